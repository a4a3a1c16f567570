"""Every situation the daemon exists for, played in a lab of its own."""

from __future__ import annotations

from pathlib import Path

import pytest

from lab.scenarios import SCENARIOS

NEEDS_TUNNEL = pytest.mark.skipif(not Path("/dev/net/tun").exists(),
                                  reason="this machine has no tunnel device")


@pytest.mark.parametrize("name", [
    pytest.param(name, marks=NEEDS_TUNNEL if scenario.situation.relay else ())
    for name, scenario in SCENARIOS.items()])
def test_scenario(play, name):
    scenario = SCENARIOS[name]
    scenario.play(play(scenario.situation))
