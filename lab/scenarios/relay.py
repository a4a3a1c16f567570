"""No direct path: the device is reached through the relay, and directly once possible."""

from __future__ import annotations

import os
import signal

from lab import daemon, network, packet_filter, provider
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT, Fault, PortTest
from lab.checks import (BOTH_MAPPED, IMPATIENT, OPTIONS, PAGES, RELAYED, SILENT, TUNNEL_PID_FILE,
                        asked, assert_log_is_proper, assert_published, assert_stops_clean,
                        page_through_the_tunnel, start, start_direct, tunnel_client,
                        wait_for_client_end, wait_for_log, wait_for_next_cycle, wait_for_status)
from lab.clock import refuse_signal
from lab.gateway import NO_PORT, GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_FOLDER = TUNNEL_PID_FILE.parent
_STARTS = _FOLDER / "starts"
_NOT_UP = "openVPNConnection() - openVPN initialization did not complete, waiting..."
_STOPS = "closeVPNConnection() - attempting to stop process with PID"
_KILLS = "closeVPNConnection() - attempting to SIGKILL process with PID"
_DOUBLE_NAT = "testPort - Enforce connection as RELAY (double-NAT detected"

# The usual start command, which also counts.
_COUNTED = {"STARTCMD": "echo start >> starts; env -u LD_PRELOAD openvpn --config client.conf"
                        " --writepid openvpn.pid > openvpn.out 2>&1 &"}

# The gateway keeps reporting the address of its WAN port.
_OTHER_EXIT = f"""
table inet lab {{
    chain other_exit {{
        type nat hook postrouting priority 90;
        oifname "wan" snat ip to {provider.ADDRESS}
    }}
}}
"""


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def no_gateway_protocol(lab: Lab) -> None:
    """A gateway that maps nothing: the device is reached through the relay."""
    client = _start_relayed(lab)
    assert (_FOLDER / "auth.txt").read_text() == "".join(
        f"{line}\n" for line in lab.account.secrets[:2])
    assert lab.central.record is None
    assert asked(lab) == [WAIT, PORT_FORWARD, COMM_STATUS]
    assert lab.central.withdrawals == 1
    assert [lab.names.resolve(name) for name in lab.account.names] == [network.RELAY_ADDRESS] * 3

    lab.step("the next cycle checks the public names and keeps the tunnel")
    requests, sent = list(lab.central.requests), list(lab.device.local_requests)
    wait_for_log(lab, "ConnectionManager::checkDNS - DNS matches local value for device domain "
                      f"names, IP address is {network.RELAY_ADDRESS}")
    wait_for_next_cycle(lab)
    assert (lab.central.requests, lab.device.local_requests) == (requests, sent)
    assert (tunnel_client(), lab.relay.connections()) == (client, 1)
    lab.moment("no protocol opens a port at the gateway, so the device is relayed",
               "no-gateway-protocol")

    lab.step("the tunnel ends with the daemon")
    assert_stops_clean(lab)
    wait_for_client_end(client)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "disabled"]


@scenario(Situation(gateway=GatewaySetup(permissions=NO_PORT), relay=True, clock=RELAYED))
def gateway_gives_in(lab: Lab) -> None:
    """A gateway refuses every port, then gives in: the tunnel ends once the direct path works."""
    client = _start_relayed(lab)
    assert lab.gateway.mappings() == []
    assert lab.central.requests_for(PORT_TEST) == []
    before = len(lab.central.requests)
    lab.moment("the gateway refuses every port, so the device is reached through the relay",
               "gateway-refuses")

    lab.step("the gateway allows ports; the service is slow to publish")
    lab.central.misbehave(PORT_FORWARD, Fault(delay=3, times=1))
    lab.gateway.become(GatewaySetup())
    lab.wait_for(lambda: PORT_FORWARD in asked(lab, before), "the publication", 60)
    assert page_through_the_tunnel(lab) == PAGES[0]
    assert tunnel_client() == client
    assert lab.central.record is None

    lab.step("the direct path is published, the tunnel ends")
    _wait_for_direct(lab, client)
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]
    assert lab.device.messages.count(_STOPS) == 1
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "portforwarded", "disabled"]


@scenario(Situation(gateway=SILENT, relay=True, static=_COUNTED, clock=IMPATIENT))
def relay_down_at_first(lab: Lab) -> None:
    """The relay does not answer: four starts, status failed, nothing left; it is used later."""
    lab.relay.server.stop()
    start(lab, "failed")
    assert _STARTS.read_text().split() == ["start"] * 4
    assert lab.device.messages.count(_NOT_UP) == 28
    assert lab.device.messages.count(_STOPS) == 4
    wait_until(lambda: daemon.running("openvpn") == [], "the last client to end", 20)
    lab.moment("the relay does not answer: four tunnel clients came and went, the status is failed",
               "relay-does-not-come-up")

    lab.step("the relay is back, but the device is sent to a name that nobody knows")
    lab.relay.start()
    _change("relay_servers.offered", network.RELAY_ADDRESS, "relay.kavra.example")
    _wait_for_failed_starts(lab)
    lab.moment("the relay's name is unknown, the status is failed", "relay-unresolved")

    lab.step("the device finds the relay, but expects another name in its certificate")
    _change("relay_servers.offered", "relay.kavra.example", network.RELAY_ADDRESS)
    _change("client.conf", "relay.kavra.example", "other.kavra.example")
    _wait_for_failed_starts(lab)
    lab.moment("the tunnel client does not accept the relay's certificate, the status is failed",
               "relay-certificate")

    lab.step("the device knows the relay")
    _change("client.conf", "other.kavra.example", "relay.kavra.example")
    client = _wait_for_relayed(lab)
    assert_stops_clean(lab)
    wait_for_client_end(client)
    assert lab.device.statuses_sent() == ["connecting", "failed", "relayed", "disabled"]


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def tunnel_client_dies(lab: Lab) -> None:
    """The tunnel client is killed: the next cycle starts another. Then the relay goes away."""
    client = _start_relayed(lab)

    lab.step("the client is killed; until the next cycle the status still says relayed")
    with lab.daemon.held():
        os.kill(client, signal.SIGKILL)
        wait_for_client_end(client)
        assert page_through_the_tunnel(lab) is None
        assert lab.device.status == "relayed"
        lab.moment("the tunnel client was killed, and the daemon has not noticed yet",
                   "tunnel-died")

    lab.step("the next cycle notices and restarts the tunnel")
    wait_for_log(lab, f"isVPNRunning() - unlink stale openVPN pid file {TUNNEL_PID_FILE}")
    wait_for_log(lab, "openVPNConnection() - openVPN has started successfully", 2)
    lab.wait_for(lambda: page_through_the_tunnel(lab) == PAGES[0], "the device's page", 20)
    assert lab.relay.connections() == 2
    second = tunnel_client()
    lab.moment("another tunnel client has been started", "no-gateway-protocol")

    lab.step("the relay goes away; the client runs on, without its interface")
    with lab.daemon.held():
        lab.relay.server.stop()
        wait_until(lambda: "process restarting" in lab.device.tunnel_output().read_text(),
                   "the client to miss the relay", 20)
        assert lab.device.status == "relayed"
        lab.moment("the relay is gone, and the daemon has not noticed yet",
                   "relay-does-not-come-up", reach="not-reached")
    assert_stops_clean(lab)
    wait_for_client_end(second)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "disabled"]


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def tunnel_client_cannot_be_stopped(lab: Lab) -> None:
    """SIGTERM cannot be sent to the tunnel client: after three tries it is killed."""
    client = _start_relayed(lab)

    lab.step("sending SIGTERM fails, and a gateway appears")
    refuse_signal(signal.SIGTERM)
    lab.gateway.become(GatewaySetup())
    _wait_for_direct(lab, client)
    stops = [text for text in lab.device.messages.texts() if _STOPS in text or _KILLS in text]
    assert [_STOPS in text for text in stops] == [True, True, True, False]
    assert all(text.split("PID: ")[1].split()[0] == str(client) for text in stops)
    assert lab.device.messages.count("failed to stop openVPN process with PID") == 3
    refuse_signal(0)
    assert_stops_clean(lab)


@scenario(Situation(gateway=SILENT, relay=True, dynamic={"DEVICEAUTH": "not-its-own"},
                    static=_COUNTED, clock=RELAYED))
def relay_refuses(lab: Lab) -> None:
    """The relay refuses the device's credentials: status failed, nothing is left running."""
    start(lab, "failed")
    assert (_FOLDER / "auth.txt").read_text() == f"{lab.account.device_id}\nnot-its-own\n"
    assert "AUTH_FAILED" in lab.device.tunnel_output().read_text()
    assert _STARTS.read_text().split() == ["start"] * 4
    assert lab.device.messages.count(_NOT_UP) == 28
    assert lab.device.messages.count("not-its-own") == 0
    wait_until(lambda: len(daemon.running("openvpn")) == 1, "only the relay's own process", 20)
    lab.moment("the relay refuses the credentials of the device: the status is failed",
               "relay-refused")
    assert lab.stop_daemon() == "SIGTERM"
    assert lab.device.statuses_sent() == ["connecting", "failed", "disabled"]
    assert_log_is_proper(lab)


@scenario(Situation(relay=True, clock=RELAYED))
def second_nat(lab: Lab) -> None:
    """A second NAT in front of the gateway: relayed after one port test, direct without it."""
    lab.provider.insert()
    client = _start_relayed(lab)
    assert lab.central.port_tests == [PortTest(provider.CUSTOMER_ADDRESS, 9091, "HTTP", "")]
    assert asked(lab) == [COMM_STATUS, PORT_FORWARD, WAIT, PORT_TEST, PORT_FORWARD]
    assert lab.device.messages.count(_DOUBLE_NAT) == 1
    assert lab.gateway.mappings() == []
    lab.moment("the gateway's address belongs to a second NAT, so the device is relayed",
               "second-nat")

    lab.step("the second NAT goes away")
    with lab.daemon.held():
        lab.provider.remove()
    _wait_for_direct(lab, client)
    lab.moment("the second NAT is gone, and the device is reached directly")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "portforwarded", "disabled"]


@scenario(Situation(relay=True, clock=IMPATIENT))
def second_nat_appears(lab: Lab) -> None:
    """A second NAT appears while the device is reached directly: relayed in the next cycle."""
    start_direct(lab)
    before = len(lab.central.requests)

    lab.step("the gateway is put behind a second NAT")
    with lab.daemon.held():
        lab.provider.insert()
    client = _wait_for_relayed(lab)
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]
    assert lab.central.port_tests[-1] == PortTest(provider.CUSTOMER_ADDRESS, 9091, "HTTP", "")
    assert lab.central.record is None
    assert lab.gateway.mappings() == []
    lab.moment("a second NAT has appeared, so the device that was reached directly is relayed",
               "second-nat")

    lab.step("the second NAT goes away")
    with lab.daemon.held():
        lab.provider.remove()
    _wait_for_direct(lab, client)
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "relayed",
                                          "portforwarded", "disabled"]


@scenario(Situation(gateway=GatewaySetup(served_at="192.168.77.2"), relay=True, clock=IMPATIENT))
def address_behind_the_gateways_back(lab: Lab) -> None:
    """The service sees another address than the gateway reports: relayed, a mapping remains."""
    start_direct(lab)
    before = len(lab.central.requests)

    lab.step("the gateway's traffic leaves from another address, nothing gets in through its own")
    with lab.daemon.held():
        network.ip_batch(f"address add {provider.ADDRESS}/24 dev wan", host=network.GATEWAY)
        packet_filter.change(_OTHER_EXIT)
        lab.gateway.block(9091)
    client = _wait_for_relayed(lab)
    with lab.daemon.held():
        assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD]
        assert lab.device.messages.count(_DOUBLE_NAT) == 1
        # The gateway still forwards, but the ports are not published.
        assert lab.gateway.mappings() == BOTH_MAPPED
        assert lab.central.record is None

    lab.step("the next cycle maps and tests the HTTP port again, and removes only that one")
    wait_for_log(lab, "createConnection() - connection type 2 un-changed")
    assert asked(lab, before) == [WAIT, PORT_TEST, PORT_FORWARD, WAIT, PORT_TEST]
    assert lab.gateway.mappings() == BOTH_MAPPED[1:]
    assert tunnel_client() == client
    lab.moment("the service sees another address than the gateway reports, so the device is "
               "relayed",
               "second-nat")

    lab.step("the gateway's own address is back in use")
    lab.gateway.unblock(9091)
    packet_filter.change("delete chain inet lab other_exit\n")
    _wait_for_direct(lab, client)
    assert_stops_clean(lab)


def _wait_for_direct(lab: Lab, client: int) -> None:
    """Wait until the device is reached directly and the tunnel client is gone."""
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    wait_for_client_end(client)


def _change(name: str, old: str, new: str) -> None:
    """Replace a text in a file of the tunnel client."""
    file = _FOLDER / name
    assert old in file.read_text()
    file.write_text(file.read_text().replace(old, new))


def _wait_for_failed_starts(lab: Lab) -> None:
    """Wait until the daemon has given up four more tunnel clients, begun after now."""
    begun = -(-len(_STARTS.read_text().split()) // 4) * 4
    lab.wait_for(lambda: len(_STARTS.read_text().split()) >= begun + 4, "four more starts", 60)
    wait_for_next_cycle(lab)


def _start_relayed(lab: Lab) -> int:
    """Start the daemon and wait until the device is relayed; the tunnel client's pid."""
    lab.start_daemon(*OPTIONS)
    return _wait_for_relayed(lab)


def _wait_for_relayed(lab: Lab) -> int:
    """Wait until a cycle first ends relayed and the page comes through; the client's pid."""
    wait_for_status(lab, "relayed")
    # The status changes before the cycle's last log line.
    wait_for_log(lab, "createConnection() - connection type changed to 2")
    assert page_through_the_tunnel(lab) == PAGES[0]
    return tunnel_client()
