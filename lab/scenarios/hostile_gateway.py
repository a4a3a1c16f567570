"""Gateways that attack: the daemon does not hang, fill the memory or ask its own device.

Nor does a back end hold it that stalls.
"""

from __future__ import annotations

import itertools
import re
import time
from collections.abc import Iterable
from dataclasses import replace
from pathlib import Path

from lab import network
from lab.checks import (FAST, NO_TUNNEL, NOT_RELAYED, OPTIONS, PAGES, assert_published,
                        assert_stops_clean, pages_from_outside, start, wait_for_log,
                        wait_for_status)
from lab.gateway import GatewaySetup
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.scripted_gateway import Answer, Call, Entry, Personality, Search, at, numbered

# The daemon's time runs ten times as fast, its time limits and the library's included: a gateway
# that is to be slow for it waits a tenth, and the unit would wait 60 seconds for its end. These are
# in real time.
_TENFOLD = 10
_STOP_SECONDS = 20
# For the search itself, in the daemon's time, and what a busy machine adds.
_SEARCH_SECONDS = 15
_MOST_GROWTH = 32 * 1024  # KiB
_RESIDENT = re.compile(r"^VmHWM:\s+(\d+) kB$", re.MULTILINE)

_CHUNK = b"x" * 65536
_SLOW_AND_UNWILLING = Personality(delay=4 / _TENFOLD, errors={"AddPortMapping": 718})
_INTO_THE_DEVICE = "http://127.0.0.1/local/comm_status?status=ridden"

_ATTACKED = "upnp_discover - List of UPNP devices found"
_NO_GATEWAY = "upnp_discover - invalid device type"
_NO_ADDRESS = "upnp_discover - failed to get External IP address"
_IGNORED = "upnp_discover - gateway ignored, its "
_REFUSED = "Router::mapPort() - fail - failed to map external port"


def _attack(personality: Personality) -> Situation:
    return Situation(gateway=GatewaySetup(personality=personality), static=NO_TUNNEL,
                     clock=_TENFOLD, hasty=True)


def _drip(head: bytes, body: bytes) -> Iterable[bytes]:
    """A byte every two seconds."""
    for letter in head + body:
        yield bytes([letter])
        time.sleep(2 / _TENFOLD)


def _endless_body(_head: bytes, _body: bytes) -> Iterable[bytes]:
    return itertools.chain([b"HTTP/1.1 200 OK\r\n\r\n"], itertools.repeat(_CHUNK))


def _endless_header(_head: bytes, _body: bytes) -> Iterable[bytes]:
    return itertools.chain([b"HTTP/1.1 200 OK\r\nX-Filler: "], itertools.repeat(_CHUNK))


def _many_values(_head: bytes, body: bytes) -> Iterable[bytes]:
    return [b"HTTP/1.1 200 OK\r\n\r\n", b"<a></>" * 700_000, body]


def _silence(_head: bytes, _body: bytes) -> Iterable[bytes]:
    time.sleep(60)
    return []


def _many_devices(search: Search) -> Iterable[bytes]:
    return (search.answer(f"{search.base}/{number}.xml") for number in range(150))


def _endless_copies(search: Search) -> Iterable[bytes]:
    while True:
        yield search.answer()
        time.sleep(1 / _TENFOLD)


def _endless_devices(search: Search) -> Iterable[bytes]:
    return (search.answer(f"{search.base}/{number}.xml") for number in itertools.count())


def _endless_list(call: Call) -> Answer:
    if call.action != "GetGenericPortMappingEntry":
        return call.perform()
    index = int(call.arguments["NewPortMappingIndex"])
    return numbered(Entry(Mapping("UDP", index, network.NEIGHBOUR_ADDRESS, index)))


@scenario(Situation(gateway=GatewaySetup(personality=Personality()), clock=FAST))
def scripted_gateway(lab: Lab) -> None:
    """The lab's own UPnP gateway is as good as another one: it maps both ports."""
    start(lab, "portforwarded")
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert_stops_clean(lab)


@scenario(_attack(Personality(deliver=_drip)))
def hostile_drip(lab: Lab) -> None:
    """The gateway's description comes at a byte in two seconds: it is given up after 30 s."""
    _assert_endures(lab, _NO_GATEWAY, 30, "settling")


@scenario(_attack(Personality()))
def hostile_change(lab: Lab) -> None:
    """The gateway's description drips once the ports are mapped: SIGTERM still removes them."""
    start(lab, "portforwarded")
    lab.moment("the ports are mapped: see what a description that drips changes")
    lab.gateway.behave(Personality(deliver=_drip))
    wait_for_log(lab, _ATTACKED, lab.device.messages.count(_ATTACKED) + 1)
    _assert_stops_in_time(lab)


@scenario(_attack(Personality(deliver_control=_drip)))
def hostile_answers(lab: Lab) -> None:
    """The gateway's answers come at a byte in two seconds: each is given up after 10 s."""
    _assert_endures(lab, _NO_ADDRESS, 30 + 10, "settling")


@scenario(_attack(Personality(deliver=_endless_body)))
def hostile_body(lab: Lab) -> None:
    """The gateway's description has no end: the daemon does not fill up."""
    _assert_endures(lab, _NO_ADDRESS, 30, "no-gateway-protocol")


@scenario(_attack(Personality(deliver=_endless_header)))
def hostile_header(lab: Lab) -> None:
    """The header of the gateway's description has no end: the daemon does not fill up."""
    _assert_endures(lab, _NO_GATEWAY, 30, "no-gateway-protocol")


@scenario(_attack(Personality(deliver_control=_many_values)))
def hostile_values(lab: Lab) -> None:
    """Answers hold 700,000 empty values, for each of which the library keeps 208 bytes."""
    _assert_endures(lab, _NO_ADDRESS, 10, "no-gateway-protocol")


@scenario(_attack(Personality()))
def hostile_names(lab: Lab) -> None:
    """The name server wants TCP and then says nothing: SIGTERM still ends the daemon."""
    asked = lab.names.demand_tcp()
    lab.start_daemon(*OPTIONS)
    lab.wait_for(asked, "a lookup", 10)
    lab.moment("the name server keeps the daemon waiting", "service-unresolved")
    # Waits for as long as the unit would.
    assert lab.stop_daemon() == "SIGTERM"


@scenario(_attack(Personality(search=_many_devices, deliver=_silence)))
def hostile_devices(lab: Lab) -> None:
    """150 devices answer the search and then keep silent: eight of them are asked."""
    by_the_doctor = _assert_endures(lab, _NO_GATEWAY, 30, "settling")
    assert lab.gateway.upnp_requests() - by_the_doctor <= 3 * 8


@scenario(_attack(Personality(search=at(_INTO_THE_DEVICE))))
def hostile_location(lab: Lab) -> None:
    """The gateway's description is said to be on the device itself: nothing is asked there."""
    _assert_endures(lab, _IGNORED + "description", 0, "no-gateway-protocol")


@scenario(_attack(Personality(control_url=_INTO_THE_DEVICE)))
def hostile_control_url(lab: Lab) -> None:
    """The gateway's control service is said to be on the device itself: nothing is asked there."""
    _assert_endures(lab, _IGNORED + "control URL", 0, "no-gateway-protocol")


@scenario(_attack(Personality(search=_endless_copies)))
def hostile_copies(lab: Lab) -> None:
    """The gateway repeats its answer every second: the search ends after 20 s, and finds it."""
    began = time.monotonic()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, _ATTACKED)
    assert (time.monotonic() - began) * _TENFOLD < 20 + _SEARCH_SECONDS
    wait_for_status(lab, "portforwarded")
    _assert_stops_in_time(lab)
    lab.step("SIGTERM during the search")
    lab.start_daemon(*OPTIONS)
    time.sleep(0.5)
    _assert_stops_in_time(lab)


@scenario(_attack(Personality(search=_endless_devices)))
def hostile_flood(lab: Lab) -> None:
    """Answers to the search come without end: the gateway among them is used after all."""
    lab.start_daemon(*OPTIONS)
    idle = _most_memory(lab)
    lab.step("SIGTERM during the flood")
    time.sleep(0.5)
    lab.moment_follows()
    _assert_stops_in_time(lab)
    lab.step("left alone, the daemon makes the device reachable")
    start(lab, "portforwarded")
    assert _most_memory(lab) - idle <= _MOST_GROWTH
    assert_published(lab)
    lab.moment("the gateway has been found amid the flood")
    assert_stops_clean(lab)


@scenario(_attack(_SLOW_AND_UNWILLING))
def hostile_delays(lab: Lab) -> None:
    """Each answer takes four seconds, 300 ports are refused: SIGTERM ends search and clean-up."""
    lab.start_daemon(*OPTIONS)
    idle = _most_memory(lab)
    wait_for_log(lab, _REFUSED, 2)
    lab.moment("each answer takes four seconds, and every port is refused", "gateway-refuses")
    lab.step("SIGTERM during the search; the list of mappings no longer ends")
    lab.gateway.behave(replace(_SLOW_AND_UNWILLING, control=_endless_list))
    _assert_stops_in_time(lab)

    lab.step("a gateway that is only slow is used")
    lab.gateway.behave(Personality(delay=4 / _TENFOLD))
    start(lab, "portforwarded")
    assert _most_memory(lab) - idle <= _MOST_GROWTH
    assert_published(lab)
    _assert_stops_in_time(lab)


@scenario(Situation(clock=_TENFOLD, hasty=True))
def hostile_back_end(lab: Lab) -> None:
    """The device's own back end answers at a byte in four seconds: it gets 30 s."""
    lab.device.answer_slowly(4 / _TENFOLD)
    began = time.monotonic()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, _ATTACKED)
    assert (time.monotonic() - began) * _TENFOLD < 30 + _SEARCH_SECONDS
    lab.moment("the back end answers at a byte in four seconds", "back-end-refuses")
    lab.device.answer_slowly(0)
    _assert_stops_in_time(lab)
    lab.device.keep_silent()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, "failed to get response from localhost")
    lab.moment("the back end hangs", "back-end-silent")
    lab.device.keep_silent(False)
    assert lab.stop_daemon() == "SIGTERM"


def _assert_endures(lab: Lab, reason: str, seconds: int, cause: str) -> int:
    """SIGTERM ends the attacked daemon; left alone it fails in that time, and says why.

    During the attack the doctor must name this cause. Returns its requests to the gateway.
    """
    lab.start_daemon(*OPTIONS)
    idle = _most_memory(lab)
    wait_for_log(lab, _ATTACKED)
    with lab.daemon.held():
        before = lab.gateway.upnp_requests()
        lab.moment("during the attack", cause)
        by_the_doctor = lab.gateway.upnp_requests() - before
    lab.step("SIGTERM during the attack")
    _assert_stops_in_time(lab)

    lab.step("left alone, the daemon gives the gateway up")
    reasons, failures = map(lab.device.messages.count, (reason, NOT_RELAYED))
    began = time.monotonic()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, reason, reasons + 1)
    assert (time.monotonic() - began) * _TENFOLD < seconds + _SEARCH_SECONDS
    wait_for_log(lab, NOT_RELAYED, failures + 1)
    assert _most_memory(lab) - idle <= _MOST_GROWTH
    assert lab.device.status == "failed"
    # Nobody but the daemon itself reports to the device's back end.
    assert set(lab.device.statuses_sent()) == {"connecting", "failed", "disabled"}
    assert_stops_clean(lab)
    return by_the_doctor


def _assert_stops_in_time(lab: Lab) -> None:
    """SIGTERM ends the daemon well before the unit would kill it, and leaves nothing mapped."""
    began = time.monotonic()
    assert lab.stop_daemon() == "SIGTERM"
    assert time.monotonic() - began < _STOP_SECONDS
    assert lab.gateway.mappings() == []
    assert lab.central.record is None
    assert lab.device.status == "disabled"


def _most_memory(lab: Lab) -> int:
    """The most resident memory that the daemon has had, in KiB."""
    found = _RESIDENT.search(Path(f"/proc/{lab.daemon.pid}/status").read_text())
    assert found
    return int(found[1])
