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
    events = [Event(when, "device", f"status: {word}") for when, word in told.items()]
    events += [Event(80.02, "device", "pelorus receives SIGTERM")]
    bars = drawn(events, "rect", height="24")
    del told[55]
    assert [bar["fill"] for bar in bars] == [STATUS_COLOURS[word] for word in told.values()]
    starts = [ends(bar)[0] for bar in bars]
    unit = (starts[3] - starts[0]) / 70
    assert starts == pytest.approx([starts[0] + unit * (when - 10) for when in told], 0.01)
    assert [ends(bar)[1] for bar in bars] == pytest.approx([*starts[1:], 1140], abs=0.1)
    words = "|".join(text["text"] for text in drawn(events, "text"))
    assert "shutdown at 80.0 s" in words and "|failed|" in words and starts[3] <= 970


def test_crowded_marks_and_headings_are_complete_and_do_not_overlap() -> None:
    events = [Event(60 + number ** 2 / 50, who, f"event {number} of {who}")
              for number in range(40) for who in ("device", "gateway", "somebody")]
    events += [Event(60 + number / 5, "story", f"and then, as step {number}, it goes on and on")
               for number in range(6)]
    events.sort(key=lambda event: event.when)
    texts = drawn(events, "text")
    lanes = {float(text["y"]) - 4: text["text"] for text in texts if text["x"] == "30"}
    headings = [text for text in drawn(events, "text", fill="#7b2d8b")
                if text["text"] != "story" and float(text["y"]) < max(lanes)]
    assert " ".join(heading["text"] for heading in headings) == " ".join(
        event.what for event in events if event.who == "story")
    numbers = {int(text["text"]): lanes[float(text["y"])]
               for text in texts if float(text["y"]) in lanes}
    assert numbers == dict(enumerate(("device", "gateway", "somebody") * 40, 1))
    boxes = sorted((shape.get("rx", ""), shape["y"], *ends(shape))
                   for shape in drawn(events, "rect", rx="9") + headings)
    assert all(end < start for (*row, _, end), (*next_row, start, _) in pairwise(boxes)
               if row == next_row)
    assert max(right for *_, right in boxes) < float(drawn(events, "rect")[0]["width"])


def test_sketch_names_the_owner_of_each_address() -> None:
    words = "puts the gateway, now 44.128.1.20, behind 44.128.0.21, far from 44.128.0.99"
    found = [host.lines()[-1] for host in hosts(Situation(), [Event(1, "provider", words)])]
    assert found == ["192.168.77.10", "44.128.0.20 or 44.128.1.20", "44.128.0.21", "44.128.0.1",
                     "44.128.0.2", "44.128.0.99"]
