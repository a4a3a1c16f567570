"""Plays every scenario, and a choice of the gateways in the zoo, each in a lab of its own."""

from __future__ import annotations

import pytest

from lab import diagnoses
from lab.relay import TUNNEL_DEVICE
from lab.scenario import Lab
from lab.scenarios import SCENARIOS
from lab.timeline import Timeline
from lab.zoo import ZOO

# The others are played by scripts/zoo.
CHOSEN = tuple(f"zoo-{row}" for row in (
    "D9", "D9b", "D11", "H1", "A2b", "A3", "P16", "L4", "T1", "N4b", "N14", "two-routers"))
PLAYED = {**SCENARIOS, **{name: ZOO[name] for name in CHOSEN}}
NEEDS_TUNNEL = pytest.mark.skipif(not TUNNEL_DEVICE.exists(),
                                  reason="this machine has no tunnel device")
# Scenarios over ten leases take longest, so they start first.
LONGEST_FIRST = sorted(PLAYED.values(), key=lambda scenario: "leases" not in scenario.name)


@pytest.mark.parametrize("name", [
    pytest.param(scenario.name, marks=NEEDS_TUNNEL if scenario.situation.relay else ())
    for scenario in LONGEST_FIRST])
def test_scenario(name: str) -> None:
    lab = Lab(PLAYED[name].situation, Timeline())
    lab.asks_doctor = True
    try:
        PLAYED[name].play(lab)
    except Exception:
        print(lab.report())
        raise
    if name in SCENARIOS:
        rows = diagnoses.table({name: lab.moments})[2:]
        assert diagnoses.without_facts(rows) == diagnoses.without_facts(
            diagnoses.documented(name)), "docs/doctor.md is not up to date: scripts/diagnoses"
