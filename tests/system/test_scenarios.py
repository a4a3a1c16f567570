"""Plays every scenario in a lab of its own."""

from __future__ import annotations

from collections.abc import Callable

import pytest

from lab.relay import TUNNEL_DEVICE
from lab.scenario import Lab, Situation
from lab.scenarios import SCENARIOS

NEEDS_TUNNEL = pytest.mark.skipif(not TUNNEL_DEVICE.exists(),
                                  reason="this machine has no tunnel device")
# Scenarios over ten leases take longest, so they start first.
LONGEST_FIRST = sorted(SCENARIOS.values(), key=lambda scenario: "leases" not in scenario.name)


@pytest.mark.parametrize("name", [
    pytest.param(scenario.name, marks=NEEDS_TUNNEL if scenario.situation.relay else ())
    for scenario in LONGEST_FIRST])
def test_scenario(play: Callable[[Situation], Lab], name: str) -> None:
    scenario = SCENARIOS[name]
    scenario.play(play(scenario.situation))
