"""The home network changes while the device is reached directly."""

from __future__ import annotations

import re

from lab import network
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT
from lab.checks import (BOTH_MAPPED, FAST, OPTIONS, PAGES, PAUSE, SILENT, asked, assert_published,
                        assert_stops_clean, page_through_the_tunnel, pages_from_outside, start,
                        start_direct, wait_for_cycle, wait_for_log, wait_for_mapping_changes,
                        wait_for_next_cycle, wait_for_status)
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_NEW_LAN_ADDRESS, _NEW_WAN_ADDRESS = "192.168.77.30", "44.128.0.30"
_NAMES_MATCH = "ConnectionManager::checkDNS - DNS matches local value"
_SINCE_LAST_TEST = re.compile(r"createDirectConnection - Elapsed time (\d+), portTestInterval 240")


@scenario(Situation(clock=FAST))
def gateway_reboots(lab: Lab) -> None:
    """The gateway reboots at a new address: the next port test fails, the ports are remapped."""
    start_direct(lab)
    before = len(lab.central.requests)

    lab.step("the gateway is switched off")
    with lab.daemon.held():
        network.ip_batch("link set lan down", host=network.GATEWAY)
        # The kernel believes for up to eight seconds that it knows where the gateway is.
        network.ip_batch("neighbour flush dev eth0", host=network.DEVICE)
        lab.moment("the gateway is off, and no cycle has noticed yet", "gateway-off",
                   reach="not-reached")
        network.ip_batch("link set lan up", host=network.GATEWAY)

        lab.step("it comes back without the mappings, at another address and control port")
        lab.gateway.reboot("192.168.77.254")
        assert pages_from_outside() == [None, None]
        lab.moment("the gateway has lost both ports, and no test has noticed yet", "mapping-lost",
                   reach="not-reached")
    lab.wait_for(lambda: lab.device.statuses_sent().count("portforwarded") == 2,
                 "the device to be published again", 60)
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert asked(lab, before) == [WAIT, *[PORT_TEST] * 4, PORT_FORWARD]
    _assert_in_one_cycle(lab, "testPort - port map check failed",
                         "createDirectConnection() - success")
    # The failing test and the search run in the first cycle in which a test is due.
    *_, earlier, at_the_test = _seconds_since_last_test(lab)
    assert earlier <= 240 < at_the_test
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def internet_address_changes(lab: Lab) -> None:
    """The internet address changes: mapped, tested and published again in the next cycle."""
    start_direct(lab, "-d", "300")
    before = len(lab.central.requests)

    lab.step("the provider gives the gateway another address")
    with lab.daemon.held():
        lab.gateway.move_to(_NEW_WAN_ADDRESS)
        lab.moment("the gateway has got another address, and no test has noticed yet",
                   "address-changed", reach="not-reached")
    _wait_for_new_internet_address(lab)
    lab.moment("the device is published at the new address")
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]

    lab.step("the next check of the public names finds nothing wrong")
    wait_for_log(lab, f"{_NAMES_MATCH} for device domain names, IP address is {_NEW_WAN_ADDRESS}")
    assert lab.device.messages.count("ConnectionManager::checkDNS - forceDNSCheck or exceeded") == 2
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def internet_address_changes_before_check(lab: Lab) -> None:
    """The internet address changes just before a check of the names: rebuilt in the same cycle."""
    start_direct(lab, "-d", "60")
    before = len(lab.central.requests)

    lab.step("the provider gives the gateway another address")
    lab.gateway.move_to(_NEW_WAN_ADDRESS)
    _wait_for_new_internet_address(lab)
    assert asked(lab, before) == [PORT_FORWARD, WAIT, PORT_TEST, PORT_FORWARD]
    assert lab.central.withdrawals == 2
    _assert_in_one_cycle(lab, f"DNS IP address is {network.GATEWAY_WAN_ADDRESS}, local value of IP "
                         f"address is {_NEW_WAN_ADDRESS}", "createDirectConnection() - success")
    wait_for_log(lab, f"{_NAMES_MATCH} for device domain names, IP address is {_NEW_WAN_ADDRESS}")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def device_address_changes(lab: Lab) -> None:
    """The device gets a new LAN address: it maps other ports, and the old mappings remain."""
    start_direct(lab)
    _move_device(lab)
    # A gateway in secure mode lets nobody touch mappings to another address, not even to the
    # device's own former one. Whoever gets that address next is reached through the old ports.
    for port in (9091, 9444):
        wait_for_log(lab, f"Router::unmapPort() - fail - failed to unmap external port: {port}")
    assert_published(lab, 9092, 9445, BOTH_MAPPED, local_ip=_NEW_LAN_ADDRESS)
    assert pages_from_outside(9092, 9445) == PAGES
    assert pages_from_outside() == [None, None]
    assert_stops_clean(lab, left=BOTH_MAPPED)


@scenario(Situation(gateway=GatewaySetup(secure=False), clock=FAST))
def device_address_changes_trusting_gateway(lab: Lab) -> None:
    """On a gateway without secure mode the mappings follow the device to its new LAN address."""
    start_direct(lab)
    _move_device(lab)
    assert_published(lab, local_ip=_NEW_LAN_ADDRESS)
    assert pages_from_outside() == PAGES
    assert_stops_clean(lab)


@scenario(Situation(gateway=SILENT, relay=True, clock=FAST))
def relayed_device_address_changes(lab: Lab) -> None:
    """A relayed device gets a new LAN address: it tells the service and the back end."""
    start(lab, "relayed")
    wait_for_next_cycle(lab)
    before, sent = len(lab.central.requests), len(lab.device.local_requests)

    lab.step("the device gets a new LAN address")
    with lab.daemon.held():
        lab.device.move_to(_NEW_LAN_ADDRESS)
    lab.wait_for(lambda: lab.central.local_ip == _NEW_LAN_ADDRESS, "the service to learn it", 60)
    wait_for_next_cycle(lab)
    assert asked(lab, before) == [COMM_STATUS]
    assert [request.url for request in lab.device.local_requests[sent:]] == [
        f"/local/local_ip?address={_NEW_LAN_ADDRESS}"]
    lab.wait_for(lambda: page_through_the_tunnel(lab) == PAGES[0], "the page to come through", 20)
    lab.moment("the device is relayed at its new address", "no-gateway-protocol")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "disabled"]


@scenario(Situation(relay=True, clock=FAST))
def gateway_falls_silent(lab: Lab) -> None:
    """The gateway no longer answers: direct while the ports are open, relayed when they close."""
    lab.start_daemon(*OPTIONS)
    wait_for_cycle(lab, 1)
    before, sent = len(lab.central.requests), len(lab.device.local_requests)

    lab.step("the gateway stops answering: each cycle tests the port, nothing changes")
    with lab.daemon.held():
        lab.device.disk_sleeps()  # these tests run even so
        lab.gateway.fall_silent()
    wait_for_cycle(lab, 3)
    assert lab.device.messages.count("Ports are still open, remaining in Port Forwarded Mode") == 2
    assert asked(lab, before) == [WAIT, PORT_TEST] * 2
    assert [request.argument("external_ip") for request in lab.central.requests_for(PORT_TEST)] \
        == [network.GATEWAY_WAN_ADDRESS, "", ""]
    assert len(lab.device.local_requests) == sent
    wait_for_mapping_changes(lab, [f"forwards {mapping}" for mapping in BOTH_MAPPED])
    # The gateway no longer reports the address, so the last port test's answer is used.
    wait_for_log(lab, "use most recent remote external IP in test port response = 44.128.0.20")
    with lab.daemon.held():
        assert_published(lab)
        assert pages_from_outside() == PAGES
        lab.device.disk_wakes()

        lab.step("the ports close: relayed in the same cycle")
        before = len(lab.central.requests)
        lab.gateway.lose()
    wait_for_status(lab, "relayed")
    assert asked(lab, before) == [WAIT, *[PORT_TEST] * 3, PORT_FORWARD]
    _assert_in_one_cycle(lab, "Port test returned FAIL_TEST", "openVPN has started successfully")
    assert lab.central.record is None
    assert page_through_the_tunnel(lab) == PAGES[0]
    lab.moment("the gateway is silent and has closed the ports, so the device is relayed",
               "no-gateway-protocol")

    lab.step("the gateway answers again: direct in the next cycle")
    before = len(lab.central.requests)
    lab.gateway.become(GatewaySetup())
    wait_for_status(lab, "portforwarded")
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]
    assert_published(lab)
    lab.moment("the gateway answers again, and the device is reached directly")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed", "relayed",
                                          "portforwarded", "disabled"]


def _wait_for_new_internet_address(lab: Lab) -> None:
    """Wait until the device is published at the gateway's new address, through new mappings."""
    lab.wait_for(lambda: lab.central.record and lab.central.record.external_ip == _NEW_WAN_ADDRESS,
                 "a record with the new address", 60)
    wait_for_next_cycle(lab)
    ports = "TCP 9091 -> 192.168.77.10:80", "TCP 9444 -> 192.168.77.10:443"
    wait_for_mapping_changes(lab, [*(f"no longer forwards {port}" for port in ports),
                                   *(f"forwards {port}" for port in ports)], since=2)
    assert_published(lab, external_ip=_NEW_WAN_ADDRESS)
    assert pages_from_outside(address=_NEW_WAN_ADDRESS) == PAGES


def _move_device(lab: Lab) -> None:
    """Give the device a new address, and check that it is reported once."""
    before, sent = len(lab.central.requests), len(lab.device.local_requests)
    lab.step("the device gets a new LAN address")
    with lab.daemon.held():
        lab.device.move_to(_NEW_LAN_ADDRESS)
    lab.wait_for(lambda: lab.device.setting("LOCAL_IP") == _NEW_LAN_ADDRESS,
                 "the back end to learn the new address", 60)
    wait_for_next_cycle(lab)
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]
    assert [request.path for request in lab.device.local_requests[sent:]] == ["/local/port_forward"]
    assert lab.device.status == "portforwarded"


def _seconds_since_last_test(lab: Lab) -> list[int]:
    """For each cycle up to a failed test, how long ago a port test had passed, in device time."""
    found = []
    for text in lab.device.messages.texts():
        elapsed = _SINCE_LAST_TEST.search(text)
        if elapsed:
            found.append(int(elapsed[1]))
        if "testPort - port map check failed" in text:
            break
    return found


def _assert_in_one_cycle(lab: Lab, first: str, then: str) -> None:
    """The daemon did not pause between these two lines of its log."""
    lines = iter(lab.device.messages.texts())
    assert any(first in line for line in lines)
    assert next(line for line in lines if then in line or line.startswith(PAUSE)).count(then) == 1
