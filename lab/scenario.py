"""A situation, stated in a few words, and the lab set up for it."""

from __future__ import annotations

import signal
import socket
from collections.abc import Callable, Mapping, Sequence
from concurrent.futures import ThreadPoolExecutor
from contextlib import AbstractContextManager, nullcontext
from dataclasses import dataclass, field
from pathlib import Path

from lab import daemon, doctor, network
from lab.account import Account
from lab.central import CentralService
from lab.certificates import Authority
from lab.daemon import Daemon
from lab.device import STATIC_FILE, Device
from lab.gateway import Gateway, GatewaySetup
from lab.names import Names
from lab.neighbour import Neighbour
from lab.own_router import OwnRouter
from lab.provider import Provider
from lab.relay import Relay
from lab.support import LabError, Seen, last_lines, wait_until
from lab.timeline import Timeline

_FOLDER = Path("/run/lab")
_LOG_LINES = 150


@dataclass(frozen=True)
class Situation:
    """How a run differs from the default.

    `static` and `dynamic` are settings of the device's two files. The device's time runs `clock`
    times as fast, with `hasty` also the time limit of its transfers. Its pauses take only a
    `pauses`th of that, and its clock jumps over the rest. With `own_router` the device is itself
    the home router.
    """

    gateway: GatewaySetup = GatewaySetup()
    relay: bool = False
    static: Mapping[str, str] = field(default_factory=dict)
    dynamic: Mapping[str, str] = field(default_factory=dict)
    clock: int = 1
    hasty: bool = False
    pauses: int = 1
    own_router: bool = False


@dataclass(frozen=True)
class Moment:
    """A moment in which the doctor was asked: what was special, what it named first, and why."""

    what: str
    cause: str
    fact: str


class Lab:
    """The network with everything in it; there is one per sandbox, and it ends with it."""

    def __init__(self, situation: Situation, timeline: Timeline) -> None:
        self.situation = situation
        self.timeline = timeline
        self.account = Account()
        self._daemon: Daemon | None = None
        self._visitor: Callable[[str, float], None] | None = None
        self._visits_first_stop = False
        self.asks_doctor = False  # in each telling moment
        self.moments: list[Moment] = []  # in which it was
        self._told = False
        socket.sethostname(self.account.host_name)
        network.raise_home_network(situation.own_router)
        authority = Authority(_FOLDER / "authority")
        self.names = Names(_FOLDER / "names", timeline)
        self.central = CentralService(self.account, authority, self.names, timeline)
        self.gateway = Gateway(_FOLDER / "gateway", situation.gateway, timeline,
                               situation.clock)
        self.neighbour = Neighbour(self.gateway, timeline)
        self.provider = Provider(self.gateway, timeline)
        self.own_router = OwnRouter(timeline)
        self.relay = Relay(_FOLDER / "relay", self.account, authority)
        self.device = Device(self.account, authority, timeline)
        self.device.messages.listen(lambda message: timeline.read_log(message.text))
        self._start()

    def _start(self) -> None:
        """Start servers before their clients, so that each can be checked from a client's host."""
        self.device.messages.start()
        self.names.start()
        self.gateway.start()
        self.central.start()
        if self.situation.relay:
            self.relay.start()
        if self.situation.own_router:
            self.own_router.start(network.GATEWAY_WAN_ADDRESS, network.DEVICE_ADDRESS)
        self.device.start(self.situation.static, self.situation.dynamic)

    def start_daemon(self, *options: str, through: Sequence[str] = ()) -> Daemon:
        """Run the daemon on the device, by the command `through` if one is given."""
        self.timeline.add("device", f"pelorus starts with {' '.join(options)}")
        self._daemon = Daemon(options, self.situation.clock, self.situation.hasty,
                              self.situation.pauses, through)
        return self._daemon

    @property
    def daemon(self) -> Daemon:
        """The daemon that was started last; LabError before the first start."""
        if self._daemon is None:
            raise LabError("no daemon was started")
        return self._daemon

    def step(self, heading: str) -> None:
        """Begin the next step; a failure report shows the device's log from here on."""
        self.timeline.step(heading)

    def visit_by(self, visitor: Callable[[str, float], None], first_stop: bool) -> None:
        """Call `visitor` in each telling moment, with what is special in it.

        Its other argument: how many seconds the device's clock is ahead.

        With `first_stop` the moment before the daemon is first stopped is one, with no text.
        """
        self._visitor, self._visits_first_stop = visitor, first_stop

    def visit(self, what: str, ahead: float = 0) -> None:
        """Like `moment`, where the story has no time for the doctor."""
        if self._visitor:
            self._visitor(what, ahead)

    def moment(self, what: str, cause: str = "", ahead: float = 0, reach: str = "") -> None:
        """Tell what is special now, at a moment of the story that is worth a visit.

        The doctor must then name this cause first, or none if it is empty, and say that the device
        is reached in the way `reach`, unless that is empty. The device's clock is `ahead` seconds
        ahead. From the log that a daemon keeps by default it must conclude the same or nothing, or
        that the daemon is at work.
        """
        self._told = True
        self.visit(what, ahead)
        if not self.asks_doctor:
            return
        whole, usual = self._diagnoses(ahead)
        assert whole.cause == cause, f"the doctor says\n{whole}"
        assert reach in {"", whole.everything["reach"]}, f"the doctor says\n{whole}"
        assert usual.cause in {cause, "", "settling"}, (
            f"from the log of a default daemon the doctor says\n{usual}")
        self.moments.append(Moment(what, cause, whole.fact))

    def moment_follows(self) -> None:
        """The doctor is not asked before the daemon is first stopped, but at a later moment."""
        if self._visits_first_stop and not self._told:
            self.visit("")
        self._told = True

    def _diagnoses(self, ahead: float) -> tuple[doctor.Diagnosis, doctor.Diagnosis]:
        """With the whole log, and with the one of a daemon without `-l`."""
        with self._held(), ThreadPoolExecutor() as pool:
            usual = pool.submit(self._examine, (), ahead, self.device.messages.default_syslog)
            return self._examine((), ahead), usual.result()

    def diagnosis(self, *options: str, ahead: float = 0,
                  through: Sequence[str] = ()) -> doctor.Diagnosis:
        """What the doctor, started by the command `through` if any, concludes now.

        The daemon is held meanwhile. No secret of the device may be in it.
        """
        with self._held():
            return self._examine(options, ahead, through=through)

    def default_log_says(self) -> doctor.Diagnosis:
        """What the doctor concludes elsewhere, from no more than the log of a default daemon."""
        return self._examine(("--no-probes",), 0, self.device.messages.default_syslog,
                             static_file=Path("/nonexistent"))

    def _examine(self, options: Sequence[str], ahead: float,
                 log: Path | None = None,
                 static_file: Path = STATIC_FILE,
                 through: Sequence[str] = ()) -> doctor.Diagnosis:
        diagnosis = doctor.examine(self.device.messages, *options, ahead=ahead, log=log,
                                   static_file=static_file, through=through)
        for secret in self.account.secrets:
            assert secret not in str(diagnosis), diagnosis
        return diagnosis

    def _held(self) -> AbstractContextManager[None]:
        runs = self._daemon is not None and not self._daemon.ended()
        return self.daemon.held() if runs else nullcontext()

    def stop_daemon(self, number: int = signal.SIGTERM) -> str:
        """Send a signal that ends the daemon and return how it ended."""
        if not self._told and (self._visits_first_stop or self.asks_doctor):
            self.moment("")
        self.timeline.add("device", f"pelorus receives {signal.Signals(number).name}")
        how = self.daemon.stop(number)
        self.timeline.add("device", f"pelorus ended with {how}")
        return how

    def wait_for(self, condition: Callable[[], Seen], what: str, seconds: float) -> Seen:
        """Wait for a state; LabError at once if the daemon ends meanwhile."""

        def seen() -> Seen:
            if self._daemon and self._daemon.ended():
                raise LabError(f"the daemon ended ({self._daemon.ended()}) before {what}")
            return condition()

        return wait_until(seen, what, seconds)

    def report(self) -> str:
        """Everything needed to see why a run failed."""
        log = [str(message) for message in self.device.messages.all
               if message.when >= self.timeline.last_step]
        sections = {
            "timeline": str(self.timeline),
            f"device log of the last step, {min(len(log), _LOG_LINES)} of {len(log)} lines":
                "\n".join(log[-_LOG_LINES:]),
            "daemon": f"{self._daemon.ended() or 'running' if self._daemon else 'not started'}, "
                      f"output:\n{last_lines(daemon.OUTPUT)}",
            "servers": "\n".join(server.state() for server in (
                self.names.server, self.gateway.server, self.relay.server)),
            "gateway forwards": "\n".join(map(str, self.gateway.mappings())),
            "gateway forwards by hand": "\n".join(map(str, self.gateway.by_hand())),
            "central service": self.central.state(),
            "local back end": "\n".join(request.url for request in self.device.local_requests),
            "tunnel client": last_lines(self.device.tunnel_output()),
        }
        if self.situation.own_router:
            sections["the device's own router"] = "\n".join(
                [*map(str, self.own_router.mappings()), *self.own_router.calls()])
        return "\n".join(f"--- {title}\n{text}" for title, text in sections.items())
