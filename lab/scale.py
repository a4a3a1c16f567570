"""Where the events of a story stand: time runs to the right, and busy moments get more width."""

from __future__ import annotations

from bisect import bisect_right
from collections.abc import Sequence
from dataclasses import dataclass
from math import ceil

from lab.sheet import LETTER
from lab.timeline import STORY, Event

STATUS = "status: "

_AROUND_STEP, _APART, _TICK, _TOGETHER = 16, 6, 3, 36
_BETWEEN_MARKS, _HALF_MARK = 3, 10
_LAST_STATUS, _LAST_STEP = 170, 220
_TICKS_APART = 44
_MOST_UNIT = 1000


@dataclass
class Mark:
    """The numbers of successive events of one lane, in a box whose left end is at `left`."""

    left: float
    first: int
    last: int

    def __str__(self) -> str:
        return str(self.first) if self.first == self.last else f"{self.first}\u2013{self.last}"

    @property
    def width(self) -> int:
        """Width of the box around the numbers."""
        return len(str(self)) * LETTER + 10

    @property
    def right(self) -> float:
        """The right end of the box."""
        return self.left + self.width


class _Places:
    """The places of events at a number of pixels a second, more where there is too little room."""

    def __init__(self, unit: float, left: float, start: float) -> None:
        self.places: list[float] = []
        self.marks: dict[str, list[Mark]] = {}
        self.right = left
        self._unit = unit
        self._x, self._when = left + _AROUND_STEP, start
        self._status, self._status_end = "", 0.0
        self._open: tuple[str, float] | None = None  # lane and place of the latest mark

    def add(self, event: Event, number: int) -> None:
        """Place the next event; `number` is 0 for a step and for a repetition."""
        self._x += (event.when - self._when) * self._unit
        self._when = event.when
        if event.who == STORY:
            self._x = max([self._x, *(lane[-1].right + _BETWEEN_MARKS
                                      for lane in self.marks.values())])
            self._keep_apart(_AROUND_STEP)
            self._reserve(_LAST_STEP)
            self._open = None
        elif number:
            self._mark(event, number)
        else:
            self._keep_apart(_TICK)
        self._reserve(0)
        self.places.append(self._x)

    def _keep_apart(self, distance: float) -> None:
        """Place the event at least this far from the one before."""
        if self.places:
            self._x = max(self._x, self.places[-1] + distance)

    def _reserve(self, room: float) -> None:
        """Have room to the right of the event, should it be the last of its kind."""
        self.right = max(self.right, self._x + room)

    def _mark(self, event: Event, number: int) -> None:
        """Join the lane's latest mark if that is the previous event's, and near; else begin one."""
        lane = self.marks.setdefault(event.who, [])
        changed = event.what.startswith(STATUS) and event.what != self._status
        if changed:
            self._x = max(self._x, self._status_end)
        if (self._open and self._open[0] == event.who and lane[-1].last == number - 1
                and not changed and self._x - self._open[1] <= _TOGETHER):
            self._keep_apart(_TICK + 1)
            lane[-1].last = number
        else:
            self._keep_apart(_APART if self._open else _AROUND_STEP)
            if lane:
                self._x = max(self._x, lane[-1].right + _BETWEEN_MARKS + _HALF_MARK)
            lane.append(Mark(self._x - _HALF_MARK, number, number))
            self._open = event.who, self._x
        if changed:
            self._status = event.what
            self._status_end = self._x + word_width(event.what.removeprefix(STATUS))
            self._reserve(_LAST_STATUS)
        self.right = max(self.right, lane[-1].right)


class Scale:
    """The places of the events, at as many pixels a second as there is room for.

    Each event stands to the right of the one before, far enough for its lane to show the numbers of
    its own events only. Each status is as wide as its word, and the last one is wide.
    """

    def __init__(self, events: Sequence[Event], numbers: Sequence[int], left: float,
                 right: float) -> None:
        """`numbers` has each event's number, 0 for a step and for a repetition."""
        self.right = max(right, left + (_placed(events, numbers, 0, left).right - left) * 1.25)
        self._unit, too_much = 0.0, float(_MOST_UNIT)
        while too_much - self._unit > 0.01:
            middle = (self._unit + too_much) / 2
            if _placed(events, numbers, middle, left).right <= self.right:
                self._unit = middle
            else:
                too_much = middle
        placed = _placed(events, numbers, self._unit, left)
        self.places, self.marks = placed.places, placed.marks
        self._times = [event.when for event in events] or [0.0]
        self._known = self.places or [left]

    def x(self, when: float) -> float:
        """The place of a moment from the first event to the last."""
        after = min(max(bisect_right(self._times, when), 1), len(self._times) - 1)
        before = max(after - 1, 0)
        span = self._times[after] - self._times[before]
        share = (when - self._times[before]) / span if span else 0
        return self._known[before] + share * (self._known[after] - self._known[before])

    def ticks(self) -> list[float]:
        """Round numbers of seconds, nowhere too close for a number at each."""
        steps = (base * 10 ** power for power in range(-1, 9) for base in (1, 2, 5))
        step = next(step for step in steps if step * self._unit >= _TICKS_APART)
        first, last = ceil(self._times[0] / step), int(self._times[-1] / step)
        return [count * step for count in range(first, last + 1)]


def word_width(word: str) -> int:
    """The width of a status bar that shows its word."""
    return len(word) * (LETTER + 1) + 12


def _placed(events: Sequence[Event], numbers: Sequence[int], unit: float, left: float) -> _Places:
    places = _Places(unit, left, events[0].when if events else 0)
    for event, number in zip(events, numbers):
        places.add(event, number)
    return places
