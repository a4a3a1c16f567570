"""Gateways that say odd things about their connection and their external address."""

from __future__ import annotations

from lab.gateway import GatewaySetup
from lab.zoo.events import go_offline, go_online
from lab.zoo.hooks import controlled, telling
from lab.zoo.row import ASK_PROVIDER, NO_ADDRESS, NOTHING, OTHER_ADDRESS, RELAYED, Row

_CARRIER_GRADE = "100.64.3.4"


def _telling(**values: str) -> GatewaySetup:
    return controlled(telling(**values))


ROWS = (
    Row("A1", "Says that it is disconnected, but maps",
        _telling(NewConnectionStatus="Disconnected"), NOTHING),
    Row("A1b", "Says \"connected\", in lower case", _telling(NewConnectionStatus="connected"),
        NOTHING),
    Row("A2", "Has no external address yet and says so with success; later it has one",
        GatewaySetup(), NOTHING, why=NO_ADDRESS, seconds=520,
        longest=500, between={0: go_offline, 1: go_online}),
    Row("A2b", "Says for ever that its external address is 0.0.0.0",
        _telling(NewExternalIPAddress="0.0.0.0"), "correct its internet settings", RELAYED,
        OTHER_ADDRESS, requests=100, cause="gateway-hides-address"),
    Row("A3", "Has a carrier-grade private address, and tells no address",
        GatewaySetup(), ASK_PROVIDER, RELAYED, NO_ADDRESS, cause="gateway-hides-address",
        between={0: lambda lab: lab.provider.insert(_CARRIER_GRADE)}),
    Row("A3b", "Has a carrier-grade private address, tells it, and maps",
        _telling(NewExternalIPAddress=_CARRIER_GRADE), ASK_PROVIDER, RELAYED,
        OTHER_ADDRESS, requests=100,
        between={0: lambda lab: lab.provider.insert(_CARRIER_GRADE)}),
    Row("A4", "Tells a public address that is not its own",
        GatewaySetup(settings={"ext_ip": "44.128.0.99"}),
        "correct the address in its settings, or restart it", RELAYED, OTHER_ADDRESS,
        requests=100),
)
