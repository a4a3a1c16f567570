"""The long runs in short."""

from __future__ import annotations

from lab.endurance import play_faults
from test_scenarios import NEEDS_TUNNEL


@NEEDS_TUNNEL
def test_random_faults() -> None:
    play_faults(2, seed=1)
