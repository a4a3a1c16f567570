"""The scenarios by name, and how a function becomes one."""

from __future__ import annotations

from collections.abc import Callable
from dataclasses import dataclass
from types import FunctionType

from lab.scenario import Lab, Situation

Play = Callable[[Lab], None]


@dataclass(frozen=True)
class Scenario:
    """One story: where it starts, what happens, what to expect. `play` raises on a failure."""

    name: str
    title: str
    situation: Situation
    play: Play

    @property
    def tells_moment(self) -> bool:
        """True when the story itself calls `Lab.moment` or `Lab.visit`."""
        return (isinstance(self.play, FunctionType)
                and not {"moment", "visit"}.isdisjoint(self.play.__code__.co_names))


SCENARIOS: dict[str, Scenario] = {}


def scenario(situation: Situation) -> Callable[[Play], Play]:
    """Register a function as a scenario; its name and docstring become name and title."""

    def register(play: Play) -> Play:
        name = play.__name__.replace("_", "-")
        assert name not in SCENARIOS and play.__doc__
        SCENARIOS[name] = Scenario(name, play.__doc__.strip().splitlines()[0], situation, play)
        return play

    return register
