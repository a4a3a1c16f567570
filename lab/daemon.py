"""The daemon under test as a running process on the device."""

from __future__ import annotations

import os
import signal
import subprocess
from collections.abc import Iterator, Sequence
from contextlib import contextmanager, suppress
from pathlib import Path

from lab import device, network, sandbox
from lab.clock import fast_pauses
from lab.support import LabError, wait_until

PID_FILE = Path("/tmp/tavik_cm_pid")
OUTPUT = device.HOME / "pelorus.out"


class Daemon:
    """One run of the daemon, from its start to its wait status."""

    def __init__(self, options: tuple[str, ...], clock: int, hasty: bool,
                 pauses: int = 1, through: Sequence[str] = ()) -> None:
        """Start it and return once it has detached; its time runs `clock` times as fast.

        The time limit of its transfers stays real time unless `hasty`, its pauses take a `pauses`th
        of their time. It is started by the command `through`, if any. Once detached it is a child
        of the sandbox's first process, which is this one.
        """
        environment = [f"PATH={device.PATH}", f"TAVIK_STATIC_CONFIG={device.STATIC_FILE}",
                       *fast_pauses(clock, hasty, pauses)]
        argv = network.command(network.DEVICE, "env", "-i", *environment,
                               *through, str(sandbox.binary()), *options)
        with OUTPUT.open("ab") as output:
            started = subprocess.run(argv, stdin=subprocess.DEVNULL, stdout=output, stderr=output,
                                     check=False)
        if started.returncode != 0:
            raise LabError(f"{argv[-1 - len(options)]} ended with status {started.returncode}: "
                           f"{OUTPUT.read_text()}")
        self.pid = wait_until(_detached, "the detached daemon", 10)
        self._status: int | None = None
        self._holders = 0

    def ended(self) -> str:
        """How the daemon ended ("SIGTERM", "exit 0"); empty while it runs."""
        if self._status is None:
            pid, status = os.waitpid(self.pid, os.WNOHANG)
            if pid == 0:
                return ""
            self._status = status
        if os.WIFSIGNALED(self._status):
            return signal.Signals(os.WTERMSIG(self._status)).name
        return f"exit {os.WEXITSTATUS(self._status)}"

    def memory(self, key: str) -> int:
        """A line of the kernel's account of the daemon, "VmRSS" or "VmHWM", in KiB."""
        lines = Path(f"/proc/{self.pid}/status").read_text().splitlines()
        return next(int(line.split()[1]) for line in lines if line.startswith(f"{key}:"))

    @contextmanager
    def held(self) -> Iterator[None]:
        """Stop it meanwhile, so that it sees several changes at once and checks see no movement.

        Its clock runs on: a pause that is over by then ends at once.
        """
        os.kill(self.pid, signal.SIGSTOP)
        self._holders += 1
        try:
            yield
        finally:
            self._holders -= 1
            if self._holders == 0:
                os.kill(self.pid, signal.SIGCONT)

    def stop(self, number: int = signal.SIGTERM) -> str:
        """Send a signal and return how the daemon ended."""
        os.kill(self.pid, number)
        return wait_until(self.ended, f"the daemon to end after signal {number}", 60)


def _detached() -> int:
    """The pid of the daemon, which may already have ended; 0 without one.

    The pid file would not do: there is none when it cannot be written.
    """
    name = f"({sandbox.binary().name})"
    for file in Path("/proc").glob("[0-9]*/stat"):
        with suppress(OSError):
            pid, command, _, parent = file.read_text().split()[:4]
            if (command, int(parent)) == (name, os.getpid()):
                return int(pid)
    return 0


def running(program: str) -> list[int]:
    """Pids of the live processes that run a program of this name."""
    found = []
    for entry in Path("/proc").iterdir():
        try:
            if entry.name.isdigit() and Path(os.readlink(entry / "exe")).name == program:
                found.append(int(entry.name))
        except OSError:
            continue  # gone, or a zombie
    return found
