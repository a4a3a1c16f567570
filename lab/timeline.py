"""What happened in a run, in order, told by everybody who took part."""

from __future__ import annotations

import re
import threading
import time
from collections.abc import Callable
from dataclasses import dataclass

# What the device's log tells about things that no other part of the lab sees: a line, the words
# for it, and for a state that is repeated in every cycle its subject, so that only news is told.
_TOLD_BY_LOG = tuple((re.compile(line), words, subject) for line, words, subject in (
    (r"Router::upnp_discover - IGD found at: ([^,]+),", "gateway found through UPnP: {}", "UPnP"),
    (r"Router::upnp_discover - UPnP Discover failed", "no gateway answers UPnP", "UPnP"),
    (r"CMnatpmp::retrieveExternalIP  fetched", "gateway found through NAT-PMP", "NAT-PMP"),
    (r"Router's external IP address: (\S+)", "external address: {}", "address"),
    (r"testPort - port map check success", "port test passed", None),
    (r"testPort - port map check failed", "port test failed", None),
    (r"Enforce connection as RELAY", "port test shows a second NAT", None),
    (r"openVPN has started successfully", "tunnel is up", None),
    (r"closeVPNConnection\(\) - attempting to", "tunnel is told to stop", None),
    (r"checkDNS - DNS matches local value", "public names point to the right address", None),
))


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
        self._last_told: dict[str, str] = {}

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

    def read_log(self, line: str) -> None:
        """Note what a line of the device's log tells, unless it is no news."""
        for pattern, words, subject in _TOLD_BY_LOG:
            found = pattern.search(line)
            if not found:
                continue
            news = words.format(*found.groups())
            if subject is None or self._last_told.get(subject) != news:
                self.add("device", news)
            if subject is not None:
                self._last_told[subject] = news

    def __str__(self) -> str:
        with self._lock:
            return "\n".join(str(event) for event in self._events) or "(nothing happened)"
