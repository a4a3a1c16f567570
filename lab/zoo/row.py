"""One behaviour of a home gateway, and what the daemon is expected to make of it."""

from __future__ import annotations

from collections.abc import Callable, Mapping
from dataclasses import dataclass, field

from lab.checks import BOTH_MAPPED
from lab.gateway import GatewaySetup
from lab.packet_filter import Mapping as Forwarding
from lab.scenario import Lab

# Times at the gateway are real; the daemon lives ten times as fast, its time limits included.
CLOCK = 10
SHORT_PAUSES = 6
CYCLES = 4

REACHED, RELAYED, FAILED = "portforwarded", "relayed", "failed"
# By outcome: seconds to the first of it, and requests to the gateway in all cycles.
_USUAL = {REACHED: (15, 50), RELAYED: (40, 30), FAILED: (0, 30)}

# What the log says when the gateway is not used, and why.
NO_ANSWER = "upnp_discover - UPnP Discover failed to return any response"
NO_GATEWAY = "upnp_discover - invalid device type"
NO_ADDRESS = "upnp_discover - failed to get External IP address"
NO_MAPPING = "Router::mapPort() - fail - failed to map external port"
NO_NATPMP = "Router::natpmp_discover - failed to get External IP address"
NOT_USED = "createDirectConnection - failed to get connection to local router"
OTHER_ADDRESS = "testPort - Enforce connection as RELAY (double-NAT detected"
TEST_FAILED = "testPort - port map check failed"

# What the owner can do.
NOTHING = "nothing: it works"
PERMANENT = "nothing: the device asks for permanent mappings only"
BY_HAND = "forward two ports by hand and enter them in the settings"
ASK_PROVIDER = "ask the provider for a public address"
LEFT_BEHIND = tuple(BOTH_MAPPED)


@dataclass(frozen=True)
class Row:
    """One behaviour. `gateway` names only what differs from a good gateway.

    After four cycles the device has the status `outcome`, and the log has a line with `why`. It is
    first reachable within `seconds`, a cycle takes at most `longest` seconds without its pause, and
    the gateway gets at most `requests` requests before SIGTERM; 0 stands for what is usual with the
    outcome. All are seconds of the device. What is in `left` stays at the gateway after SIGTERM.
    What is in `between` happens in the pause after the cycle of that number; 0 is before the first.

    `played` tells after the last cycle if the device has met the behaviour; the lab's own servers
    know it themselves. Unless `https`, only HTTP comes through the gateway by then. `cause` is what
    the doctor must name first by then, if it is asked.
    """

    name: str
    title: str
    gateway: GatewaySetup
    advice: str
    outcome: str = REACHED
    why: str = ""
    seconds: int = 0
    longest: int = 60
    requests: int = 0
    left: tuple[Forwarding, ...] = ()
    between: Mapping[int, Callable[[Lab], None]] = field(default_factory=dict)
    played: Callable[[Lab], bool] | None = None
    https: bool = True
    cause: str = ""

    @property
    def within(self) -> int:
        """The seconds until the device must be reachable."""
        return self.seconds or _USUAL[self.outcome][0]

    @property
    def most_requests(self) -> int:
        """The requests that the gateway may get."""
        return self.requests or _USUAL[self.outcome][1]
