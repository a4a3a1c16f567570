"""Gateways that attack: the daemon neither hangs nor fills up nor asks its own device."""

from __future__ import annotations

from lab.checks import (FAST, PAGES, assert_published, assert_stops_clean, pages_from_outside,
                        start)
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.scripted_gateway import Personality


@scenario(Situation(gateway=GatewaySetup(personality=Personality()), clock=FAST))
def scripted_gateway(lab: Lab) -> None:
    """The lab's own UPnP gateway is as good as another one: it maps both ports."""
    start(lab, "portforwarded")
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert_stops_clean(lab)
