"""A home router that maps ports: the device is reached directly."""

from __future__ import annotations

import signal
import time
from collections.abc import Callable, Iterable, Sequence

from lab import network
from lab.central import PORT_FORWARD, PORT_TEST, WAIT
from lab.checks import (BOTH_MAPPED, FAST, IMPATIENT, NOT_DUE, OPTIONS, PAGES, asked,
                        assert_published, assert_reported_in_order, assert_stops_clean,
                        page_through_the_tunnel, pages_from_outside, ports_tested, start,
                        start_direct, wait_for_cycle, wait_for_log, wait_for_next_cycle,
                        wait_for_status)
from lab.gateway import STOCK_PERMISSIONS, GatewaySetup
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.scripted_gateway import Answer, Call, Personality, Search

_TAKEN = "is already mapped to another IP: 192.168.77.20"
_REFUSED = "Router::mapPort() - fail - failed to map external port: "
_MAPPED_ANEW = "Resetting HTTP allocated ports due to external or local IP change: [9091]"
_PASSED = "TavikClient::testPort - port map check success."
_FAILED = "TavikClient::testPort - port map check failed."

# Requests to a UPnP gateway. A discovery asks for its description, its state and twice for its
# address. Mappings left by an earlier run, under two names, take two passes each through its list.
_DISCOVERY = 4
_PASSES = 4
# Trying a port takes two requests: who holds it, then the mapping. While nothing is mapped, the
# daemon removes two mappings that do not exist: after a failed search, before each port of the
# extended range, before the first search, and before each search limited to the default ports.
_MAP, _TAKE_BACK = 2, 2
# A search goes three times through 9091 and the 99 ports from 9092 on. After a failed first round
# the last port counts as bad.
_FIRST_SEARCH = 100 * _MAP + 99 * _TAKE_BACK + 2 * (99 * _MAP + 98 * _TAKE_BACK)
_NEXT_SEARCH = 3 * (99 * _MAP + 98 * _TAKE_BACK)


def _telling(address: str) -> Callable[[Call], Answer]:
    def told(call: Call) -> Answer:
        if call.action == "GetExternalIPAddress":
            return 0, {"NewExternalIPAddress": address}
        return call.perform()
    return told


def _late(search: Search) -> Iterable[bytes]:
    time.sleep(0.1)
    yield search.answer()


_ACCESS_POINT = Personality(search=_late, control=_telling("44.128.0.99"), forwards=False)


@scenario(Situation(clock=FAST))
def upnp(lab: Lab) -> None:
    """A UPnP gateway: both ports are mapped, tested, published and reached from the internet."""
    assert pages_from_outside() == [None, None]
    start(lab, "portforwarded")
    assert_reported_in_order(lab)
    _assert_reached(lab)

    lab.step("the next cycle checks the public names and changes nothing")
    requests, sent = list(lab.central.requests), list(lab.device.local_requests)
    wait_for_log(lab, "ConnectionManager::checkDNS - DNS matches local value for device domain "
                      "names, IP address is 44.128.0.20")
    wait_for_cycle(lab, 2)
    assert (lab.central.requests, lab.device.local_requests) == (requests, sent)
    assert lab.gateway.mappings() == BOTH_MAPPED
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]
    assert pages_from_outside() == [None, None]


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=FAST))
def natpmp(lab: Lab) -> None:
    """A gateway that speaks only NAT-PMP works as well as one that speaks UPnP."""
    start(lab, "portforwarded")
    assert_reported_in_order(lab)
    _assert_reached(lab)
    assert lab.device.messages.count("Router::upnp_discover - UPnP Discover failed") > 0
    wait_for_cycle(lab, 1)
    if lab.asks_doctor:
        # The log says that no gateway speaks UPnP. Direct counts once nothing has failed for long.
        from_log = lab.default_log_says()
        assert from_log.cause in {"", "settling"}, from_log
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]


@scenario(Situation(gateway=GatewaySetup(secure=False), clock=FAST))
def ports_taken(lab: Lab) -> None:
    """Another computer holds 9091, then 9444 too: the next ports are used, it keeps its own."""
    lab.neighbour.hold(9091, 80)
    others = lab.gateway.mappings()
    start(lab, "portforwarded")
    _assert_reached(lab, 9092, 9444, others)
    assert_stops_clean(lab, left=others)

    lab.step("it holds 9444 as well, and pelorus starts again")
    lab.neighbour.hold(9444, 443)
    others = lab.gateway.mappings()
    start(lab, "portforwarded")
    _assert_reached(lab, 9092, 9445, others)
    assert ports_tested(lab) == [9092, 9092]
    assert lab.device.messages.count(_TAKEN) == 3
    assert lab.device.messages.count(_REFUSED) == 0
    lab.moment("the neighbour holds ports 9091 and 9444, so the device uses 9092 and 9445")
    assert_stops_clean(lab, left=others)


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=FAST))
def natpmp_port_taken(lab: Lab) -> None:
    """Another computer holds 9091 of a NAT-PMP gateway: the port granted instead is published."""
    lab.neighbour.hold(9091, 80)
    others = lab.gateway.mappings()
    start(lab, "portforwarded")
    _assert_reached(lab, 9092, 9444, others)
    assert ports_tested(lab) == [9092]
    # The gateway chose it: nothing was refused, and nothing had to be requested twice.
    assert lab.device.messages.count("Router::mapPort() - ") == 2
    assert_stops_clean(lab, left=others)


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=FAST))
def natpmp_and_other_programs(lab: Lab) -> None:
    """NAT-PMP removes all ports of a device at once: at the end other programs lose theirs."""
    start(lab, "portforwarded")

    lab.step("another program on the device maps a port; NAT-PMP mappings carry no owner's name")
    network.output(network.DEVICE, "natpmpc", "-g", lab.gateway.lan_address,
                   "-a", "7000", "8000", "tcp", "604800")
    other = Mapping("TCP", 7000, network.DEVICE_ADDRESS, 8000)
    wait_for_next_cycle(lab)
    _assert_reached(lab, others=[other])

    lab.step("stopping removes every mapping to the device, and no other")
    lab.neighbour.hold(7001, 80)
    assert_stops_clean(lab, left=[Mapping("TCP", 7001, network.NEIGHBOUR_ADDRESS, 80)])


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=FAST))
def natpmp_answers_late(lab: Lab) -> None:
    """A slow NAT-PMP gateway answers twice and too late: no answer is mistaken for another."""
    start_direct(lab, "-t", "200")
    requests = lab.gateway.natpmp_requests()

    lab.step("the gateway hangs until it has been asked twice")
    lab.gateway.server.send_signal(signal.SIGSTOP)
    lab.wait_for(lambda: lab.gateway.natpmp_requests() >= requests + 2, "a repetition", 60)
    lab.gateway.server.send_signal(signal.SIGCONT)

    lab.step("the mappings are renewed unchanged, at the same address")
    renewals = lab.device.messages.count("mapPort returncode[1]")
    wait_for_log(lab, "mapPort returncode[1]", renewals + 4)
    assert lab.device.messages.count("does not match the response internal port") == 0
    assert len({text for text in lab.device.messages.texts()
                if "fetched external IP address" in text}) == 1
    _assert_reached(lab)
    assert_stops_clean(lab)


@scenario(Situation(dynamic={"DEFAULT_PORTS_ONLY": "TRUE"}, relay=True, clock=IMPATIENT))
def default_ports_only(lab: Lab) -> None:
    """Only 9091 is allowed, but another computer holds it: no other port is tried, relayed."""
    lab.neighbour.hold(9091, 80)
    others = lab.gateway.mappings()
    lab.start_daemon(*OPTIONS)
    wait_for_cycle(lab, 1)
    # Each pass through the list sees the neighbour's entry, and then the end.
    start = _DISCOVERY + 2 * _PASSES
    attempt = _DISCOVERY + _TAKE_BACK + 3 + _TAKE_BACK
    with lab.daemon.held():
        assert lab.device.messages.count(_TAKEN) == 3
        assert lab.gateway.upnp_requests() == start + attempt
        assert lab.device.status == "relayed"
        assert page_through_the_tunnel(lab) == PAGES[0]

    lab.step("the next cycle asks for the same port again")
    wait_for_cycle(lab, 2)
    assert lab.device.messages.count(_TAKEN) == 6
    assert lab.gateway.upnp_requests() == start + 2 * attempt
    assert lab.gateway.mappings() == others
    assert ports_tested(lab) == []
    lab.moment("another computer holds the only port that is allowed, so the device is relayed",
               "ports-taken")

    lab.step("the port is free, but nothing from the internet comes through it")
    with lab.daemon.held():
        lab.gateway.lose(9091)
        lab.gateway.block(9091)
        failures = lab.device.messages.count(_FAILED)
    wait_for_log(lab, _FAILED, failures + 1)
    wait_for_next_cycle(lab)
    assert set(ports_tested(lab)) == {9091}
    lab.moment("a filter drops what comes to the port, so the device stays relayed",
               "port-filtered")

    lab.step("the provider replaces the router, and its internet address by a shared one")
    with lab.daemon.held():
        lab.gateway.become(GatewaySetup(personality=Personality()))
        lab.provider.insert("100.64.3.9")
        lab.moment("the gateway has got a shared address, and no test has noticed yet",
                   "shared-address")
        lab.gateway.behave(Personality(control=_telling("")))
        lab.moment("the gateway does not tell its address", "gateway-hides-address")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "failed", "relayed", "disabled"]


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True, others=(
    Personality(control=_telling(""), forwards=False),)), clock=FAST))
def natpmp_beside_access_point(lab: Lab) -> None:
    """An access point answers to UPnP and tells no address: the gateway is used, by NAT-PMP."""
    start_direct(lab)
    lab.moment("the access point maps nothing, and need not")
    assert_stops_clean(lab)


@scenario(Situation(gateway=GatewaySetup(others=(_ACCESS_POINT,)), relay=True, clock=FAST))
def access_point_answers(lab: Lab) -> None:
    """An access point answers as a gateway, after the gateway, and tells an address: relayed."""
    start(lab, "relayed")
    lab.moment("the access point is taken for the gateway, so the device is relayed",
               "wrong-gateway-answers")
    assert_stops_clean(lab)


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), relay=True,
                    dynamic={"DEFAULT_PORTS_ONLY": "TRUE"}, clock=IMPATIENT))
def natpmp_port_filtered(lab: Lab) -> None:
    """Nothing comes through the only port that a NAT-PMP gateway may open: relayed."""
    lab.gateway.block(9091)
    start(lab, "relayed")
    wait_for_cycle(lab, 1)
    assert lab.gateway.mappings() == []
    lab.moment("a filter drops what comes to the port, so the device is relayed", "port-filtered")
    if lab.asks_doctor:
        # The log says that no gateway speaks UPnP, and not that one speaks NAT-PMP.
        from_log = lab.default_log_says()
        assert from_log.cause == "port-filtered", from_log
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def port_filtered(lab: Lab) -> None:
    """Port 9091 is filtered on the way from the internet: the second candidate is published."""
    lab.gateway.block(9091)
    lab.start_daemon(*OPTIONS)
    _wait_for_sent(lab, "connecting", "failed", "portforwarded")
    assert ports_tested(lab) == [9091] * 3 + [9092]
    _assert_reached(lab, 9092)
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def forwarding_dies(lab: Lab) -> None:
    """A port is listed but no longer forwarded: the next port replaces it for good."""
    lab.start_daemon(*OPTIONS)
    _wait_for_sent(lab, "connecting", "portforwarded")
    with lab.daemon.held():
        _assert_reached(lab)
        requests, sent = len(lab.central.requests), len(lab.device.local_requests)

        lab.step("nothing comes through port 9091 any more")
        lab.gateway.block(9091)
    _wait_for_sent(lab, "connecting", "portforwarded", "failed", "portforwarded")
    with lab.daemon.held():
        _assert_reached(lab, 9092)
        assert sorted(listed.mapping for listed in lab.gateway.listing()) == lab.gateway.mappings()
        # Three tests of the mapping, three of the same port mapped again, one of the next port.
        assert ports_tested(lab)[1:] == [9091] * 6 + [9092]
        assert asked(lab, requests) == [WAIT, *[PORT_TEST] * 7, PORT_FORWARD]
        assert [request.path for request in lab.device.local_requests[sent:]] == [
            "/local/comm_status", "/local/port_forward", "/local/comm_status"]

        lab.step("port 9091 works again and 9092 does not; 9091 still counts as bad")
        lab.gateway.unblock(9091)
        lab.gateway.block(9092)
    _wait_for_sent(lab, "connecting", *["portforwarded", "failed"] * 2, "portforwarded")
    assert ports_tested(lab)[8:] == [9092] * 6 + [9093]
    _assert_reached(lab, 9093)
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def http_forwarding_lost(lab: Lab) -> None:
    """The gateway loses the HTTP forwarding: the next port test notices, and it is mapped again."""
    start_direct(lab)
    requests, ignored = len(lab.central.requests), lab.device.messages.count(NOT_DUE)
    tests = len(lab.central.port_tests)

    lab.step("the gateway drops port 9091")
    with lab.daemon.held():
        lab.gateway.lose(9091)
        assert pages_from_outside() == [None, PAGES[1]]
        lab.moment("the gateway has dropped a port, and no test has noticed yet", "mapping-lost")
    _wait_for_sent(lab, "connecting", "portforwarded", "failed", "portforwarded")
    # Cycles are two minutes apart, tests four.
    assert lab.device.messages.count(NOT_DUE) - ignored <= 2
    assert ports_tested(lab)[tests:] == [9091] * 4
    assert asked(lab, requests) == [WAIT, *[PORT_TEST] * 4, PORT_FORWARD]
    _assert_reached(lab)
    lab.moment("the port is mapped again")
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def https_forwarding_lost(lab: Lab) -> None:
    """The gateway loses the HTTPS forwarding: unnoticed until the mappings are renewed."""
    start_direct(lab, "-t", "1200")
    # With -t the start asks no gateway, so the second cycle takes the address for a new one.
    assert lab.device.messages.count(_MAPPED_ANEW) == 1
    requests, sent = len(lab.central.requests), len(lab.device.local_requests)

    lab.step("the gateway drops port 9444; the port test checks HTTP only")
    with lab.daemon.held():
        lab.gateway.lose(9444)
    passed = lab.device.messages.count(_PASSED)
    wait_for_log(lab, _PASSED, passed + 1)
    assert lab.gateway.mappings() == BOTH_MAPPED[:1]
    assert pages_from_outside() == [PAGES[0], None]

    lab.step("half of the lease is over")
    lab.wait_for(lambda: lab.gateway.mappings() == BOTH_MAPPED, "the renewal", 60)
    _assert_reached(lab)
    assert set(asked(lab, requests)) == {WAIT, PORT_TEST}
    assert len(lab.device.local_requests) == sent
    # A renewal that recreates the mapping gives it no name, so the shutdown does not find it.
    assert {listed.mapping: listed.description for listed in lab.gateway.listing()} == dict(
        zip(BOTH_MAPPED, ("Kavra", "")))
    assert_stops_clean(lab, left=BOTH_MAPPED[1:])


@scenario(Situation(gateway=GatewaySetup(permissions=STOCK_PERMISSIONS), relay=True,
                    clock=IMPATIENT))
def privileged_ports_refused(lab: Lab) -> None:
    """A gateway refuses to forward to ports below 1024: relayed until the web server moves."""
    lab.start_daemon(*OPTIONS)
    wait_for_cycle(lab, 1)
    start = _DISCOVERY + _PASSES
    attempt = _DISCOVERY + _TAKE_BACK + _FIRST_SEARCH + _TAKE_BACK
    with lab.daemon.held():
        assert lab.device.messages.count(_REFUSED) == 100 + 2 * 99
        assert lab.gateway.upnp_requests() == start + attempt
        assert lab.device.status == "relayed"
        assert page_through_the_tunnel(lab) == PAGES[0]

    lab.step("every cycle searches again")
    wait_for_cycle(lab, 2)
    next_attempt = _DISCOVERY + _NEXT_SEARCH + _TAKE_BACK
    with lab.daemon.held():
        assert lab.device.messages.count(_REFUSED) == 100 + 5 * 99
        assert lab.gateway.upnp_requests() == start + attempt + next_attempt
        assert ports_tested(lab) == []
        lab.moment("the gateway refuses ports below 1024, so every cycle searches, and the device "
                   "is relayed",
                   "gateway-refuses")

        lab.step("the user moves the web server to ports 8080 and 8443")
        lab.device.serve_on(8080, 8443)
        lab.device.change(INTERNAL_HTTP_PORT="8080", INTERNAL_HTTPS_PORT="8443")
    wait_for_status(lab, "portforwarded")
    _assert_reached(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "portforwarded"]
    assert_stops_clean(lab)


def _wait_for_sent(lab: Lab, *statuses: str) -> None:
    """Wait until the local back end has received exactly these status words."""
    lab.wait_for(lambda: lab.device.statuses_sent() == list(statuses), " ".join(statuses), 60)
    wait_for_status(lab, statuses[-1])


def _assert_reached(lab: Lab, http_port: int = 9091, https_port: int = 9444,
                    others: Sequence[Mapping] = ()) -> None:
    """Both ports are published, and the device's pages come through them."""
    assert_published(lab, http_port, https_port, others)
    assert pages_from_outside(http_port, https_port) == PAGES
