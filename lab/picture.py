"""A timeline as a picture that a web page can show: SVG without script, style or link."""

from __future__ import annotations

import re
import textwrap
import xml.etree.ElementTree as ElementTree
from collections.abc import Sequence
from dataclasses import dataclass

from lab.timeline import STORY, Event

STATUS_COLOURS = {"connecting": "#c05f10", "portforwarded": "#2b8a4b", "relayed": "#2b6cb0",
                  "failed": "#c53030", "disabled": "#718096"}
_ACTOR_COLOURS = {"device": "#34495e", "gateway": "#8a5a12", "neighbour": "#9b2c2c",
                  "central": "#1f6f78", "names": "#3f6b1f", "relay": "#2b6cb0", "lab": "#718096"}
_OTHER, _STORY, _INK, _PALE = "#4a5568", "#7b2d8b", "#1a202c", "#e2e8f0"
_STATUS = "status: "

_WIDTH, _LEFT, _RIGHT = 1200, 110, 1140
_HEADINGS_TOP, _HEADING, _LANE, _LINE, _AXIS = 56, 20, 38, 20, 64
_COLUMNS, _TIME_AT, _WHO_AT, _TEXT_AT = (30, 625), 96, 103, 183
_TITLE_LETTERS, _HEADING_LETTERS, _LIST_LETTERS = 105, 60, 48
_MOST_NUDGE = 20
_LEAST_LETTERS = 20
_LETTER = 8  # mean width of a letter in the widest of the usual fonts
_UNPRINTABLE = re.compile("[^\t\n\r\x20-\ud7ff\ue000-\ufffd\U00010000-\U0010ffff]")


@dataclass
class _Entry:
    """An event in the list, with the times at which its actor repeated it."""

    number: int
    event: Event
    times: list[float]

    @property
    def colour(self) -> str:
        """A status has its own colour, any other event its actor's."""
        status = self.event.what.removeprefix(_STATUS)
        return STATUS_COLOURS.get(status, _ACTOR_COLOURS.get(self.event.who, _OTHER))

    def lines(self) -> list[str]:
        """The text, cut to fit a column."""
        text = self.event.what
        if len(self.times) > 1:
            text += f" ({len(self.times)} times, until {self.times[-1]:.2f} s)"
        return textwrap.wrap(text, _LIST_LETTERS) or [""]

    def height(self) -> int:
        """Height in the list; a heading has some space above it."""
        return _LINE * len(self.lines()) + (10 if self.event.who == STORY else 3)


@dataclass
class _Mark:
    """The number of an entry in its lane, or a range where entries are too close."""

    left: float
    first: int
    last: int

    def __str__(self) -> str:
        return str(self.first) if self.first == self.last else f"{self.first}\u2013{self.last}"

    @property
    def width(self) -> int:
        """Width of the box around the numbers."""
        return len(str(self)) * _LETTER + 10


class _Scale:
    """Seconds to pixels, with space left for the last status and the start of late headings."""

    def __init__(self, events: Sequence[Event]) -> None:
        words = [(event.when, _LEAST_LETTERS) for event in events if event.who == STORY]
        words += [(when, len(word)) for when, word in _statuses(events)[-1:]]
        end = max([event.when for event in events] + [1])
        self._unit = min([(_RIGHT - _LEFT) / end] + [
            (_RIGHT - _LEFT - letters * _LETTER - 12) / when for when, letters in words
            if when > 0])

    def x(self, when: float) -> float:
        """The horizontal position of a moment."""
        return _LEFT + when * self._unit

    def ticks(self) -> list[float]:
        """Round numbers of seconds, at least 60 pixels apart."""
        steps = (base * 10 ** power for power in range(-1, 9) for base in (1, 2, 5))
        step = next(step for step in steps if step * self._unit >= 60)
        return [count * step for count in range(int((_RIGHT - _LEFT) / self._unit / step) + 1)]


class Sheet:
    """The drawing."""

    def __init__(self, height: float) -> None:
        self._root = ElementTree.Element("svg", {
            "xmlns": "http://www.w3.org/2000/svg", "width": f"{_WIDTH}", "height": f"{height:g}",
            "viewBox": f"0 0 {_WIDTH} {height:g}", "font-family": "sans-serif", "fill": _INK})
        self.draw("rect", width=_WIDTH, height=height, rx=8, fill="#ffffff")

    def draw(self, shape: str, text: str = "", **attributes: str | float) -> None:
        """Add a shape; an underscore in an attribute's name stands for a hyphen."""
        element = ElementTree.SubElement(self._root, shape, {
            name.replace("_", "-"): value if isinstance(value, str) else f"{value:g}"
            for name, value in attributes.items()})
        element.text = _UNPRINTABLE.sub("\ufffd", text)

    def write(self, text: str, x: float, y: float, **attributes: str | float) -> None:
        """Add a line of text."""
        placed: dict[str, str | float] = {"x": x, "y": y, "font_size": 14}
        self.draw("text", text, **placed | attributes)

    def mark(self, mark: _Mark, y: float, colour: str) -> None:
        """Add numbers in a box with round corners."""
        self.draw("rect", x=mark.left, y=y, width=mark.width, height=18, rx=9, fill=colour)
        self.write(str(mark), mark.left + mark.width / 2, y + 13, text_anchor="middle",
                   font_size=12, font_weight="bold", fill="#ffffff")

    def __str__(self) -> str:
        ElementTree.indent(self._root)
        return ElementTree.tostring(self._root, encoding="unicode") + "\n"


def svg(title: str, events: Sequence[Event]) -> str:
    """Status over time, a lane for every actor, and below them the numbered list of events."""
    scale, entries = _Scale(events), _entries(events)
    steps = _step_rows(events, scale)
    seen = [entry.event.who for entry in entries if entry.number]
    actors = [who for who in dict.fromkeys([*_ACTOR_COLOURS, *seen]) if who in seen]
    lanes_top = _HEADINGS_TOP + 8 + _HEADING * max([row + 1 for _, row in steps] + [0])
    lanes_end = lanes_top + _LANE * (1 + len(actors))
    columns = _columns(entries)
    list_height = max(sum(entry.height() for entry in column) for column in columns)
    sheet = Sheet(lanes_end + _AXIS + list_height + 12)
    sheet.write(textwrap.shorten(title, _TITLE_LETTERS, placeholder=" \u2026"), _COLUMNS[0], 36,
                font_size=18, font_weight="bold")
    _draw_axis(sheet, scale, lanes_top, lanes_end)
    _draw_steps(sheet, scale, steps, lanes_end)
    _draw_status(sheet, scale, _statuses(events), lanes_top)
    for number, who in enumerate(actors, 1):
        own = [entry for entry in entries if entry.event.who == who]
        _draw_lane(sheet, scale, own, lanes_top + number * _LANE)
    for x, column in zip(_COLUMNS, columns):
        _draw_list(sheet, column, x, lanes_end + _AXIS)
    return str(sheet)


def _entries(events: Sequence[Event]) -> list[_Entry]:
    """Merge what an actor repeats within a step into one entry."""
    entries: list[_Entry] = []
    latest: dict[str, _Entry] = {}
    number = 0
    for event in events:
        before = latest.get(event.who)
        if event.who == STORY:
            latest.clear()
            entries.append(_Entry(0, event, [event.when]))
        elif before and before.event.what == event.what:
            before.times.append(event.when)
        else:
            number += 1
            latest[event.who] = _Entry(number, event, [event.when])
            entries.append(latest[event.who])
    return entries


def _statuses(events: Sequence[Event]) -> list[tuple[float, str]]:
    """The device's status changes, with their times."""
    told = [(event.when, event.what.removeprefix(_STATUS)) for event in events
            if event.who == "device" and event.what.startswith(_STATUS)]
    return [change for before, change in zip([(0.0, ""), *told], told) if change[1] != before[1]]


def _heading(step: Event, scale: _Scale) -> str:
    """The text of a step, cut to the available width; the list has it in full."""
    letters = int((_RIGHT - scale.x(step.when)) / _LETTER)
    return textwrap.shorten(step.what, min(_HEADING_LETTERS, letters), placeholder=" \u2026")


def _step_rows(events: Sequence[Event], scale: _Scale) -> list[tuple[Event, int]]:
    """Each step with the row of its heading, below every heading that its line would cross."""
    rows: list[tuple[Event, int]] = []
    ends: list[float] = []
    for step in (event for event in events if event.who == STORY):
        x = scale.x(step.when)
        crossed = [row for (_, row), end in zip(rows, ends) if end > x]
        rows.append((step, max(crossed, default=-1) + 1))
        ends.append(x + len(_heading(step, scale)) * _LETTER + 8)
    return rows


def _marks(entries: Sequence[_Entry], scale: _Scale) -> list[_Mark]:
    """Marks that do not overlap: moved to the right a little, else merged into the previous one."""
    marks: list[_Mark] = []
    for entry in entries:
        mark = _Mark(0, entry.number, entry.number)
        wanted = scale.x(entry.event.when) - mark.width / 2
        free = marks[-1].left + marks[-1].width + 3 if marks else wanted
        if free - wanted > _MOST_NUDGE:
            marks[-1].last = entry.number
        else:
            mark.left = max(wanted, free)
            marks.append(mark)
    return marks


def _columns(entries: list[_Entry]) -> tuple[list[_Entry], list[_Entry]]:
    """Two columns of about the same height; the first does not end with a heading."""
    half, height, first = sum(entry.height() for entry in entries) / 2, 0, 0
    while first < len(entries) and height < half:
        height += entries[first].height()
        first += 1
    while first and entries[first - 1].event.who == STORY:
        first -= 1
    return entries[:first], entries[first:]


def _draw_axis(sheet: Sheet, scale: _Scale, top: float, end: float) -> None:
    for tick in scale.ticks():
        x = scale.x(tick)
        sheet.draw("line", x1=x, x2=x, y1=top, y2=end + 6, stroke=_PALE)
        sheet.write(f"{tick:g}", x, end + 20, text_anchor="middle", font_size=12)
    sheet.write("seconds in the lab", (_LEFT + _RIGHT) / 2, end + 37, text_anchor="middle",
                font_size=12)


def _draw_steps(sheet: Sheet, scale: _Scale, steps: Sequence[tuple[Event, int]],
                end: float) -> None:
    if steps:
        sheet.write(STORY, _COLUMNS[0], _HEADINGS_TOP + 14, fill=_STORY, font_weight="bold")
    for step, row in steps:
        x, y = scale.x(step.when), _HEADINGS_TOP + row * _HEADING
        sheet.draw("line", x1=x, x2=x, y1=y + 2, y2=end + 6, stroke=_STORY, stroke_dasharray="4 3")
        sheet.write(_heading(step, scale), x + 5, y + 14, fill=_STORY, font_size=13,
                    font_weight="bold")


def _draw_status(sheet: Sheet, scale: _Scale, changes: Sequence[tuple[float, str]],
                 y: float) -> None:
    """A bar from each change to the next, the last one up to the right edge."""
    sheet.write("status", _COLUMNS[0], y + 24, font_weight="bold")
    places = [scale.x(when) for when, _ in changes] + [_RIGHT]
    for (_, word), x, end in zip(changes, places, places[1:]):
        sheet.draw("rect", x=x, y=y + 7, width=end - x, height=_LANE - 14,
                   fill=STATUS_COLOURS.get(word, _OTHER))
        if end - x >= len(word) * _LETTER + 12:
            sheet.write(word, x + 6, y + 24, fill="#ffffff", font_weight="bold")


def _draw_lane(sheet: Sheet, scale: _Scale, entries: Sequence[_Entry], y: float) -> None:
    """A tick at every event, and the marks above the ticks."""
    who, base = entries[0].event.who, y + _LANE - 3
    colour = _ACTOR_COLOURS.get(who, _OTHER)
    sheet.write(who, _COLUMNS[0], y + 24, fill=colour, font_weight="bold")
    sheet.draw("line", x1=_LEFT, x2=_RIGHT, y1=base, y2=base, stroke=colour)
    for when in (when for entry in entries for when in entry.times):
        sheet.draw("line", x1=scale.x(when), x2=scale.x(when), y1=base - 8, y2=base,
                   stroke=colour, stroke_width=2)
    for mark in _marks(entries, scale):
        sheet.mark(mark, y + 7, colour)


def _draw_list(sheet: Sheet, entries: Sequence[_Entry], x: float, y: float) -> None:
    for entry in entries:
        event, lines = entry.event, entry.lines()
        y += entry.height()
        first = y - _LINE * len(lines) + 12
        if event.who == STORY:
            colour, text_at, style = _STORY, _WHO_AT, {"fill": _STORY, "font_weight": "bold"}
        else:
            colour, text_at, style = entry.colour, _TEXT_AT, {}
            sheet.mark(_Mark(x, entry.number, entry.number), first - 14, colour)
            sheet.write(event.who, x + _WHO_AT, first, fill=colour)
        sheet.write(f"{event.when:.2f} s", x + _TIME_AT, first, text_anchor="end", fill=colour)
        for number, line in enumerate(lines):
            sheet.write(line, x + text_at, first + number * _LINE, **style)
