"""How a situation becomes a scenario that has a name and can be played."""

from __future__ import annotations

from collections.abc import Callable
from dataclasses import dataclass

from lab.scenario import Lab, Situation

Play = Callable[[Lab], None]


@dataclass(frozen=True)
class Scenario:
    """One story: where it starts, what happens, what must be seen. `play` raises when it is not."""

    name: str
    title: str
    situation: Situation
    play: Play


SCENARIOS: dict[str, Scenario] = {}


def scenario(situation: Situation) -> Callable[[Play], Play]:
    """Register a function as a scenario, named and titled after it and its docstring."""

    def register(play: Play) -> Play:
        name = play.__name__.replace("_", "-")
        assert name not in SCENARIOS and play.__doc__
        SCENARIOS[name] = Scenario(name, play.__doc__.strip().splitlines()[0], situation, play)
        return play

    return register
