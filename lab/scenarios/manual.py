"""Ports that the user forwards by hand."""

from __future__ import annotations

from collections.abc import Sequence

from lab import network, provider
from lab.central import MY_IP, PORT_FORWARD, PORT_TEST, PortTest, Record
from lab.checks import (BOTH_MAPPED, FAST, MANUAL_PORTS, NOT_DUE, NOT_RELAYED, NO_TUNNEL, OPTIONS,
                        PAGES, PUBLISHED, SILENT, assert_logged_by_next_cycle, assert_published,
                        assert_stops_clean, forward_by_hand, pages_from_outside, ports_tested,
                        start, wait_for_log, wait_for_next_cycle, wait_for_status)
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_HERE, _ELSEWHERE = network.GATEWAY_WAN_ADDRESS, "44.128.0.30"
_BY_HAND = [Mapping("TCP", 8081, network.DEVICE_ADDRESS, 80),
            Mapping("TCP", 8444, network.DEVICE_ADDRESS, 443)]

_BEGIN, _END = "manualPortForward - allocatedHttpPort", "manualPortForward - localConnectionType"
_DOUBLE_NAT = "Enforce connection as RELAY"
_OTHER_DEVICE = "is different than the Device ID of this unit"

_CLOCK, _INTERVAL = 100, 500


@scenario(Situation(static=NO_TUNNEL, dynamic=MANUAL_PORTS, clock=FAST))
def manual_ports(lab: Lab) -> None:
    """Ports forwarded by hand are tested and published; with a wrong port configured it fails."""
    forward_by_hand(lab)
    start(lab, "portforwarded")
    device_id, auth, _ = lab.account.secrets
    assert [request.url for request in lab.central.requests_for(PORT_TEST)] == [
        f"/api/1.0/rest/{PORT_TEST}/{device_id}?external_ip=&port=8081&protocol=HTTP&auth={auth}"]
    wait_for_log(lab, f"setNetworkAddrs - external IP [{_HERE}], local IP [192.168.77.10]")
    assert lab.device.messages.count("interval duration [720]") == 1
    with lab.daemon.held():
        _assert_published_by_hand(lab)

        lab.step("the device's settings name an HTTP port that is not forwarded")
        lab.device.change(MANUAL_EXTERNAL_HTTP_PORT="8082")
    wait_for_log(lab, NOT_RELAYED)
    assert lab.device.status == "failed"
    assert ports_tested(lab) == [8081, 8082, 8082, 8082]
    assert lab.central.record is None

    lab.step("while it is wrong, every cycle tests it, due or not, even with the disk asleep")
    lab.device.disk_sleeps()
    wait_for_log(lab, NOT_RELAYED, 2)
    assert ports_tested(lab)[1:] == [8082] * 6
    lab.device.disk_wakes()
    lab.moment("the settings name a port that nobody forwards: every cycle tests it, and fails",
               "manual-ports-closed")
    with lab.daemon.held():
        told = lab.default_log_says()
    assert told.cause == "manual-ports-closed", told

    lab.step("the user forwards that port, but to another device")
    with lab.daemon.held():
        lab.neighbour.pretend("0815")
        elsewhere = Mapping("TCP", 8082, network.NEIGHBOUR_ADDRESS, 80)
        lab.gateway.forward_by_hand(8082, 80, network.NEIGHBOUR_ADDRESS)
        answers = lab.device.messages.count(_OTHER_DEVICE)
    wait_for_log(lab, _OTHER_DEVICE, answers + 1)
    wait_for_next_cycle(lab)
    lab.moment("the port leads to another device of this kind", "another-device-answers")

    lab.step("the settings are correct again")
    lab.device.change(MANUAL_EXTERNAL_HTTP_PORT="8081")
    wait_for_status(lab, "portforwarded")
    _assert_published_by_hand(lab, [elsewhere])
    assert lab.device.messages.count(_DOUBLE_NAT) == 0
    lab.moment("the settings name the right ports again, and the device is reached on them")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]
    assert lab.gateway.by_hand() == sorted([*_BY_HAND, elsewhere])


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def manual_ports_that_are_none(lab: Lab) -> None:
    """An invalid manual port stops everything; what was mapped before stays open."""
    lab.gateway.forward_by_hand(65535, 80)
    lab.gateway.forward_by_hand(1, 443)
    start(lab, "portforwarded")

    for http, https, kind in (("0", "1", "HTTP"), ("65536", "1", "HTTP"), ("http", "1", "HTTP"),
                              ("65535", "", "HTTPS")):
        lab.step(f"the user enters the ports '{http}' and '{https}'")
        line = ("ConnectionManager::manualPortForward - bad value for manually configured "
                f"{kind} Port.")
        before = lab.device.messages.texts().count(line)
        failures = lab.device.messages.count(NOT_RELAYED)
        lab.device.change(MANUAL_PORT_FORWARD="TRUE", MANUAL_EXTERNAL_HTTP_PORT=http,
                          MANUAL_EXTERNAL_HTTPS_PORT=https)
        wait_for_log(lab, NOT_RELAYED, failures + 1)
        assert lab.device.messages.texts().count(line) == before + 1
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed"]
    assert ports_tested(lab) == [9091]
    assert lab.central.record is None
    # Switching to the relay withdraws the record but leaves the gateway alone.
    assert lab.gateway.mappings() == BOTH_MAPPED
    lab.moment("a manual port is no port number: nothing is tested, and the old mappings stay open",
               "manual-ports-invalid")

    lab.step("both ports are valid, and the automatic ones are removed")
    lab.device.change(MANUAL_EXTERNAL_HTTPS_PORT="1")
    wait_for_status(lab, "portforwarded")
    assert lab.gateway.mappings() == []
    assert ports_tested(lab) == [9091, 65535]
    assert lab.central.record == Record(_HERE, network.DEVICE_ADDRESS, 65535, 1)
    assert pages_from_outside(65535, 1) == PAGES
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def manual_and_back(lab: Lab) -> None:
    """Automatic ports, manual ones and back: the daemon removes only what it mapped itself."""
    others = [Mapping("TCP", 7000, network.DEVICE_ADDRESS, 80),
              Mapping("TCP", 9092, network.NEIGHBOUR_ADDRESS, 80)]
    # The first belongs to another program on the device.
    network.output(network.DEVICE, "upnpc", "-u", lab.gateway.description_url, "-e", "camera",
                   "-a", network.DEVICE_ADDRESS, "80", "7000", "tcp")
    lab.neighbour.hold(9092, 80)
    start(lab, "portforwarded")
    assert lab.gateway.mappings() == sorted([*BOTH_MAPPED, *others])

    lab.step("the user forwards ports by hand and configures the device")
    with lab.daemon.held():
        forward_by_hand(lab)
        lab.device.change(**MANUAL_PORTS)
        changed = len(lab.device.messages.all)
    _wait_for_port(lab, 8081)
    assert_logged_by_next_cycle(lab, changed, _BEGIN)
    with lab.daemon.held():
        assert lab.gateway.mappings() == others
        _assert_published_by_hand(lab)
        # While the doctor looks, a port test would fall due.
        lab.visit("ports forwarded by hand are in use, and the daemon has removed its own two")

        lab.step("back to automatic, and nothing changes")
        lab.device.change(MANUAL_PORT_FORWARD="FALSE")
        ignored = lab.device.messages.count(NOT_DUE)
    wait_for_log(lab, NOT_DUE, ignored + 1)
    with lab.daemon.held():
        assert lab.gateway.mappings() == others
        _assert_published_by_hand(lab)

        lab.step("the user's ports are gone, and the next test makes the daemon map its own")
        lab.gateway.stop_forwarding_by_hand()
    _wait_for_port(lab, 9091)
    wait_for_status(lab, "portforwarded")
    assert ports_tested(lab) == [9091, 8081, 8081, 8081, 8081, 9091]
    assert lab.gateway.mappings() == sorted([*BOTH_MAPPED, *others])
    assert lab.central.record == PUBLISHED
    assert pages_from_outside() == PAGES
    assert [request.argument("http_port") for request in lab.central.requests_for(PORT_FORWARD)
            ] == ["0", "9091", "8081", "9091"]
    lab.moment("the ports forwarded by hand are gone, and the daemon has mapped its own two again")

    lab.step("stopping leaves the other ports alone")
    assert_stops_clean(lab, left=others)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


# Two discoveries per cycle time out, so it lasts about 280 s.
@scenario(Situation(gateway=SILENT, dynamic=MANUAL_PORTS, clock=_CLOCK))
def manual_without_protocol(lab: Lab) -> None:
    """No mapping protocol: the service is asked for the address at times, a new one published."""
    forward_by_hand(lab)
    start(lab, "portforwarded", "-p", f"{_INTERVAL}")
    _assert_published_by_hand(lab)
    sent = list(lab.device.local_requests)

    lab.step("after the interval the service is asked; the address has not changed")
    wait_for_log(lab, f"NetworkAddrs::getMyIP - external IP address {_HERE}")
    lab.wait_for(lambda: lab.device.messages.count(_BEGIN) == lab.device.messages.count(_END),
                 "the attempt to end", 60)

    lab.step("the provider assigns another address: the ports pass their test there as well")
    lab.gateway.move_to(_ELSEWHERE)
    lab.wait_for(lambda: lab.central.port_tests[-1].address == _ELSEWHERE, "a test there", 60)
    assert lab.device.local_requests == sent

    lab.step("the next request for the address is due, but the service asks to wait a minute")
    lab.central.wait_seconds = 60
    wait_for_log(lab, "NetworkAddrs::getMyIP - wait 60 seconds")
    lab.central.wait_seconds = 0
    wait_for_log(lab, f"setNetworkAddrs - external IP [{_ELSEWHERE}]")
    assert lab.device.messages.texts().count(
        "ConnectionManager::manualPortForward - detected change to external IP "
        f"[{_HERE}] or local IP [192.168.77.10]") == 1
    assert lab.central.record == Record(_ELSEWHERE, network.DEVICE_ADDRESS, 8081, 8444)
    _assert_asked_in_intervals(lab)
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]
    assert lab.gateway.by_hand() == _BY_HAND


@scenario(Situation(static=NO_TUNNEL, dynamic=MANUAL_PORTS, clock=FAST))
def manual_behind_second_nat(lab: Lab) -> None:
    """A second NAT blocks ports forwarded by hand: the test just fails, and passes without it."""
    lab.provider.insert()
    forward_by_hand(lab)
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, NOT_RELAYED)
    assert lab.central.port_tests == [PortTest(provider.ADDRESS, 8081, "HTTP", "")] * 3
    assert lab.device.statuses_sent() == ["connecting", "failed"]
    assert lab.device.messages.count(_DOUBLE_NAT) == 0
    lab.moment("a second NAT blocks the ports that the user forwarded, so their test fails",
               "manual-ports-closed")

    lab.step("the provider's NAT is gone")
    with lab.daemon.held():
        lab.provider.remove()
    wait_for_status(lab, "portforwarded")
    assert lab.central.port_tests[-1] == PortTest(_HERE, 8081, "HTTP", lab.account.device_id)
    _assert_published_by_hand(lab)
    assert_stops_clean(lab)


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def manual_after_second_nat(lab: Lab) -> None:
    """A second NAT found by the automatic test rules out manual ports even after it is gone."""
    lab.provider.insert()
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, NOT_RELAYED)
    assert lab.device.messages.count(_DOUBLE_NAT) == 1

    lab.step("the second NAT goes away, and the user forwards ports by hand: they are not tested")
    with lab.daemon.held():
        lab.provider.remove()
        forward_by_hand(lab)
        lab.device.change(**MANUAL_PORTS)
    wait_for_log(lab, "relay mode is enforced, therefore don't manual forward ports.", 2)
    assert ports_tested(lab) == [9091]
    assert lab.device.status == "failed"
    lab.moment("ports are forwarded by hand, but a second NAT was found earlier: they are not "
               "tested",
               "manual-ruled-out")

    lab.step("only an automatic attempt lifts that")
    lab.device.change(MANUAL_PORT_FORWARD="FALSE")
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    lab.device.change(MANUAL_PORT_FORWARD="TRUE")
    _wait_for_port(lab, 8081)
    _assert_published_by_hand(lab)
    assert_stops_clean(lab)


def _wait_for_port(lab: Lab, http_port: int) -> None:
    lab.wait_for(lambda: lab.device.setting("EXTERNAL_HTTP_PORT") == str(http_port),
                 f"the device to be published on port {http_port}", 60)


def _assert_published_by_hand(lab: Lab, others: Sequence[Mapping] = ()) -> None:
    """The user's ports are published and lead to the device; beside them there are `others`."""
    assert lab.central.record == Record(_HERE, network.DEVICE_ADDRESS, 8081, 8444)
    assert lab.device.setting("EXTERNAL_IP") == _HERE
    assert lab.device.setting("EXTERNAL_HTTP_PORT") == "8081"
    assert lab.device.setting("EXTERNAL_HTTPS_PORT") == "8444"
    assert lab.gateway.by_hand() == sorted([*_BY_HAND, *others])
    assert pages_from_outside(8081, 8444) == PAGES


def _assert_asked_in_intervals(lab: Lab) -> None:
    """Twice, each time an interval or more after the publication or the previous request."""
    published, *_ = lab.central.requests_for(PORT_FORWARD)
    first, second = lab.central.requests_for(MY_IP)
    assert {(asking.scheme, asking.url) for asking in (first, second)} == {
        ("http", "/api/1.0/rest/myip")}
    shortest = min(first.when - published.when, second.when - first.when)
    assert shortest * _CLOCK > _INTERVAL - 2  # the daemon counts whole seconds
