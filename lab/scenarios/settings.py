"""Changes by other programs on the device: credentials, ports, switches, a sleeping disk."""

from __future__ import annotations

import random

from lab import network
from lab.central import PORT_FORWARD, PORT_TEST, WAIT
from lab.checks import (FAST, OPTIONS, PAGES, RELAYED, asked, assert_logged_by_next_cycle,
                        assert_published, assert_stops_clean, pages_from_outside, ports_tested,
                        start, tunnel_client, wait_for_client_end, wait_for_cycle, wait_for_log,
                        wait_for_next_cycle, wait_for_status)
from lab.device import DYNAMIC_COPY, DYNAMIC_FILE
from lab.gateway import NO_PORT, GatewaySetup
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_RUBBISH = random.Random(9091).randbytes(60000)
_IDLE = "Deviceid and DeviceAuth is empty. Idle Process."
_STARTED = "main - pelorus daemon starting up"


@scenario(Situation(clock=FAST))
def disk_asleep(lab: Lab) -> None:
    """A sleeping disk is not woken for a port test, and the device stays port forwarded."""
    start(lab, "portforwarded")
    requests, sent = list(lab.central.requests), list(lab.device.local_requests)

    lab.step("the next port test is due, but the disk is in standby")
    lab.device.disk_sleeps()
    wait_for_log(lab, "drive is in standby, port test is suspended")
    lab.moment("the disk sleeps, so no port is tested, and the device stays port forwarded")

    lab.step("the disk spins up, but has not been used for two minutes")
    lab.device.minutes_since_disk_access(2)
    lab.device.disk_wakes()
    wait_for_log(lab, "sleep count > 1, port testing SKIP.")
    assert (lab.central.requests, lab.device.local_requests) == (requests, sent)

    lab.step("the disk is in use again, so the test is made up for")
    lab.device.minutes_since_disk_access(1)
    lab.wait_for(lambda: len(lab.central.port_tests) == 2, "the second port test", 60)
    wait_for_next_cycle(lab)
    assert lab.device.local_requests == sent
    assert_published(lab)
    lab.moment("the disk is in use, and the ports have been tested again")
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def disk_asleep_at_the_start(lab: Lab) -> None:
    """The first port test of a run wakes the disk, whatever the status was before."""
    lab.device.disk_sleeps()
    for word in ("disabled", "failed", "relayed", "portforwarded"):
        lab.step(f"pelorus starts, the status says {word}")
        lab.device.change(COMMUNICATION_STATUS=word)
        lab.central.port_tests.clear()
        lab.device.local_requests.clear()
        lab.start_daemon(*OPTIONS)
        wait_for_next_cycle(lab)
        assert len(lab.central.port_tests) == 1
        assert_published(lab)
        assert_stops_clean(lab)
        first = ["connecting"] if word == "disabled" else []
        assert lab.device.statuses_sent() == [*first, "portforwarded", "disabled"]
    assert lab.device.messages.count("checkHddStandByMode") == 0


@scenario(Situation(clock=FAST))
def disk_asleep_and_names_wrong(lab: Lab) -> None:
    """Wrong public names justify waking the disk: everything is rebuilt."""
    lab.device.disk_sleeps()
    lab.names.pin(lab.account.names[0], network.SERVICE_ADDRESS)
    start(lab, "portforwarded")

    lab.step("the next cycle finds the names wrong")
    lab.wait_for(lambda: lab.device.statuses_sent().count("portforwarded") == 2,
                 "the device to be published again", 60)
    lab.names.unpin(lab.account.names[0])
    wait_for_next_cycle(lab)
    assert len(lab.central.port_tests) == 2
    assert lab.central.withdrawals == 2
    assert_published(lab)

    lab.step("once nothing is forced, the disk is left asleep")
    wait_for_log(lab, "testPort - hard disk is asleep.")
    assert len(lab.central.port_tests) == 2
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


@scenario(Situation(gateway=GatewaySetup(permissions=NO_PORT), relay=True, clock=RELAYED))
def disk_asleep_while_relayed(lab: Lab) -> None:
    """A sleeping disk keeps a device relayed, until another program says "connecting"."""
    start(lab, "relayed")
    client = tunnel_client()

    lab.step("the gateway maps ports now, but they cannot be tested")
    lab.device.disk_sleeps()
    lab.gateway.become(GatewaySetup())
    wait_for_log(lab, "Skipped port test, unmapped HTTP port 9091, leaving forwardPort()")
    assert lab.gateway.mappings() == []
    assert lab.central.port_tests == []
    assert lab.device.statuses_sent() == ["connecting", "relayed"]
    assert tunnel_client() == client
    lab.moment("the gateway maps ports, but the disk sleeps: no port is tested, the device stays "
               "relayed",
               "disk-asleep")

    lab.step("another program requests a new connection")
    lab.device.change(COMMUNICATION_STATUS="connecting")
    wait_for_status(lab, "portforwarded")
    assert len(lab.central.port_tests) == 1
    assert lab.device.statuses_sent() == ["connecting", "relayed", "portforwarded"]
    wait_for_client_end(client)
    assert_published(lab)
    lab.moment("the disk was woken for a test, and the device is reached directly")
    assert_stops_clean(lab)


@scenario(Situation(dynamic={"DEVICEID": "", "DEVICEAUTH": ""}, clock=FAST))
def credentials_missing(lab: Lab) -> None:
    """Without credentials the daemon idles silently; it starts working as soon as they appear."""
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, _IDLE, 2)
    lab.moment("there are no credentials: the daemon asks nobody anything",
               "credentials-missing")

    lab.step("an identifier without its authorisation is not enough")
    lab.device.change(DEVICEID=lab.account.device_id)
    wait_for_next_cycle(lab, 2)
    assert lab.device.messages.count(_IDLE) >= 3
    assert lab.central.requests == []
    assert lab.gateway.mappings() == []

    lab.step("the device is registered")
    with lab.daemon.held():
        lab.device.change(DEVICEAUTH=lab.account.auth)
        changed = len(lab.device.messages.all)
    wait_for_status(lab, "portforwarded")
    assert_logged_by_next_cycle(lab, changed, "createDirectConnection() - success")
    # The service gets the local address with the record; it is sent alone only at a start.
    assert asked(lab) == [WAIT, PORT_TEST, PORT_FORWARD]
    assert_published(lab)
    assert lab.device.messages.count(_STARTED) == 1
    lab.moment("the device has been registered, and is reached directly")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["disabled", "connecting", "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def internal_ports_change(lab: Lab) -> None:
    """The device's web server moves to other ports; the next port test has them remapped."""
    start(lab, "portforwarded")
    wait_for_cycle(lab, 1)
    requests = len(lab.device.local_requests)

    lab.step("the web server moves from ports 80 and 443 to 8080 and 8443")
    with lab.daemon.held():
        lab.device.serve_on(8080, 8443)
        assert pages_from_outside() == [None, None]
        lab.moment("the web server has moved to other ports than the settings say",
                   "web-server-silent", reach="not-reached")
        lab.device.change(INTERNAL_HTTP_PORT="8080", INTERNAL_HTTPS_PORT="8443")

    lab.step("the port test notices; port 9091 is still held by the old mapping, so 9092 is used")
    lab.wait_for(lambda: lab.device.setting("EXTERNAL_HTTP_PORT") == "9092", "the new port", 60)
    wait_for_status(lab, "portforwarded")
    assert [request.url for request in lab.device.local_requests[requests:]] == [
        "/local/comm_status?status=failed",
        "/local/port_forward?external_ip=44.128.0.20&http_port=9092&https_port=9444"
        "&local_ip=192.168.77.10&internal_port=8080",
        "/local/comm_status?status=portforwarded"]
    assert lab.gateway.mappings() == [Mapping("TCP", 9092, network.DEVICE_ADDRESS, 8080),
                                      Mapping("TCP", 9444, network.DEVICE_ADDRESS, 8443)]
    assert ports_tested(lab) == [9091, 9091, 9091, 9091, 9092]
    assert lab.central.record and lab.central.record.http_port == 9092
    assert pages_from_outside(9092, 9444) == PAGES
    lab.moment("the gateway forwards to the new ports")
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def default_ports_only_later(lab: Lab) -> None:
    """Only 9091 is allowed while 9092 is in use: 9092 closes at once, 9091 opens only later."""
    lab.neighbour.hold(9091, 80)
    others = lab.gateway.mappings()
    lab.start_daemon(*OPTIONS)
    wait_for_cycle(lab, 1)
    assert_published(lab, 9092, others=others)
    requests, sent = list(lab.central.requests), list(lab.device.local_requests)

    lab.step("only the default ports are allowed, and 9091 is free: no search is due yet")
    with lab.daemon.held():
        lab.gateway.lose(9091)
        lab.device.change(DEFAULT_PORTS_ONLY="TRUE")
        changed = len(lab.device.messages.all)
    assert_logged_by_next_cycle(lab, changed, "Skip testing port due to interval")
    # Clients are sent to closed ports until the search; nothing is reported.
    assert lab.gateway.mappings() == []
    assert (lab.central.requests, lab.device.local_requests) == (requests, sent)
    assert lab.central.record and lab.central.record.http_port == 9092
    assert lab.device.status == "portforwarded"

    lab.step("the next search is due")
    lab.wait_for(lambda: lab.device.setting("EXTERNAL_HTTP_PORT") == "9091", "the new port", 60)
    wait_for_next_cycle(lab)
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def rubbish_in_place_of_settings(lab: Lab) -> None:
    """A dynamic configuration that is all rubbish: the daemon idles until it is repaired."""
    proper = DYNAMIC_FILE.read_bytes()
    DYNAMIC_FILE.write_bytes(_RUBBISH)
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, _IDLE, 2)
    assert lab.central.requests == []
    assert lab.gateway.mappings() == []
    lab.moment("the dynamic configuration is rubbish: the daemon idles",
               "credentials-missing")

    lab.step("the configuration is repaired")
    for path in (DYNAMIC_FILE, DYNAMIC_COPY):
        path.write_bytes(proper)
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    assert lab.device.messages.count(_STARTED) == 1
    assert_stops_clean(lab)


@scenario(Situation(clock=FAST))
def rubbish_amid_settings(lab: Lab) -> None:
    """Rubbish among the settings of a running daemon changes nothing."""
    start(lab, "portforwarded")
    wait_for_next_cycle(lab)
    sent = list(lab.device.local_requests)
    proper = DYNAMIC_COPY.read_bytes()
    reloads = lab.device.messages.count("Reload dynamicconfig.ini file.")

    lab.step("another program corrupts the file")
    DYNAMIC_COPY.write_bytes(_RUBBISH + b"\n" + proper)
    wait_for_log(lab, "Reload dynamicconfig.ini file.", reloads + 1)
    wait_for_next_cycle(lab)
    assert lab.device.local_requests == sent
    assert lab.central.withdrawals == 1
    assert_published(lab)
    DYNAMIC_COPY.write_bytes(proper)
    assert_stops_clean(lab)
