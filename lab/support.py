"""What every part of the lab uses: waiting for a state, running a tool, failing with evidence."""

from __future__ import annotations

import subprocess
import time
from collections.abc import Callable
from pathlib import Path
from typing import TypeVar

Seen = TypeVar("Seen")


class LabError(Exception):
    """Something in the lab is not as it must be; the text says what and shows the evidence."""


def wait_until(condition: Callable[[], Seen], what: str, seconds: float,
               pause: float = 0.05) -> Seen:
    """Ask `condition` until it holds and return what it gave; the last answer is told if never."""
    deadline = time.monotonic() + seconds
    while True:
        seen = condition()
        if seen:
            return seen
        if time.monotonic() > deadline:
            raise LabError(f"waited {seconds:g} s in vain for {what}; last seen: {seen!r}")
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
