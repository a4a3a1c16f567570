"""The picture of a timeline: complete, to scale, readable, and made of plain shapes only."""

from __future__ import annotations

import xml.etree.ElementTree as ElementTree

import pytest

from lab.picture import STATUS_COLOURS, svg
from lab.timeline import Event, Timeline

pytestmark = pytest.mark.outside

SVG = "{http://www.w3.org/2000/svg}"
Box = tuple[float, float]


def drawn(events: list[Event]) -> ElementTree.Element:
    return ElementTree.fromstring(svg("A day in the lab", events))


def texts(picture: ElementTree.Element) -> list[str]:
    return [element.text or "" for element in picture.iter(f"{SVG}text")]


def measure(shape: ElementTree.Element, name: str) -> float:
    """An attribute that the shape must have."""
    return float(shape.attrib[name])


def side_by_side(picture: ElementTree.Element, kind: str, **wanted: str) -> list[list[Box]]:
    """The left and right ends of shapes of a kind, for each height at which some are."""
    rows: dict[str, list[Box]] = {}
    for shape in picture.iter(SVG + kind):
        if all(shape.get(name.replace("_", "-")) == value for name, value in wanted.items()):
            left = measure(shape, "x")
            width = float(shape.get("width", 7 * len(shape.text or "")))
            rows.setdefault(shape.attrib["y"], []).append((left, left + width))
    return [sorted(row) for row in rows.values()]


def test_repeated_lines_become_one_entry_without_control_characters() -> None:
    timeline = Timeline()
    timeline.step("the gateway has <no> port & says \x1b[31mso\udc80")
    refusal = ("Router::mapPort() - fail - failed to map external port: {}, "
               "to internal port: 80, status: 718")
    for port in range(9091, 9391):
        timeline.read_log(refusal.format(port))
    timeline.read_log("Router::mapPort() - success - external port: 9391 has been mapped to "
                      "internal port: 80  ")
    timeline.read_log(refusal.format(9392))
    timeline.add("relay", "a tunnel begins")
    timeline.add("relay", "a tunnel begins")

    seen = [(event.who, event.what) for event in timeline.events]
    assert seen[1:] == [("device", "gateway refuses a port")] * 2 + [("relay",
                                                                      "a tunnel begins")] * 2
    picture = drawn(timeline.events)
    assert {element.tag for element in picture.iter()} == {
        f"{SVG}{shape}" for shape in ("svg", "rect", "line", "text")}
    words = texts(picture)
    heading = "the gateway has <no> port & says \ufffd[31mso\ufffd"
    assert words.count(heading) == 2
    assert sum(word.startswith("gateway refuses a port (2 times") for word in words) == 1
    assert sum(word.startswith("a tunnel begins (2 times") for word in words) == 1


def test_status_bars_follow_each_other_to_scale() -> None:
    events = [Event(when, "device", f"status: {word}") for when, word in (
        (10, "connecting"), (40, "relayed"), (55, "relayed"), (70, "failed"), (80, "disabled"))]
    picture = drawn([Event(5, "lab", "is raised"), *events, Event(81, "lab", "is gone")])
    bars = [row[0] for word in ("connecting", "relayed", "failed", "disabled") for row in
            side_by_side(picture, "rect", fill=STATUS_COLOURS[word], height="24")]
    scale = (bars[0][1] - bars[0][0]) / 30
    assert [(right - left) / scale for left, right in bars[:3]] == pytest.approx([30, 30, 10], 0.01)
    assert len(bars) == 4 and bars[2][1] == pytest.approx(bars[3][0], abs=0.1)
    assert {"connecting", "relayed", "disabled"} <= set(texts(picture))


def test_crowded_marks_and_headings_do_not_overlap() -> None:
    moments = [Event(60 + number ** 2 / 50, who, f"event {number} of {who}")
               for number in range(40) for who in ("device", "gateway", "somebody")]
    steps = [Event(60 + number / 5, "story", f"and then, as step {number}, it goes on and on")
             for number in range(6)]
    events = sorted(moments + steps, key=lambda event: event.when)
    picture = drawn(events)
    words = texts(picture)
    assert all(event.what in words for event in events)
    marks = side_by_side(picture, "rect", rx="9")
    headings = side_by_side(picture, "text", font_size="13")
    assert sum(map(len, headings)) == 6 and max(map(len, marks)) > 1
    for row in marks + headings:
        assert all(before[1] < after[0] for before, after in zip(row, row[1:]))
        assert 0 < row[0][0] and row[-1][1] < 1200
    lowest = max(measure(text, "y") for text in picture.iter(f"{SVG}text"))
    assert lowest < measure(picture, "height")
