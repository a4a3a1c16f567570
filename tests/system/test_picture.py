"""The picture of a timeline: complete, to scale and readable."""

from __future__ import annotations

from itertools import pairwise
from xml.etree import ElementTree

import pytest

from lab.picture import STATUS_COLOURS, svg
from lab.scenario import Situation
from lab.sketch import hosts
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


def test_status_bars_follow_each_other_to_scale_and_the_last_is_wide() -> None:
    told = {10: "connecting", 40: "relayed", 55: "relayed", 70: "failed", 80: "portforwarded"}
    events = [Event(0, "device", "pelorus starts")]
    events += [Event(when, "device", f"status: {word}") for when, word in told.items()]
    events += [Event(80.02, "device", "pelorus receives SIGTERM"),
               Event(80.04, "device", "status: disabled")]
    bars = drawn(events, "rect", height="24")
    words = ["connecting", "relayed", "failed", "portforwarded"]
    assert [bar["fill"] for bar in bars] == [STATUS_COLOURS[word] for word in words]
    starts = [ends(bar)[0] for bar in bars]
    scale = (starts[3] - starts[0]) / 70
    assert starts == pytest.approx([122 + scale * when for when in (10, 40, 70, 80)], 0.01)
    assert [ends(bar)[1] for bar in bars] == pytest.approx([*starts[1:], 1140], abs=0.1)
    assert starts[3] <= 1140 - 170
    texts = {text["text"] for text in drawn(events, "text")}
    assert {*words} <= texts and any("shutdown at 80.0 s" in text for text in texts)


def test_crowded_marks_and_headings_do_not_overlap_and_no_heading_is_cut() -> None:
    events = [Event(60 + number ** 2 / 50, who, f"event {number} of {who}")
              for number in range(40) for who in ("device", "gateway", "somebody")]
    events += [Event(60 + number / 5, "story", f"and then, as step {number}, it goes on and on")
               for number in range(6)]
    events.sort(key=lambda event: event.when)
    texts = drawn(events, "text")
    assert {event.what for event in events} <= {text["text"] for text in texts}
    sheet, *_ = drawn(events, "rect")
    assert float(sheet["height"]) > max(float(text["y"]) for text in texts)
    lanes_end = max(float(line["y2"]) for line in drawn(events, "line"))
    headings = [text for text in drawn(events, "text", fill="#7b2d8b")
                if float(text["x"]) > 122 and float(text["y"]) < lanes_end]
    words = " ".join(heading["text"] for heading in headings)
    assert all(event.what in words for event in events if event.who == "story")
    rows: dict[tuple[str, str], list[tuple[float, float]]] = {}
    for shape in drawn(events, "rect", rx="9") + headings:
        rows.setdefault((shape.get("rx", ""), shape["y"]), []).append(ends(shape))
    assert max(map(len, rows.values())) > 1
    for row in rows.values():
        row.sort()
        assert all(before[1] < after[0] for before, after in pairwise(row))
        assert 0 < row[0][0] and row[-1][1] < float(sheet["width"])


def test_numbers_in_a_lane_are_those_of_its_own_events() -> None:
    events = [Event(number // 6 / 9, who, f"{number}") for number, who in enumerate(
        ("device", "device", "gateway", "device", "central", "gateway") * 9)]
    lanes = {float(text["y"]): text["text"] for text in drawn(events, "text", x="30")}
    marks = [(lanes[float(text["y"]) + 4], text["text"].partition("\u2013"))
             for text in drawn(events, "text", **{"font-size": "12", "font-weight": "bold"})
             if float(text["y"]) + 4 in lanes]
    found = [(number, who) for who, (first, _, last) in marks
             for number in range(int(first), int(last or first) + 1)]
    assert sorted(found) == [(number, event.who) for number, event in enumerate(events, 1)]


def test_sketch_names_the_owner_of_each_address() -> None:
    events = [Event(1, "provider", "puts the gateway, now 44.128.1.20, behind 44.128.0.21"),
              Event(2, "device", "public names point to 44.128.0.99 instead of 44.128.0.2")]
    owners = {host.name: host.lines() for host in hosts(Situation(), events)}
    assert owners == {"device": ["192.168.77.10"], "provider's NAT": ["44.128.0.21"],
                      "gateway": ["192.168.77.1", "44.128.0.20 or 44.128.1.20"],
                      "central service, names": ["44.128.0.1"], "relay": ["44.128.0.2"],
                      "somebody else": ["44.128.0.99"]}
