"""Helpers for every part of the lab: wait for a state, run a tool, fail with evidence."""

from __future__ import annotations

import subprocess
import time
from collections.abc import Callable
from pathlib import Path
from typing import TypeVar

Seen = TypeVar("Seen")


class LabError(Exception):
    """The lab or the daemon in it failed; the text says how and shows the evidence."""


def wait_until(condition: Callable[[], Seen], what: str, seconds: float,
               pause: float = 0.05) -> Seen:
    """Poll `condition` until it holds and return its value; LabError with the last if never."""
    deadline = time.monotonic() + seconds
    while True:
        seen = condition()
        if seen:
            return seen
        if time.monotonic() > deadline:
            raise LabError(f"waited {seconds:g} s for {what}; last seen: {seen!r}")
        time.sleep(pause)


def run_tool(*argv: str, text: str = "") -> None:
    """Run a short command that must succeed, with `text` on its standard input."""
    done = subprocess.run(argv, input=text, capture_output=True, text=True, check=False)
    if done.returncode != 0:
        raise LabError(f"{' '.join(argv)} failed: {done.stderr.strip() or done.stdout.strip()}")


def last_lines(path: Path, count: int = 15) -> str:
    """The end of a log file, indented, for a failure message."""
    if not path.exists():
        return "  (no log)"
    lines = path.read_text(errors="replace").splitlines()[-count:]
    return "\n".join(f"  {line}" for line in lines) or "  (empty log)"
