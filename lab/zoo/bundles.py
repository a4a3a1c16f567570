"""Several behaviours together, as they come in life."""

from __future__ import annotations

from lab.gateway import GatewaySetup
from lab.scripted_gateway import Personality
from lab.zoo.discovery import COPIES, SETUP_DEVICE, access_point
from lab.zoo.events import (all_of, fall_silent, go_deaf, go_offline, go_online, reboot,
                            reload_firewall, restart)
from lab.zoo.mapping import silently_full
from lab.zoo.row import (ASK_PROVIDER, CLOCK, NO_ADDRESS, NOTHING, OTHER_ADDRESS, RELAYED,
                         TEST_FAILED, Row)

# Lookups that nobody answers take real time, ten times as long for the device.
_WITHOUT_NAMES = 1300

ROWS = (
    Row("power-cut", "Silence, then no internet address yet, then back without mappings, at "
        "another port (T1, A2, N1, H1, N12)", GatewaySetup(natpmp=True), NOTHING,
        why=NO_ADDRESS, longest=_WITHOUT_NAMES, requests=65,
        between={1: all_of(go_offline, fall_silent), 2: reboot, 3: go_online}),
    Row("two-routers", "An own router behind the provider's box, and an access point that answers "
        "as a gateway (D10, A3)",
        GatewaySetup(others=(access_point("192.168.1.2"),)), ASK_PROVIDER, RELAYED,
        OTHER_ADDRESS, requests=80, cause="wrong-gateway-answers",
        between={0: lambda lab: lab.provider.insert("100.64.3.4")}),
    Row("old-router", "Slow, accepts only permanent mappings, forgets leases, and has no room, "
        "which it does not say (P13, T2, P1, H13)",
        GatewaySetup(personality=Personality(control=silently_full(1), delay=4 / CLOCK)),
        "delete mappings on the router", RELAYED, TEST_FAILED, longest=430, seconds=430,
        requests=200, between={1: restart}),
    Row("firewall-reload", "Reloads its firewall time and again: lists mappings, forwards none "
        "(P15)", GatewaySetup(), NOTHING, why=TEST_FAILED, requests=70,
        between={1: reload_firewall, 2: reload_firewall}),
    Row("mesh", "A setup device and an access point answer as well, answers are repeated without "
        "end, then nobody hears searches any more (D9, D10, D5, D11)",
        GatewaySetup(personality=COPIES,
                     others=(SETUP_DEVICE, access_point("44.128.0.99"))),
        "switch off UPnP on the access points", RELAYED, OTHER_ADDRESS, seconds=100,
        requests=50, between={2: go_deaf}),
)
