"""Time that runs faster for a program than for the lab around it."""

from __future__ import annotations

import glob
from pathlib import Path

from lab import sandbox
from lab.support import LabError, run_tool

_PRELOAD = Path("/run/lab/preload.so")
_REFUSED_SIGNAL = Path("/run/lab/refused_signal")
_SIGNAL_IN_GMTIME = Path("/run/lab/signal_in_gmtime")


def fast_clock(factor: int, ahead: float = 0) -> list[str]:
    """Environment in which a program's time runs `factor` times as fast, `ahead` seconds ahead."""
    return _faketime(factor, ahead) if factor != 1 else []


def fast_pauses(factor: int, hasty: bool, divisor: int = 1) -> list[str]:
    """`fast_clock` for a program that talks to real servers and must give them time to answer.

    The time limit of its transfers stays real time unless `hasty`: libcurl measures it by the
    monotonic clock. Its pauses take only a `divisor`th, and its clock jumps over the rest.
    """
    if factor == 1:
        return []
    if not _PRELOAD.exists():
        # Not in /tmp, which may be full.
        run_tool("env", f"TMPDIR={_PRELOAD.parent}", "cc", "-shared", "-fPIC",
                 f'-DREFUSED_SIGNAL="{_REFUSED_SIGNAL}"',
                 f'-DSIGNAL_IN_GMTIME="{_SIGNAL_IN_GMTIME}"',
                 "-o", str(_PRELOAD), str(sandbox.PROJECT / "lab/preload.c"))
    return [*_faketime(factor, 0, str(_PRELOAD)),
            f"FAKETIME_DONT_FAKE_MONOTONIC={0 if hasty else 1}", f"SHORT_PAUSES={divisor}"]


def at(ahead: float, factor: int = 1) -> list[str]:
    """Environment in which a program's time is `ahead` seconds ahead, or behind if negative.

    It runs `factor` times as fast from there.
    """
    return _faketime(factor, ahead)


def refuse_signal(number: int) -> None:
    """Make programs with fast pauses fail to send this signal from now on; 0 for none."""
    _REFUSED_SIGNAL.write_text(f"{number}\n")


def signal_in_gmtime() -> None:
    """Make the next program with fast pauses that breaks a time down receive SIGTERM meanwhile."""
    _SIGNAL_IN_GMTIME.touch()


def _faketime(factor: int, ahead: float, *before: str) -> list[str]:
    libraries = glob.glob("/usr/lib/*/faketime/libfaketimeMT.so.1")
    if not libraries:
        raise LabError("libfaketime is not installed")
    return [f"LD_PRELOAD={' '.join((*before, libraries[0]))}",
            f"FAKETIME={int(ahead):+d} x{factor}"]
