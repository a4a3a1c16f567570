"""A situation, stated in a few words, and the lab raised to play it."""

from __future__ import annotations

import socket
from collections.abc import Callable, Mapping
from dataclasses import dataclass, field
from pathlib import Path

from lab import daemon, network
from lab.account import Account
from lab.central import CentralService
from lab.certificates import Authority
from lab.daemon import Daemon
from lab.device import Device
from lab.gateway import Gateway, GatewaySetup
from lab.names import Names
from lab.relay import Relay
from lab.support import LabError, Seen, last_lines, wait_until
from lab.timeline import Timeline

_FOLDER = Path("/run/lab")
_LOG_LINES = 150


@dataclass(frozen=True)
class Situation:
    """What is special about a run; everything else is as usual.

    `static` and `dynamic` are settings of the device's two files; `clock` makes the device's time
    run faster by that factor.
    """

    gateway: GatewaySetup = GatewaySetup()
    relay: bool = False
    static: Mapping[str, str] = field(default_factory=dict)
    dynamic: Mapping[str, str] = field(default_factory=dict)
    clock: int = 1


class Lab:
    """The raised network with everything in it. It lives as long as its sandbox, one per run."""

    def __init__(self, situation: Situation, timeline: Timeline) -> None:
        self.situation = situation
        self.timeline = timeline
        self.account = Account()
        self.daemon: Daemon | None = None
        socket.sethostname(self.account.host_name)
        network.raise_home_network()
        authority = Authority(_FOLDER / "authority")
        self.names = Names(_FOLDER / "names")
        self.central = CentralService(self.account, authority, self.names, timeline)
        self.gateway = Gateway(_FOLDER / "gateway", situation.gateway, timeline)
        self.relay = Relay(_FOLDER / "relay", self.account, authority)
        self.device = Device(self.account, authority, timeline)
        self.device.messages.listen(lambda message: timeline.read_log(message.text))
        self._start()

    def _start(self) -> None:
        """Start what answers first, so that each can be asked from where its clients are."""
        self.device.messages.start()
        self.names.start()
        self.gateway.start()
        self.central.start()
        if self.situation.relay:
            self.relay.start()
        self.device.start(self.situation.static, self.situation.dynamic)

    def start_daemon(self, *options: str) -> Daemon:
        """Run the daemon on the device."""
        self.timeline.add("device", f"pelorus starts with {' '.join(options)}")
        self.daemon = Daemon(options, self.situation.clock)
        return self.daemon

    def stop_daemon(self) -> str:
        """Send SIGTERM and return how the daemon ended."""
        assert self.daemon is not None
        self.timeline.add("device", "pelorus gets SIGTERM")
        how = self.daemon.stop()
        self.timeline.add("device", f"pelorus ended by {how}")
        return how

    def wait_for(self, condition: Callable[[], Seen], what: str, seconds: float) -> Seen:
        """Wait for a state while the daemon runs; its death ends the waiting at once."""

        def seen() -> Seen:
            if self.daemon and self.daemon.ended():
                raise LabError(f"the daemon ended ({self.daemon.ended()}) before {what}")
            return condition()

        return wait_until(seen, what, seconds)

    def report(self) -> str:
        """Everything one needs to see when a run went wrong."""
        sections = {
            "timeline": str(self.timeline),
            f"device log, last {_LOG_LINES} lines":
                "\n".join(str(message) for message in self.device.messages.all[-_LOG_LINES:]),
            "daemon": f"{self.daemon.ended() or 'running' if self.daemon else 'not started'}, "
                      f"output:\n{last_lines(daemon.OUTPUT)}",
            "servers": "\n".join(server.state() for server in (
                self.names.server, self.gateway.server, self.relay.server)),
            "gateway forwards": "\n".join(map(str, self.gateway.mappings())),
            "central service": self.central.state(),
            "local back end": "\n".join(request.url for request in self.device.local_requests),
            "tunnel client": last_lines(self.device.tunnel_output()),
        }
        return "\n".join(f"--- {title}\n{text}" for title, text in sections.items())
