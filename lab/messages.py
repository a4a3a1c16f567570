"""The device's system log: everything sent to /dev/log, with its priority."""

from __future__ import annotations

import contextlib
import re
import select
import socket
import threading
import time
from collections.abc import Callable
from dataclasses import dataclass
from datetime import datetime
from pathlib import Path

# A folder of its own, which servers on other hosts do not see.
FOLDER = Path("/run/syslog")
_LOG_SOCKET = FOLDER / "socket"
_LINK = Path("/dev/log")
_LOOK_SECONDS = 0.2
_DEFAULT_SEVERITY = 5
_DATAGRAM = re.compile(r"<(\d+)>(?:\w{3} [ \d]\d [\d:]{8} )?([^:\[]+)(?:\[\d+\])?: ?(.*)", re.S)
_SEVERITIES = ("emerg", "alert", "crit", "err", "warning", "notice", "info", "debug")


@dataclass(frozen=True)
class Message:
    """One line of the log; facility and severity are the syslog numbers, `when` is monotonic."""

    facility: int
    severity: int
    ident: str
    text: str
    when: float

    def __str__(self) -> str:
        return f"{_SEVERITIES[self.severity]:<7} {self.ident}: {self.text}"


class Messages:
    """Receives and keeps the log; `file` holds the same lines for a human reader.

    `syslog` holds them as a log daemon writes them, with the machine's time, and `default_syslog`
    those of them that a daemon logs without an option for more.

    A reader gets every line sent before its call, however busy the receiving thread is.
    """

    def __init__(self, file: Path) -> None:
        self.file = file
        self.syslog = file.with_name("syslog")
        self.default_syslog = file.with_name("syslog.default")
        self._kept: list[Message] = []
        self._listeners: list[Callable[[Message], None]] = []
        self._lock = threading.Lock()
        self._receiver: socket.socket | None = None

    def start(self) -> None:
        """Open the log socket."""
        receiver = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        FOLDER.mkdir(exist_ok=True)
        receiver.bind(str(_LOG_SOCKET))
        _LOG_SOCKET.chmod(0o666)
        if not _LINK.is_symlink():
            _LINK.symlink_to(_LOG_SOCKET)
        self.file.parent.mkdir(parents=True, exist_ok=True)
        self.file.touch()
        self.syslog.touch()
        self.default_syslog.touch()
        self._receiver = receiver
        threading.Thread(target=self._receive, args=(receiver,), daemon=True).start()

    def stop(self) -> None:
        """Remove the log socket: what is sent until the next start is lost."""
        self.take_waiting()
        with self._lock:
            assert self._receiver is not None
            self._receiver.close()
            self._receiver = None
            _LOG_SOCKET.unlink()

    @property
    def all(self) -> list[Message]:
        """The lines so far, in order."""
        self.take_waiting()
        return list(self._kept)

    def listen(self, listener: Callable[[Message], None]) -> None:
        """Call `listener` with every message from now on."""
        self._listeners.append(listener)

    def texts(self) -> list[str]:
        """The lines without priority and ident, in order."""
        return [message.text for message in self.all]

    def count(self, part: str) -> int:
        """How many lines contain `part`."""
        return sum(part in text for text in self.texts())

    def _receive(self, receiver: socket.socket) -> None:
        while self._receiver is receiver:
            with contextlib.suppress(OSError, ValueError):  # closed meanwhile
                select.select([receiver], [], [], _LOOK_SECONDS)
            self.take_waiting()

    def take_waiting(self) -> None:
        """Store the lines waiting in the socket."""
        with self._lock, self.file.open("a", errors="replace") as file, \
                self.syslog.open("a", errors="replace") as syslog, \
                self.default_syslog.open("a", errors="replace") as default_syslog:
            while self._receiver:
                try:
                    datagram = self._receiver.recv(65536, socket.MSG_DONTWAIT)
                except BlockingIOError:
                    return
                message = _read(datagram.rstrip(b"\n\0").decode(errors="replace"))
                self._kept.append(message)
                file.write(f"{message}\n")
                stamp = datetime.now().astimezone().isoformat(timespec="milliseconds")
                text = message.text.replace("\n", "#012")
                line = f"{stamp} {socket.gethostname()} {message.ident}: {text}\n"
                syslog.write(line)
                if message.severity <= _DEFAULT_SEVERITY:
                    default_syslog.write(line)
                for listener in self._listeners:
                    listener(message)


def _read(datagram: str) -> Message:
    """Parse a datagram that has just been received."""
    parts = _DATAGRAM.match(datagram)
    if not parts:
        return Message(0, 7, "(unreadable)", datagram, time.monotonic())
    priority = int(parts[1])
    return Message(priority >> 3, priority & 7, parts[2], parts[3], time.monotonic())
