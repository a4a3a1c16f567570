"""The picture of a timeline: complete, to scale and readable."""

from __future__ import annotations

from itertools import pairwise
from xml.etree import ElementTree

import pytest

from lab.picture import STATUS_COLOURS, svg
from lab.timeline import Event, Timeline

pytestmark = pytest.mark.outside


def drawn(events: list[Event], kind: str, **wanted: str) -> list[dict[str, str]]:
    """The shapes of a kind in the picture of the events: attributes and text, in their order."""
    root = ElementTree.fromstring(svg("A day in the lab", events))
    shapes = [{**shape.attrib, "text": shape.text or ""} for shape in root
              if shape.tag == "{http://www.w3.org/2000/svg}" + kind]
    return [shape for shape in shapes if wanted.items() <= shape.items()]


def ends(shape: dict[str, str]) -> tuple[float, float]:
    """The left and the right end of a shape; a text has no width of its own."""
    left = float(shape["x"])
    return left, left + float(shape.get("width", 7 * len(shape["text"])))


def test_repeated_lines_become_one_entry_without_control_characters() -> None:
    timeline = Timeline()
    timeline.step("the gateway has <no> port & says \x1b[31mso\udc80")
    for result in ["fail"] * 300 + ["success", "fail"]:
        timeline.read_log(f"Router::mapPort() - {result}")
    told = [(event.who, event.what) for event in timeline.events[1:]]
    assert told == [("device", "gateway refuses a port")] * 2
    words = [shape["text"] for shape in drawn(timeline.events, "text")]
    assert words.count("the gateway has <no> port & says \ufffd[31mso\ufffd") == 2
    assert sum(word.startswith("gateway refuses a port (2 times") for word in words) == 1


def test_status_bars_follow_each_other_to_scale() -> None:
    told = {10: "connecting", 40: "relayed", 55: "relayed", 70: "failed", 80: "disabled"}
    events = [Event(when, "device", f"status: {word}") for when, word in told.items()]
    events.append(Event(81, "lab", "is gone"))
    bars = drawn(events, "rect", height="24")
    assert [bar["fill"] for bar in bars] == [
        STATUS_COLOURS[word] for word in ("connecting", "relayed", "failed", "disabled")]
    starts = [ends(bar)[0] for bar in bars]
    scale = (starts[3] - starts[0]) / 70
    assert starts == pytest.approx([110 + scale * when for when in (10, 40, 70, 80)], 0.01)
    assert [ends(bar)[1] for bar in bars] == pytest.approx([*starts[1:], 1140], abs=0.1)
    assert {"connecting", "disabled"} <= {text["text"] for text in drawn(events, "text")}


def test_crowded_marks_and_headings_do_not_overlap() -> None:
    events = [Event(60 + number ** 2 / 50, who, f"event {number} of {who}")
              for number in range(40) for who in ("device", "gateway", "somebody")]
    events += [Event(60 + number / 5, "story", f"and then, as step {number}, it goes on and on")
               for number in range(6)]
    events.sort(key=lambda event: event.when)
    texts = drawn(events, "text")
    assert {event.what for event in events} <= {text["text"] for text in texts}
    assert float(drawn(events, "rect")[0]["height"]) > max(float(text["y"]) for text in texts)
    rows: dict[tuple[str, str], list[tuple[float, float]]] = {}
    for shape in drawn(events, "rect", rx="9") + drawn(events, "text", **{"font-size": "13"}):
        rows.setdefault((shape.get("rx", ""), shape["y"]), []).append(ends(shape))
    assert [len(row) for (kind, _), row in rows.items() if not kind] == [1] * 6
    assert max(map(len, rows.values())) > 1
    for row in rows.values():
        row.sort()
        assert all(before[1] < after[0] for before, after in pairwise(row))
        assert 0 < row[0][0] and row[-1][1] < 1200
