"""What happened in a run, in order, told by everybody who took part."""

from __future__ import annotations

import threading
import time
from collections.abc import Callable
from dataclasses import dataclass


@dataclass(frozen=True)
class Event:
    """One thing that happened, in seconds since the lab was raised."""

    when: float
    who: str
    what: str

    def __str__(self) -> str:
        return f"{self.when:7.2f} s  {self.who:<8}  {self.what}"


class Timeline:
    """Collects events from any thread; listeners get each as it happens."""

    def __init__(self) -> None:
        self._start = time.monotonic()
        self._lock = threading.Lock()
        self._events: list[Event] = []
        self._listeners: list[Callable[[Event], None]] = []

    def listen(self, listener: Callable[[Event], None]) -> None:
        """Call `listener` with every event from now on."""
        self._listeners.append(listener)

    def add(self, who: str, what: str) -> None:
        """Note that something happened just now."""
        with self._lock:
            event = Event(time.monotonic() - self._start, who, what)
            self._events.append(event)
            for listener in self._listeners:
                listener(event)

    def __str__(self) -> str:
        with self._lock:
            return "\n".join(str(event) for event in self._events) or "(nothing happened)"
