"""Plays a row: four cycles of the daemon, then SIGTERM, and the checks that always hold."""

from __future__ import annotations

import re
import time
from dataclasses import dataclass
from itertools import pairwise

from lab import daemon, network
from lab.central import PORT_FORWARD, PORT_TEST
from lab.checks import (OPTIONS, PAGES, PAUSE, assert_log_is_proper, page_through_the_tunnel,
                        pages_from_outside)
from lab.messages import Message
from lab.packet_filter import Mapping
from lab.scenario import Lab
from lab.web import Request
from lab.zoo.row import CLOCK, CYCLES, REACHED, RELAYED, Row

# The second port that the daemon would try.
NEIGHBOURS = Mapping("TCP", 9092, network.NEIGHBOUR_ADDRESS, 7000)

# Seconds of the device: a busy machine may keep it waiting for a real second in a call of the
# library, for three in a cycle.
_SLACK_IN_CALL, _SLACK = CLOCK, 3 * CLOCK
_STOPPED_WITHIN = 100
# From one of these lines to the next of them at most so many seconds pass.
_BOUNDS = tuple((re.compile(begin), re.compile(end), seconds) for begin, end, seconds in (
    (r"initLocalIp\(\) - Address Name", r"upnp_discover - (List of UPNP|UPnP Discover failed)", 20),
    (r"upnp_discover - List of UPNP",
     r"upnp_discover - (.* found at|gateway ignored|invalid device)|natpmp_discover", 30),
    (r"upnp_discover - .* found at", r"upnp_discover - .*[eE]xternal IP address", 10),
    (r"upnp_discover - (UPnP Discover failed|invalid device|failed to get External)",
     r"natpmp_discover - (failed|Router's external IP address:)", 2 * CLOCK),
    (r"mapPort\(\) - UPNP_GetSpecific", r"mapPort\(\) - (success|fail|internal port)", 10),
    (r"killConnection\(\) - unmapping all ports", r"unmapAllPorts\(\) - (success|fail)", 120)))
_PAUSE_SECONDS = re.compile(re.escape(PAUSE) + r"(\d+) secs")


@dataclass(frozen=True)
class Played:
    """What was seen; times are seconds of the device, and None if it never became reachable."""

    outcome: str
    reachable: float | None
    longest: float
    requests: int
    left: list[Mapping]

    def __str__(self) -> str:
        when = "never" if self.reachable is None else f"after {self.reachable:.0f} s"
        return (f"{self.outcome}, first reachable {when}, longest cycle {self.longest:.0f} s, "
                f"{self.requests} requests, left behind: "
                f"{', '.join(map(str, self.left)) or 'nothing'}")


def play(lab: Lab, row: Row) -> Played:
    """Play a row; AssertionError or LabError if it does not end as it says."""
    lab.gateway.keep(NEIGHBOURS)
    row.between.get(0, _nothing)(lab)
    by_hand = lab.gateway.by_hand()
    began = time.monotonic()
    lab.start_daemon(*OPTIONS)
    for cycle in range(1, CYCLES + 1):
        patience = (row.longest + _SLACK) / CLOCK + 30
        lab.wait_for(lambda: lab.device.messages.count(PAUSE) >= cycle, f"cycle {cycle} to end",
                     patience)
        with lab.daemon.held():
            assert NEIGHBOURS in lab.gateway.left()
            if cycle in row.between:
                row.between[cycle](lab)
                lab.gateway.keep(NEIGHBOURS)
    with lab.daemon.held():
        seen = Played(lab.device.status, _reachable(lab, began), _longest(lab, began),
                      lab.gateway.requests(), [])
        _assert_outcome(lab, row, seen)
        _assert_proven(lab)
        assert not row.played or row.played(lab), "the behaviour was not met"
        if lab.asks_doctor:
            lab.moment("", row.cause)
    _assert_stops(lab, row)
    shows = [bool(row.why), bool(row.between), row.gateway.needs_miniupnpd]
    assert row.played or shows.count(True) >= 2 or any(
        note.startswith("odd ") for note in lab.gateway.diary), "the behaviour was not played"
    assert lab.gateway.by_hand() == by_hand
    assert not lab.gateway.was_asked("DeletePortMapping: external port: 9092") or (
        lab.device.messages.count("success - external port: 9092 has been mapped"))
    left = [mapping for mapping in lab.gateway.left() if mapping != NEIGHBOURS]
    return Played(seen.outcome, seen.reachable, seen.longest, seen.requests, left)


def _nothing(_lab: Lab) -> None:
    pass


def _assert_outcome(lab: Lab, row: Row, seen: Played) -> None:
    """The status is the right one, and true: a page comes through on the path it promises."""
    assert seen.outcome == row.outcome, seen
    assert any(row.why in line for line in lab.device.messages.texts()), f"not logged: {row.why}"
    if row.outcome == REACHED:
        record = lab.central.record
        assert record
        pages = pages_from_outside(record.http_port, record.https_port, record.external_ip)
        assert pages == [PAGES[0], PAGES[1] if row.https else None], pages
    elif row.outcome == RELAYED:
        assert page_through_the_tunnel(lab) == PAGES[0]
        assert lab.central.record is None
    if row.outcome in (REACHED, RELAYED):
        assert seen.reachable and seen.reachable <= row.within + _SLACK, seen
    assert seen.longest <= row.longest + _SLACK, seen
    assert seen.requests <= row.most_requests, seen


def _assert_stops(lab: Lab, row: Row) -> None:
    """SIGTERM ends the daemon in time; only what the row names stays behind."""
    began = time.monotonic()
    assert lab.stop_daemon() == "SIGTERM"
    assert (time.monotonic() - began) * CLOCK <= _STOPPED_WITHIN + _SLACK
    assert lab.gateway.left() == sorted([*row.left, NEIGHBOURS])
    assert lab.central.record is None
    assert lab.device.status == "disabled"
    assert daemon.running("pelorus") == []
    _assert_proven(lab)
    _assert_bounds(lab)
    assert_log_is_proper(lab)


def _assert_proven(lab: Lab) -> None:
    """What was published, to the service or the device, had passed its latest port test.

    Only the HTTP port is tested: the HTTPS port goes with it.
    """
    tests = list(zip(lab.central.requests_for(PORT_TEST), lab.central.port_tests, strict=True))
    for request in [*lab.central.requests_for(PORT_FORWARD), *_told_locally(lab)]:
        published = request.argument("external_ip"), request.argument("http_port")
        passed = [test.passed(lab.account) for asked, test in tests
                  if asked.when < request.when and published == (test.address, str(test.port))]
        assert published[0] == "NULL" or passed[-1:] == [True], request.url


def _assert_bounds(lab: Lab) -> None:
    """Every call of the library has ended in time. SIGTERM cuts a search short."""
    stopped = next(message.when for message in lab.device.messages.all if "sigTrap" in message.text)
    for begin, end, seconds in _BOUNDS:
        since: float | None = None
        for message in lab.device.messages.all:
            if begin.search(message.text):
                since = since or message.when
            elif since and end.search(message.text):
                took = (message.when - since) * CLOCK
                assert took <= seconds + _SLACK_IN_CALL, f"{took:.0f} s until {message.text}"
                since = None
        assert since is None or since > stopped, f"no end of {begin.pattern}"


def _told_locally(lab: Lab) -> list[Request]:
    return [request for request in lab.device.local_requests
            if request.path == "/local/port_forward"]


def _reachable(lab: Lab, began: float) -> float | None:
    """When the device was first reachable."""
    return next(((request.when - began) * CLOCK for request in lab.device.local_requests
                 if request.argument("status") in (REACHED, RELAYED)), None)


def _longest(lab: Lab, began: float) -> float:
    """The length of the longest cycle, without its pause."""
    ends = [message for message in lab.device.messages.all if PAUSE in message.text][:CYCLES]
    lengths = [(ends[0].when - began) * CLOCK]
    lengths += [(end.when - before.when) * CLOCK - _pause(before)
                for before, end in pairwise(ends)]
    return max(lengths)


def _pause(message: Message) -> int:
    found = _PAUSE_SECONDS.search(message.text)
    assert found
    return int(found[1])
