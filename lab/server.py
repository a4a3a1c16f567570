"""A real server as a child process on one of the lab's hosts."""

from __future__ import annotations

import subprocess
import time
from collections.abc import Callable
from pathlib import Path

from lab import messages, network
from lab.clock import fast_clock
from lab.support import LabError, last_lines, wait_until

# The log socket is the device's; a server on another host must not write to it.
_NO_SYSLOG = ("sh", "-c", f'mount -t tmpfs no-syslog {messages.FOLDER} && exec "$@"', "sh")


class Server:
    """One server process; its output goes to `log`. Its time runs `clock` times as fast.

    A restarted server's clock continues from where it would have been.
    """

    def __init__(self, name: str, host: str, argv: list[str], log: Path, clock: int = 1) -> None:
        self.name = name
        self.log = log
        self._host = host
        self._argv = argv
        self._clock = clock
        self._made = time.monotonic()
        self._process: subprocess.Popen[bytes] | None = None

    def start(self, answers: Callable[[], object], seconds: float = 15) -> None:
        """Start the process and wait until `answers` holds; LabError with its log if never."""
        self.log.parent.mkdir(parents=True, exist_ok=True)
        ahead = (time.monotonic() - self._made) * (self._clock - 1)
        with self.log.open("ab") as log:
            self._process = subprocess.Popen(network.command(self._host, *_NO_SYSLOG, "env",
                                                             *fast_clock(self._clock, ahead),
                                                             *self._argv),
                                             stdin=subprocess.DEVNULL, stdout=log, stderr=log)
        try:
            wait_until(lambda: self._ended() or answers(), f"{self.name} to answer", seconds)
        except LabError as late:
            raise LabError(f"{late}\n{self.name}, end of its log:\n"
                           f"{last_lines(self.log)}") from None
        if self._ended():
            raise LabError(f"{self.name} ended with status {self._process.returncode} "
                           f"before it answered; end of its log:\n{last_lines(self.log)}")

    def stop(self) -> None:
        """Terminate the process and wait for its end."""
        assert self._process is not None
        self._process.terminate()
        self._process.wait(10)

    @property
    def running(self) -> bool:
        """True between start and end of the process."""
        return self._process is not None and not self._ended()

    def send_signal(self, number: int) -> None:
        """Send a signal to the process."""
        assert self._process is not None
        self._process.send_signal(number)

    def state(self) -> str:
        """One line for a failure report."""
        if self._process is None:
            return f"{self.name}: not started"
        return f"{self.name}: {'ended' if self._ended() else 'running'}"

    def _ended(self) -> bool:
        return self._process is not None and self._process.poll() is not None
