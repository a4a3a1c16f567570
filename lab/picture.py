"""The timeline of a story as a picture: its network, a lane for each actor, and every event."""

from __future__ import annotations

import textwrap
from collections.abc import Sequence
from dataclasses import dataclass

from lab import sketch
from lab.scale import STATUS, Mark, Scale, word_width
from lab.scenario import Situation
from lab.sheet import ACTOR_COLOURS, LETTER, OTHER, PALE, QUIET, WIDTH, Sheet
from lab.timeline import STORY, Event

STATUS_COLOURS = {"connecting": "#c05f10", "portforwarded": "#2b8a4b", "relayed": "#2b6cb0",
                  "failed": "#c53030", "disabled": "#718096"}
_STORY_COLOUR = "#7b2d8b"

_MARGIN, _LEFT, _RIGHT = 30, 122, 1140
_SKETCH_TOP, _HEADINGS_TOP, _HEADING, _LANE, _LINE, _AXIS = 70, 186, 18, 38, 20, 64
_COLUMN, _TIME_AT, _WHO_AT, _TEXT_AT = 585, 88, 95, 178
_TITLE_LETTERS, _STEP_LETTERS, _LIST_LETTERS = 105, 58, 52
_LEAST_LETTERS, _MOST_LETTERS = 26, 60
_END = "pelorus receives SIGTERM"
_START_OR_END = ("pelorus starts", _END)


@dataclass
class _Entry:
    """An event in the list, with the times at which its actor repeated it."""

    number: int
    event: Event
    times: list[float]

    @property
    def colour(self) -> str:
        """A status has its own colour, any other event its actor's."""
        status = self.event.what.removeprefix(STATUS)
        return STATUS_COLOURS.get(status, ACTOR_COLOURS.get(self.event.who, OTHER))

    def lines(self) -> list[str]:
        """The text, wrapped to fit a column."""
        text = self.event.what
        if len(self.times) > 1:
            text += f" ({len(self.times)} times, until {self.times[-1]:.2f} s)"
        letters = _STEP_LETTERS if self.event.who == STORY else _LIST_LETTERS
        return textwrap.wrap(text, letters) or [""]

    def height(self) -> int:
        """Height in the list; a heading has some space above it."""
        return _LINE * len(self.lines()) + (10 if self.event.who == STORY else 3)


@dataclass
class _Step:
    """The heading of a step, and the place of its line."""

    x: float
    lines: list[str]
    top: float = 0

    @property
    def bottom(self) -> float:
        """The lower end of the heading."""
        return self.top + _HEADING * len(self.lines)

    @property
    def right(self) -> float:
        """The right end of the heading."""
        return self.x + max(map(len, self.lines)) * LETTER + 8


def svg(title: str, events: Sequence[Event], situation: Situation = Situation()) -> str:
    """The network, status over time, a lane for each actor, and the numbered list of events."""
    shown, end = _story(title, events)
    entries, numbers = _entries(shown)
    scale = Scale(shown, numbers, _LEFT, _RIGHT)
    width = scale.right + WIDTH - _RIGHT
    steps = _steps(shown, scale)
    actors = sorted(scale.marks, key=[*ACTOR_COLOURS, *scale.marks].index)
    lanes_top = max([step.bottom for step in steps], default=_HEADINGS_TOP) + 6
    lanes_end = lanes_top + _LANE * (1 + len(actors))
    columns = _columns(entries, int(width / _COLUMN))
    list_height = max(sum(entry.height() for entry in column) for column in columns)
    sheet = Sheet(lanes_end + _AXIS + list_height + 12, width)
    _draw_head(sheet, title, events, situation)
    _draw_axis(sheet, scale, lanes_top, lanes_end, end)
    _draw_steps(sheet, steps, lanes_end)
    _draw_status(sheet, scale, shown, lanes_top)
    for number, who in enumerate(actors, 1):
        _draw_lane(sheet, scale, shown, who, lanes_top + number * _LANE)
    for number, column in enumerate(columns):
        _draw_list(sheet, column, _MARGIN + number * _COLUMN, lanes_end + _AXIS)
    return str(sheet)


def _story(title: str, events: Sequence[Event]) -> tuple[list[Event], str]:
    """The events without the lab's own and without a shutdown that only ends the story.

    The second value tells of that shutdown. A shutdown is part of the story if the title names the
    signal, or if it is all that the device does in the last step.
    """
    told = [event for event in events if event.who != "lab"]
    runs = [number for number, event in enumerate(told) if event.what.startswith(_START_OR_END)]
    if not runs or told[runs[-1]].what != _END:
        return told, ""
    before, after = told[:runs[-1]], told[runs[-1]:]
    own = [event.who for event in before if event.who in ("device", STORY)]
    if "SIGTERM" in title or own[-1] == STORY or any(event.who == STORY for event in after):
        return told, ""
    return before, f" \u00b7 the shutdown at {after[0].when:.1f} s is left out"


def _entries(events: Sequence[Event]) -> tuple[list[_Entry], list[int]]:
    """Merge what an actor repeats within a step into one entry.

    The second value has the number of each event's entry, 0 for a repetition or a step.
    """
    entries: list[_Entry] = []
    numbers: list[int] = []
    latest: dict[str, _Entry] = {}
    for event in events:
        before = latest.get(event.who)
        number = 0
        if event.who == STORY:
            latest.clear()
            entries.append(_Entry(0, event, [event.when]))
        elif before and before.event.what == event.what:
            before.times.append(event.when)
        else:
            number = max(numbers, default=0) + 1
            latest[event.who] = _Entry(number, event, [event.when])
            entries.append(latest[event.who])
        numbers.append(number)
    return entries, numbers


def _steps(events: Sequence[Event], scale: Scale) -> list[_Step]:
    """Each step, its heading beside those before it, or below those that its line would cross."""
    told = [(event.what, x) for event, x in zip(events, scale.places) if event.who == STORY]
    steps: list[_Step] = []
    for number, (text, x) in enumerate(told):
        beside = [told[number + 1][1] - x - 14] if number + 1 < len(told) else []
        letters = [int(room / LETTER) for room in (*beside, scale.right - x - 8)]
        wide = next(count for count in (*letters, _LEAST_LETTERS) if count >= _LEAST_LETTERS)
        step = _Step(x, textwrap.wrap(text, min(wide, _MOST_LETTERS)))
        step.top = max([before.bottom for before in steps if before.right > x],
                       default=_HEADINGS_TOP)
        steps.append(step)
    return steps


def _columns(entries: list[_Entry], count: int) -> list[list[_Entry]]:
    """Columns of about the same height; none ends with a heading."""
    share = sum(entry.height() for entry in entries) / count
    columns: list[list[_Entry]] = [[]]
    height = 0
    for entry in entries:
        if height >= share * len(columns) and len(columns) < count:
            columns.append([])
            if columns[-2][-1].event.who == STORY:
                columns[-1].append(columns[-2].pop())
        columns[-1].append(entry)
        height += entry.height()
    return columns


def _draw_head(sheet: Sheet, title: str, events: Sequence[Event], situation: Situation) -> None:
    words = textwrap.shorten(title.replace("`", ""), _TITLE_LETTERS, placeholder=" \u2026")
    sheet.write(words, _MARGIN, 36, font_size=18, font_weight="bold")
    sheet.write(clock(situation), _MARGIN, 58, fill=QUIET)
    sketch.draw(sheet, sketch.hosts(situation, events), _LEFT, _RIGHT, _SKETCH_TOP)


def clock(situation: Situation) -> str:
    """How fast the device's clock runs."""
    if situation.clock == 1:
        return "The device's clock runs at its normal speed."
    in_pauses = situation.clock * situation.pauses
    faster = f", in pauses {in_pauses} times" if situation.pauses != 1 else ""
    pause = 60 / in_pauses
    return (f"The device's clock runs {situation.clock} times as fast{faster}: a pause of 1 minute "
            f"takes {pause:.2g} second{'' if pause == 1 else 's'}.")


def _draw_axis(sheet: Sheet, scale: Scale, top: float, end: float, remark: str) -> None:
    for tick in scale.ticks():
        x = scale.x(tick)
        sheet.draw("line", x1=x, x2=x, y1=top, y2=end + 6, stroke=PALE)
        sheet.write(f"{tick:g}", x, end + 20, text_anchor="middle", font_size=12)
    sheet.write(f"seconds in the lab, wider where more happens{remark}",
                (_LEFT + scale.right) / 2, end + 38, text_anchor="middle", font_size=12, fill=QUIET)


def _draw_steps(sheet: Sheet, steps: Sequence[_Step], end: float) -> None:
    if steps:
        sheet.write(STORY, _MARGIN, _HEADINGS_TOP + 14, fill=_STORY_COLOUR, font_weight="bold")
    for step in steps:
        sheet.draw("line", x1=step.x, x2=step.x, y1=step.top + 2, y2=end + 6,
                   stroke=_STORY_COLOUR, stroke_dasharray="4 3")
        for number, line in enumerate(step.lines):
            sheet.write(line, step.x + 5, step.top + 14 + number * _HEADING, fill=_STORY_COLOUR,
                        font_size=13, font_weight="bold")


def _draw_status(sheet: Sheet, scale: Scale, events: Sequence[Event], y: float) -> None:
    """A bar from each change to the next, the last one up to the right edge."""
    sheet.write("status", _MARGIN, y + 24, font_weight="bold")
    told = [(event.what.removeprefix(STATUS), x) for event, x in zip(events, scale.places)
            if event.who == "device" and event.what.startswith(STATUS)]
    changes = [now for before, now in zip([("", 0.0), *told], told) if now[0] != before[0]]
    for (word, x), (_, end) in zip(changes, [*changes[1:], ("", scale.right)]):
        sheet.draw("rect", x=x, y=y + 7, width=end - x, height=_LANE - 14,
                   fill=STATUS_COLOURS.get(word, OTHER))
        if end - x >= word_width(word) - 1:
            sheet.write(word, x + 6, y + 24, fill="#ffffff", font_weight="bold")


def _draw_lane(sheet: Sheet, scale: Scale, events: Sequence[Event], who: str, y: float) -> None:
    """A tick at every event, and the marks above the ticks."""
    colour, base = ACTOR_COLOURS.get(who, OTHER), y + _LANE - 3
    sheet.write(who, _MARGIN, y + 24, fill=colour, font_weight="bold")
    sheet.draw("line", x1=_LEFT, x2=scale.right, y1=base, y2=base, stroke=colour)
    for x in (x for event, x in zip(events, scale.places) if event.who == who):
        sheet.draw("line", x1=x, x2=x, y1=base - 8, y2=base, stroke=colour, stroke_width=2)
    for mark in scale.marks[who]:
        _draw_mark(sheet, mark, y + 7, colour)


def _draw_mark(sheet: Sheet, mark: Mark, y: float, colour: str) -> None:
    """Numbers in a box with round corners."""
    sheet.draw("rect", x=mark.left, y=y, width=mark.width, height=18, rx=9, fill=colour)
    sheet.write(str(mark), mark.left + mark.width / 2, y + 13, text_anchor="middle",
                font_size=12, font_weight="bold", fill="#ffffff")


def _draw_list(sheet: Sheet, entries: Sequence[_Entry], x: float, y: float) -> None:
    for entry in entries:
        event, lines = entry.event, entry.lines()
        y += entry.height()
        first = y - _LINE * len(lines) + 12
        if event.who == STORY:
            colour, text_at, style = _STORY_COLOUR, _WHO_AT, {
                "fill": _STORY_COLOUR, "font_weight": "bold"}
        else:
            colour, text_at, style = entry.colour, _TEXT_AT, {}
            _draw_mark(sheet, Mark(x, entry.number, entry.number), first - 14, colour)
            sheet.write(event.who, x + _WHO_AT, first, font_size=13, fill=colour)
        sheet.write(f"{event.when:.2f} s", x + _TIME_AT, first, font_size=13, text_anchor="end",
                    fill=colour)
        for number, line in enumerate(lines):
            sheet.write(line, x + text_at, first + number * _LINE, font_size=13, **style)
