"""A device that is itself the maker's router."""

from __future__ import annotations

from lab import network
from lab.central import COMM_STATUS, PORT_TEST, Fault, PortTest, Record
from lab.checks import (BOTH_MAPPED, FAST, NOT_RELAYED, NO_TUNNEL, OPTIONS, PAGES, PUBLISHED,
                        assert_stops_clean, pages_from_outside, start, wait_for_log,
                        wait_for_next_cycle, wait_for_status)
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_TYPE = {"DEVICETYPE": "5"}
_HERE = network.GATEWAY_WAN_ADDRESS

_LIST = "tavik_helper.sh list"
_ADDRESSES = ["getip.sh wan", "getip.sh lan"]
_OFFLINE = ("Router::initIpAddrBrenvik - Not connected to internet. "
            "Please check network connectivity.")
_ERROR = 3
# The clean-up at a start, which ends with a withdrawal that needs the local address.
_START = [_LIST, *_ADDRESSES]


# In real time, so that the pause after each removal shows.
@scenario(Situation(own_router=True, static=_TYPE))
def own_router(lab: Lab) -> None:
    """The device is itself the home router: it opens its own ports and closes them at the end."""
    assert pages_from_outside() == [None, None]
    start(lab, "portforwarded")
    _assert_own_ports_published(lab)
    assert lab.own_router.calls() == [
        *_START, *_ADDRESSES, _LIST, _LIST, _add(9091, 80, "Kavra"),
        _LIST, _LIST, _add(9444, 443, "KavraSSL")]
    # The service learns the local address with the record, not before.
    assert lab.central.requests_for(COMM_STATUS) == []
    assert lab.central.port_tests == [PortTest(_HERE, 9091, "HTTP", lab.account.device_id)]

    lab.step("stopping removes both, and pauses a second after each")
    before = len(lab.own_router.calls())
    assert_stops_clean(lab)
    assert lab.own_router.calls()[before:] == [_LIST, _remove(9091, 80), _remove(9444, 443)]
    assert (lab.own_router.mappings(), lab.own_router.entries()) == ([], [])
    _assert_pauses_after_removals(lab)
    assert pages_from_outside() == [None, None]


@scenario(Situation(own_router=True, static=_TYPE, clock=FAST))
def own_router_predefined(lab: Lab) -> None:
    """The router already forwards ports to the device: the first HTTP port that works is used."""
    for first, last, internal_port in ((2222, 2223, 22), (8080, 8081, 80), (8443, 8443, 443)):
        lab.own_router.predefine(first, last, internal_port)
    forwards, entries = lab.own_router.mappings(), lab.own_router.entries()
    # Start and end try to remove the first port of each; the router keeps pre-defined ports.
    in_vain = [_LIST, _remove(2222, 22), _remove(8080, 80), _remove(8443, 443)]
    lab.central.misbehave(PORT_TEST, Fault(drop=True, times=3))
    start(lab, "portforwarded")
    assert [request.argument("port") for request in lab.central.requests_for(PORT_TEST)] == [
        *["8080"] * 3, "8081"]
    calls = lab.own_router.calls()
    assert calls == [*_START, *in_vain[1:], *_ADDRESSES, _LIST, _LIST]
    before = len(calls)
    assert lab.central.record == Record(_HERE, network.DEVICE_ADDRESS, 8081, 8443)
    assert pages_from_outside(8081, 8443) == PAGES

    lab.step("the ports are kept and tested again, without reading the list")
    lab.wait_for(lambda: len(lab.central.port_tests) == 2, "another port test", 60)
    wait_for_next_cycle(lab)
    calls = lab.own_router.calls()[before:]
    assert calls == _ADDRESSES * (len(calls) // 2)
    assert (lab.own_router.mappings(), lab.own_router.entries()) == (forwards, entries)

    lab.step("stopping leaves them in place")
    assert_stops_clean(lab)
    assert lab.own_router.calls()[-len(in_vain):] == in_vain
    assert (lab.own_router.mappings(), lab.own_router.entries()) == (forwards, entries)
    assert lab.device.statuses_sent() == ["connecting", "failed", "portforwarded", "disabled"]


@scenario(Situation(own_router=True, static=_TYPE, clock=FAST))
def own_router_port_taken(lab: Lab) -> None:
    """Another LAN device holds the router's ports 9091 and 9444: the next ones are used."""
    for port, internal_port in ((9091, 80), (9444, 443)):
        lab.own_router.predefine(port, port, internal_port, "OTHER", network.NEIGHBOUR_ADDRESS)
    foreign, entries = lab.own_router.mappings(), lab.own_router.entries()
    start(lab, "portforwarded")
    own = [Mapping("TCP", 9092, network.DEVICE_ADDRESS, 80),
           Mapping("TCP", 9445, network.DEVICE_ADDRESS, 443)]
    assert lab.own_router.mappings() == sorted([*foreign, *own])
    assert lab.central.record == Record(_HERE, network.DEVICE_ADDRESS, 9092, 9445)
    assert pages_from_outside(9092, 9445) == PAGES
    assert _changes(lab) == [_add(9092, 80, "Kavra"), _add(9445, 443, "KavraSSL")]

    lab.step("stopping leaves the other device its ports")
    assert_stops_clean(lab)
    assert _changes(lab)[2:] == [_remove(9092, 80), _remove(9445, 443)]
    assert (lab.own_router.mappings(), lab.own_router.entries()) == (foreign, entries)


@scenario(Situation(own_router=True, static={**_TYPE, **NO_TUNNEL}, clock=FAST))
def own_router_offline(lab: Lab) -> None:
    """The router has no internet address, gets one, loses it: failed, forwarded, failed."""
    lab.own_router.go_offline()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, NOT_RELAYED)
    assert lab.device.statuses_sent() == ["connecting", "failed"]
    # Once for the clean-up, once for the attempt.
    assert [message.severity for message in lab.device.messages.all
            if message.text == _OFFLINE] == [_ERROR, _ERROR]
    assert lab.own_router.calls() == [*_START, *_ADDRESSES]
    assert lab.central.port_tests == []

    lab.step("the router gets an address")
    lab.own_router.go_online()
    wait_for_status(lab, "portforwarded")
    _assert_own_ports_published(lab)

    lab.step("it loses the address: what the daemon opened is closed and withdrawn")
    lab.own_router.go_offline()
    wait_for_log(lab, NOT_RELAYED, 2)
    assert lab.device.status == "failed"
    assert _changes(lab)[2:] == [_remove(9091, 80), _remove(9444, 443)]
    assert lab.own_router.mappings() == []
    assert lab.central.record is None
    lab.moment("the router has lost its internet address, so its ports are closed",
               "gateway-without-address")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "failed", "portforwarded", "failed",
                                          "disabled"]


@scenario(Situation(own_router=True, static=_TYPE, clock=FAST))
def own_router_disk_asleep(lab: Lab) -> None:
    """On the maker's router a disk in standby delays a port test, a long time unused does not."""
    lab.device.minutes_since_disk_access(99)
    start(lab, "portforwarded")

    lab.step("the next port test is due, but the disk is in standby")
    lab.device.disk_sleeps()
    wait_for_log(lab, "testPort - hard disk is asleep.")
    assert len(lab.central.port_tests) == 1

    lab.step("the disk spins up, though unused for long: the test is made up for")
    lab.device.disk_wakes()
    lab.wait_for(lambda: len(lab.central.port_tests) == 2, "the second port test", 60)
    assert lab.device.messages.count("checking sleep count") == 0
    _assert_own_ports_published(lab)
    assert_stops_clean(lab)


def _assert_own_ports_published(lab: Lab) -> None:
    """Both ports are open at the device itself and published everywhere."""
    assert lab.own_router.mappings() == BOTH_MAPPED
    assert lab.central.record == PUBLISHED
    assert lab.device.setting("EXTERNAL_IP") == _HERE
    assert [lab.names.resolve(name) for name in lab.account.names] == [_HERE] * 3
    assert pages_from_outside() == PAGES


def _assert_pauses_after_removals(lab: Lab) -> None:
    """A second after each of the two; how soon the lab notices a removal varies."""
    removed = [event.when for event in lab.timeline.events
               if event.who == "router" and event.what.startswith("no longer forwards")]
    withdrawn = [event.when for event in lab.timeline.events
                 if event.what.startswith("mapping withdrawn")][-1]
    first, second = removed
    assert min(second - first, withdrawn - second) > 0.5


def _add(port: int, internal_port: int, description: str) -> str:
    return f"tavik_helper.sh add TCP,{port},192.168.77.10,{internal_port},{description}"


def _remove(port: int, internal_port: int) -> str:
    return f"tavik_helper.sh remove TCP,{port},192.168.77.10,{internal_port}"


def _changes(lab: Lab) -> list[str]:
    """What the router was asked to add and to remove, in order."""
    return [call for call in lab.own_router.calls()
            if call.startswith(("tavik_helper.sh add", "tavik_helper.sh remove"))]
