"""The doctor beside the daemon on the device: runs it and reads what it says."""

from __future__ import annotations

import json
import os
import subprocess
import sys
from collections.abc import Sequence
from dataclasses import dataclass
from pathlib import Path
from typing import Any

from lab import clock, device, network, sandbox
from lab.messages import Messages
from lab.support import LabError

_PATIENCE = 30
_HASTE = 2
_ANSWERS = range(4)


@dataclass(frozen=True)
class Diagnosis:
    """What the doctor says, as it says it to other programs."""

    everything: dict[str, Any]
    status: int

    @property
    def cause(self) -> str:
        """The cause that it names first; empty when it names none."""
        causes = self.everything["causes"]
        return str(causes[0]["name"]) if causes else ""

    @property
    def fact(self) -> str:
        """The first fact that proves it; empty without a cause."""
        causes = self.everything["causes"]
        return str(causes[0]["facts"][0]["text"]) if causes else ""

    def checks(self, verdict: str) -> list[str]:
        """The lines about what was checked, with this verdict ("ok", "problem", "not-seen")."""
        return [str(check["text"]) for check in self.everything["checks"]
                if check["verdict"] == verdict]

    def __str__(self) -> str:
        return json.dumps(self.everything, indent=1)


def examine(messages: Messages, *options: str, ahead: float = 0, log: Path | None = None,
            static_file: Path = device.STATIC_FILE, through: Sequence[str] = ()) -> Diagnosis:
    """Let the doctor conclude from everything it may look at; see `run`."""
    done = run(messages, "--json", *options, ahead=ahead, log=log, static_file=static_file,
               through=through)
    try:
        return Diagnosis(json.loads(done.stdout), done.returncode)
    except ValueError as error:
        raise LabError(f"the doctor ended with {done.returncode} and said {done.stdout!r}, "
                       f"{done.stderr!r}") from error


def run(messages: Messages, *options: str, ahead: float = 0, log: Path | None = None,
        static_file: Path = device.STATIC_FILE,
        through: Sequence[str] = ()) -> subprocess.CompletedProcess[str]:
    """Run it on the device with these options, over the log so far.

    Its clock begins with the machine's, or `ahead` seconds ahead of it, and runs so fast that it
    waits less for what does not answer. It reads the whole log, or the file `log`. It is started by
    the command `through`, if any.
    """
    messages.take_waiting()
    environment = [f"PATH={device.PATH}", f"TAVIK_STATIC_CONFIG={static_file}",
                   *clock.at(ahead, _HASTE)]
    return subprocess.run(
        network.command(network.DEVICE, "env", "-i", *environment, *through,
                        str(sandbox.doctor()), "--log", str(log or messages.syslog), *options),
        stdin=subprocess.DEVNULL, capture_output=True, text=True, timeout=_PATIENCE, check=False)


def show(messages: Messages, ahead: float = 0) -> None:
    """Have it print its note here, as wide and as coloured as the terminal is."""
    messages.take_waiting()
    terminal = [f"{name}={os.environ[name]}" for name in ("NO_COLOR", "TERM") if name in os.environ]
    environment = [f"PATH={device.PATH}", f"TAVIK_STATIC_CONFIG={device.STATIC_FILE}", *terminal,
                   *(clock.at(ahead) if ahead else ())]
    sys.stdout.flush()
    done = subprocess.run(
        network.command(network.DEVICE, "env", "-i", *environment, str(sandbox.doctor()),
                        "--log", str(messages.syslog)),
        stdin=subprocess.DEVNULL, timeout=_PATIENCE, check=False)
    if done.returncode not in _ANSWERS:
        raise LabError(f"the doctor ended with {done.returncode}")
