"""The device's system log: everything that is sent to /dev/log, kept with its priority."""

from __future__ import annotations

import re
import socket
import threading
import time
from collections.abc import Callable
from dataclasses import dataclass
from pathlib import Path

_LOG_SOCKET = "/dev/log"
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
    """Receives and keeps the log; `file` holds the same lines for a human reader."""

    def __init__(self, file: Path) -> None:
        self.file = file
        self.all: list[Message] = []
        self._listeners: list[Callable[[Message], None]] = []

    def start(self) -> None:
        """Open the log socket of this machine's programs."""
        receiver = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        receiver.bind(_LOG_SOCKET)
        Path(_LOG_SOCKET).chmod(0o666)
        self.file.parent.mkdir(parents=True, exist_ok=True)
        self.file.touch()
        threading.Thread(target=self._receive, args=(receiver,), daemon=True).start()

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
        with self.file.open("a", errors="replace", buffering=1) as file:
            while True:
                datagram = receiver.recv(65536).rstrip(b"\n\0").decode(errors="replace")
                parts = _DATAGRAM.match(datagram)
                if parts:
                    priority = int(parts[1])
                    message = Message(priority >> 3, priority & 7, parts[2], parts[3],
                                      time.monotonic())
                else:
                    message = Message(0, 7, "(unreadable)", datagram, time.monotonic())
                self.all.append(message)
                file.write(f"{message}\n")
                for listener in self._listeners:
                    listener(message)
