"""What happened in a run, in order, as reported by every part of the lab."""

from __future__ import annotations

import re
import threading
import time
from collections.abc import Callable
from dataclasses import dataclass

STORY = "story"

# Events that only the device's log shows: a pattern, the text to report, and a subject if the line
# recurs in every cycle or for every port. For a subject a text is reported only when it changes; a
# row without text resets the subject.
_LOG_EVENTS = tuple((re.compile(line), text, subject) for line, text, subject in (
    (r"createConnection\(\) - Deviceid and DeviceAuth is empty",
     "credentials are missing, the daemon idles", "credentials"),
    (r"createDirectConnection - Current Status", None, "credentials"),

    (r"Router::upnp_discover - IGD found at: ([^,]+),", "gateway found through UPnP: {}", "UPnP"),
    (r"Router::upnp_discover - Unconnected IGD found at: (\S+)",
     "unconnected gateway found through UPnP: {}", "UPnP"),
    (r"Router::upnp_discover - UPnP Discover failed", "no gateway answers UPnP", "UPnP"),
    (r"CMnatpmp::retrieveExternalIP  fetched", "gateway found through NAT-PMP", "NAT-PMP"),
    (r"CMnatpmp::retrieveExternalIP  failed", "no gateway answers NAT-PMP", "NAT-PMP"),
    (r"Router's external IP address: (\S+)", "external address: {}", "address"),
    (r"due to external or local IP change: \[([1-9]\d*)\]",
     "mapping of port {} is outdated and dropped", None),
    (r"Ports are still open, remaining", "open ports are kept without a gateway", "gateway"),
    (r"Router is initialized", None, "gateway"),

    (r"Router::mapPort\(\) - fail", "gateway refuses a port", "refusal"),
    (r"already mapped to another IP: (\S+)", "gateway maps the port to {}", "other device"),
    (r"Router::mapPort\(\) - success", None, "refusal"),
    (r"Router::mapPort\(\) - success", None, "other device"),
    (r"PORTFORWARDED (\w+): mapPort returncode\[1\], internalPort\[\d+\], new externalPort\[(\d+)",
     "{} mapping renewed, port {}", None),
    (r"PORTFORWARDED (\w+): mapPort returncode\[0\], internalPort\[[1-9]",
     "{} mapping could not be renewed", None),

    (r"pollServerForSleepTime - (?:missing action|malformed|received garbage)",
     "answer to the permission request is malformed", "permission"),
    (r"central server gave permission to proceed|sleep time from server is", None, "permission"),
    (r"testPort - hard disk is asleep", "port test skipped: the disk is asleep", "no test"),
    (r"testPort - server has requested sleep", "port test skipped: the server asks to wait",
     "no test"),
    (r"(?:Ignore Port Test|Skip testing port) due to [Ii]nterval|Not time to do port test",
     "port test skipped: it is not due yet", "no test"),
    (r"testPort\[1-3\] - Port Test URL", None, "no test"),
    (r"Running port test for manually forwarded", "manually forwarded ports are tested", None),
    (r"bad value for manually configured (\w+) Port", "manual {} port is invalid", "manual port"),
    (r"manualPortForward - allocatedHttpPort", None, "manual port"),
    (r"testPort - port map check success", "port test passed", None),
    (r"testPort - port map check failed", "port test failed", None),
    (r"forwardPort - Port test failed", "candidate port is given up", None),
    (r"Enforce connection as RELAY", "port test shows a second NAT", "second NAT"),
    (r"testPort - port map check success", None, "second NAT"),

    (r"(?:no|to get) response from central server", "central service does not answer", "central"),
    (r"httpGet (?:got|Response)", None, "central"),
    (r"response (?:received )?from local(?:host| server)", "web back end does not accept it",
     "back end"),
    (r"Successful update status", None, "back end"),
    (r"failed to update (?:mapping info|port mapping)", "mapping could not be published", None),

    (r"relay servers and other settings", "tunnel client is started", None),
    (r"openVPN will not be started", "tunnel is put off: the server asks to wait", "tunnel"),
    (r"openVPN initialization did not complete", "tunnel is not up yet", "tunnel"),
    (r"openVPN has started successfully", "tunnel is up", None),
    (r"closeVPNConnection\(\) - attempting to stop", "tunnel is told to stop", None),
    (r"closeVPNConnection\(\) - attempting to SIGKILL", "tunnel is killed", None),
    (r"closeVPNConnection\(\) - (?:attempting|openVPN process is not)|relay servers and", None,
     "tunnel"),
    (r"failed to create VPN connection", "tunnel did not come up, the attempt ends", None),

    (r"checkDNS - DNS matches local value .* address is (\S+)",
     "public names point to the right address, {}", "names"),
    (r"checkDNS - DNS check failed .* address is (\S+), local value .* is (\S+)",
     "public names point to {} instead of {}", "names"),
    (r"checkDNS - nslookup 3-level", "public names do not resolve to one address", "names"),
    (r"checkDNS - failed to retrieve local value", "public names cannot be compared", "names"),
    (r"kill existing connections", "names do not match: every connection is torn down", None),
))


@dataclass(frozen=True)
class Event:
    """One event; `when` is in seconds since the lab was set up."""

    when: float
    who: str
    what: str

    def __str__(self) -> str:
        if self.who == STORY:
            return f"\n{self.when:7.2f} s  == {self.what}"
        return f"{self.when:7.2f} s  {self.who:<9}  {self.what}"


class Timeline:
    """Collects events from any thread; listeners get each as it happens."""

    def __init__(self) -> None:
        self._start = time.monotonic()
        self._last_step = self._start
        self._lock = threading.Lock()
        self._events: list[Event] = []
        self._listeners: list[Callable[[Event], None]] = []
        self._last_text: dict[str, str | None] = {}

    @property
    def events(self) -> list[Event]:
        """What has happened so far."""
        with self._lock:
            return list(self._events)

    @property
    def last_step(self) -> float:
        """When the last step began (time.monotonic()); at first when the lab was set up."""
        return self._last_step

    def listen(self, listener: Callable[[Event], None]) -> None:
        """Call `listener` with every event from now on."""
        self._listeners.append(listener)

    def add(self, who: str, what: str) -> None:
        """Record something that happened just now."""
        with self._lock:
            event = Event(time.monotonic() - self._start, who, what)
            self._events.append(event)
            for listener in self._listeners:
                listener(event)

    def step(self, text: str) -> None:
        """Begin a step; call this before the step's first action."""
        self._last_step = time.monotonic()
        self.add(STORY, text)

    def read_log(self, line: str) -> None:
        """Record what a line of the device's log shows, unless it is a repetition."""
        for pattern, text, subject in _LOG_EVENTS:
            found = pattern.search(line)
            if not found:
                continue
            shown = text and text.format(*found.groups())
            if shown and (subject is None or self._last_text.get(subject) != shown):
                self.add("device", shown)
            if subject is not None:
                self._last_text[subject] = shown

    def __str__(self) -> str:
        return "\n".join(map(str, self.events)) or "(nothing happened)"
