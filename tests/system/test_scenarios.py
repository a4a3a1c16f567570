"""Plays every scenario in a lab of its own."""

from __future__ import annotations

import pytest

from lab.relay import TUNNEL_DEVICE
from lab.scenario import Lab
from lab.scenarios import SCENARIOS
from lab.timeline import Timeline

NEEDS_TUNNEL = pytest.mark.skipif(not TUNNEL_DEVICE.exists(),
                                  reason="this machine has no tunnel device")
# Scenarios over ten leases take longest, so they start first.
LONGEST_FIRST = sorted(SCENARIOS.values(), key=lambda scenario: "leases" not in scenario.name)


@pytest.mark.parametrize("name", [
    pytest.param(scenario.name, marks=NEEDS_TUNNEL if scenario.situation.relay else ())
    for scenario in LONGEST_FIRST])
def test_scenario(name: str) -> None:
    lab = Lab(SCENARIOS[name].situation, Timeline())
    try:
        SCENARIOS[name].play(lab)
    except Exception:
        print(lab.report())
        raise
