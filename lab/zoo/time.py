"""Gateways that forget, restart and clean up."""

from __future__ import annotations

from lab.gateway import GatewaySetup
from lab.zoo.events import all_of, fall_silent, lose, reboot, restart
from lab.zoo.met import leased
from lab.zoo.row import NOTHING, TEST_FAILED, Row

_NEW_ADDRESS = "44.128.0.30"
_STILL_OPEN = "UPnP discovery failed, running port test to see if ports are still open"

ROWS = (
    Row("T1", "Restarts without mappings, at another port", GatewaySetup(), NOTHING,
        why=TEST_FAILED, between={1: reboot}),
    Row("T1b", "Answers nothing for a while, comes back without mappings, at another port",
        GatewaySetup(), NOTHING, why=_STILL_OPEN, between={1: fall_silent, 2: reboot}),
    Row("T2", "Restarts with its mappings, but has forgotten their lease",
        GatewaySetup(settings={"lease_file": "/run/lab/none/leases"}), NOTHING,
        between={1: restart}, played=leased(forever=True)),
    Row("T3", "Cleans up the rule of the HTTP port, which was idle", GatewaySetup(), NOTHING,
        why=TEST_FAILED, between={1: lose(9091)}),
    Row("T3b", "Cleans up the rule of the HTTPS port, which was idle", GatewaySetup(),
        "restart the device: only the HTTP port is tested, and HTTPS is dead until the renewal "
        "after three and a half days", between={1: lose(9444)}, https=False),
    Row("T4", "Gets another internet address and restarts its services", GatewaySetup(), NOTHING,
        requests=85, why="Router's external IP address has changed!",
        between={1: all_of(lambda lab: lab.gateway.move_to(_NEW_ADDRESS), restart)}),
)
