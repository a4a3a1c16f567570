"""NAT-PMP gateways that answer late: no request succeeds with the answer to another one."""

from __future__ import annotations

import re

from lab import network
from lab.central import PortTest
from lab.checks import (BOTH_MAPPED, FAST, NO_TUNNEL, OPTIONS, PAGES, assert_published,
                        assert_stops_clean, pages_from_outside, ports_tested, start, wait_for_cycle)
from lab.gateway import GatewaySetup
from lab.natpmp import Grant
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_LEASE = 600
_TRACKED = re.compile(r"set (HTTPS?) PMTracker params. internal_port (\d+), external_port (\d+)")


def _gateway(delay: float = 0, refused: frozenset[int] = frozenset()) -> GatewaySetup:
    return GatewaySetup(upnp=False, natpmp=True,
                        grant=Grant(lambda asked: asked, _LEASE, refused, delay))


@scenario(Situation(gateway=_gateway(delay=0.4, refused=frozenset({9091})), clock=FAST))
def natpmp_slow_refusal(lab: Lab) -> None:
    """A NAT-PMP gateway refuses the first port, 400 ms late: the second one is used."""
    start(lab, "portforwarded")
    assert_published(lab, 9092, 9444)
    assert lab.central.port_tests == [
        PortTest(network.GATEWAY_WAN_ADDRESS, 9092, "HTTP", lab.account.device_id)]
    assert pages_from_outside(9092, 9444) == PAGES
    assert _tracked(lab) == {("HTTP", 80, 9092), ("HTTPS", 443, 9444)}
    assert_stops_clean(lab)


@scenario(Situation(gateway=_gateway(), clock=FAST))
def natpmp_hangs_once(lab: Lab) -> None:
    """A NAT-PMP gateway hangs for two seconds at the first mapping: nothing gets mixed up."""
    lab.gateway.hang_once(2)
    start(lab, "portforwarded")
    assert lab.device.messages.count("failed to map public port") > 0, "the request that hung"
    assert_published(lab)
    assert ports_tested(lab) == [9091]
    assert pages_from_outside() == PAGES
    assert _tracked(lab) == {("HTTP", 80, 9091), ("HTTPS", 443, 9444)}
    assert lab.gateway.mappings() == BOTH_MAPPED
    assert_stops_clean(lab)


@scenario(Situation(gateway=_gateway(delay=2), static=NO_TUNNEL, clock=FAST))
def natpmp_too_slow(lab: Lab) -> None:
    """A NAT-PMP gateway becomes two seconds late for good: no answer is taken for another one."""
    lab.start_daemon(*OPTIONS)
    wait_for_cycle(lab, 1)
    assert lab.device.messages.count("failed to map public port") > 0
    wait_for_cycle(lab, 3)
    fetched = [text for text in lab.device.messages.texts()
               if "::retrieveExternalIP  fetched" in text]
    assert {text.split()[-1] for text in fetched} == {network.GATEWAY_WAN_ADDRESS}
    assert _tracked(lab) == set()
    assert lab.gateway.mappings() == []
    lab.moment("the gateway answers too late for a mapping, and no tunnel client starts",
               "tunnel-client-does-not-start")
    assert_stops_clean(lab)


def _tracked(lab: Lab) -> set[tuple[str, int, int]]:
    """Service, internal and external port of every mapping that the daemon took for granted."""
    found = filter(None, map(_TRACKED.search, lab.device.messages.texts()))
    return {(told[1], int(told[2]), int(told[3])) for told in found}
