"""Waits and checks shared by the scenarios."""

from __future__ import annotations

import signal
from collections.abc import Sequence
from itertools import takewhile

from lab import daemon, network, web
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT, PortTest, Record
from lab.device import DYNAMIC_COPY, HOME
from lab.gateway import GatewaySetup
from lab.packet_filter import Mapping
from lab.scenario import Lab
from lab.support import wait_until

OPTIONS = ("-l", "7", "-f", "30")
# A pause of two minutes takes two seconds.
FAST = 60
# The tunnel comes up in real time, while the ten seconds between the daemon's checks run fast.
RELAYED = 20
# The five minutes spent on trying a tunnel take seven seconds, a pause takes three.
IMPATIENT = 40
# A tunnel that never starts is given up at the first check instead of after five minutes.
NO_TUNNEL = {"STARTCMD": "true"}
TUNNEL_PID_FILE = HOME / "openvpn/openvpn.pid"

# A gateway that only masquerades.
SILENT = GatewaySetup(upnp=False)

# Ports that the user forwards; `forward_by_hand` does it at the gateway.
MANUAL_PORTS = {"MANUAL_PORT_FORWARD": "TRUE", "MANUAL_EXTERNAL_HTTP_PORT": "8081",
                "MANUAL_EXTERNAL_HTTPS_PORT": "8444"}

# Lines of the device's log: the end of a cycle, a skipped port test, a tunnel given up.
PAUSE = "DaemonControl::run - retry connection after "
NOT_DUE = "createDirectConnection() - Ignore Port Test due to Interval"
NOT_RELAYED = "createRelayConnection() - failed to create VPN connection."

_LOCAL0 = 16
_PATIENCE = 60

BOTH_MAPPED = [Mapping("TCP", 9091, network.DEVICE_ADDRESS, 80),
               Mapping("TCP", 9444, network.DEVICE_ADDRESS, 443)]
PUBLISHED = Record(network.GATEWAY_WAN_ADDRESS, network.DEVICE_ADDRESS, 9091, 9444)
PAGES = ["welcome to mynas, over http", "welcome to mynas, over https"]


def forward_by_hand(lab: Lab) -> None:
    """Forward the ports of `MANUAL_PORTS` to the device."""
    lab.gateway.forward_by_hand(8081, 80)
    lab.gateway.forward_by_hand(8444, 443)


def wait_for_status(lab: Lab, status: str) -> None:
    """Wait until the device's configuration has this status."""
    lab.wait_for(lambda: lab.device.status == status, f"status {status}", _PATIENCE)


def wait_for_log(lab: Lab, part: str, count: int = 1) -> None:
    """Wait until the device's log has at least `count` lines with a text."""
    lab.wait_for(lambda: lab.device.messages.count(part) >= count, f"{count} x [{part}]",
                 _PATIENCE)


def wait_for_cycle(lab: Lab, number: int) -> None:
    """Wait for the pause that ends cycle `number`, counted from the daemon's first start."""
    wait_for_log(lab, PAUSE, number)


def start(lab: Lab, status: str, *options: str) -> None:
    """Start the daemon and wait for a status."""
    lab.start_daemon(*OPTIONS, *options)
    wait_for_status(lab, status)


def start_direct(lab: Lab, *options: str) -> None:
    """Start the daemon and wait until it has kept the direct path for one cycle.

    Its pause has then just begun, so it does not notice a change at the gateway half done.
    """
    start(lab, "portforwarded", *options)
    with lab.daemon.held():
        assert_published(lab)
        assert pages_from_outside() == PAGES
    wait_for_cycle(lab, 2)


def wait_for_next_cycle(lab: Lab, cycles: int = 1) -> None:
    """Wait for the end of that many more cycles."""
    wait_for_cycle(lab, lab.device.messages.count(PAUSE) + cycles)


def assert_logged_by_next_cycle(lab: Lab, since: int, part: str) -> None:
    """The log has a text after its first `since` lines, before a second cycle begins."""
    wait_for_log(lab, part)
    lines = lab.device.messages.texts()[since:]
    assert any(part in line for line in lines)
    before = takewhile(lambda line: part not in line, lines)
    assert sum("createConnection() - checking status" in line for line in before) <= 1


def pages_from_outside(http_port: int = 9091, https_port: int = 9444,
                       address: str = network.GATEWAY_WAN_ADDRESS) -> list[str | None]:
    """What a browser on the internet gets from the device through its external ports."""
    return [web.fetch(network.INTERNET, url, seconds=0.5) for url in (
        f"http://{address}:{http_port}/", f"https://{address}:{https_port}/")]


def asked(lab: Lab, since: int = 0) -> list[str]:
    """What the device asked the service for, in order, after the first `since` requests."""
    return [request.path.split("/")[4] for request in lab.central.requests[since:]]


def ports_tested(lab: Lab) -> list[int]:
    """The ports to which the service has connected back, in order."""
    return [test.port for test in lab.central.port_tests]


def tunnel_client() -> int:
    """The pid of the tunnel client, which must be running."""
    client = int(TUNNEL_PID_FILE.read_text())
    assert client in daemon.running("openvpn")
    return client


def wait_for_client_end(client: int) -> None:
    """Wait until a tunnel client has exited, which takes it a while."""
    wait_until(lambda: client not in daemon.running("openvpn"), f"tunnel client {client} to end",
               20)


def page_through_the_tunnel(lab: Lab) -> str | None:
    """The device's page as the relay gets it through the tunnel; None without a client."""
    address = lab.relay.client_address()
    return web.fetch(network.INTERNET, f"http://{address}/", seconds=2) if address else None


def mapping_changes(lab: Lab) -> list[str]:
    """What the gateway began and ceased to forward, in order."""
    return [event.what for event in lab.timeline.events
            if event.who == "gateway" and "forwards TCP" in event.what]


def wait_for_mapping_changes(lab: Lab, changes: Sequence[str], since: int = 0) -> None:
    """Wait until exactly these changes have been seen after the first `since`."""
    lab.wait_for(lambda: mapping_changes(lab)[since:] == list(changes), f"{changes}", 10)


def assert_reported_in_order(lab: Lab) -> None:
    """The service gets, once each: status, withdrawal, permission request, port test, record."""
    device_id, auth, _ = lab.account.secrets
    forward = f"/api/1.0/rest/{PORT_FORWARD}/{device_id}?external_ip="
    assert [(request.scheme, request.url) for request in lab.central.requests] == [
        ("https", f"/api/1.0/rest/{COMM_STATUS}/{device_id}?auth={auth}&local_ip=192.168.77.10"),
        ("https", f"{forward}NULL&local_ip=192.168.77.10&http_port=0&https_port=0&auth={auth}"),
        ("http", f"/api/1.0/rest/{WAIT}/{device_id}"),
        ("https", f"/api/1.0/rest/{PORT_TEST}/{device_id}?external_ip=44.128.0.20&port=9091"
                  f"&protocol=HTTP&auth={auth}"),
        ("https", f"{forward}44.128.0.20&local_ip=192.168.77.10&http_port=9091&https_port=9444"
                  f"&auth={auth}")]
    assert lab.central.port_tests == [PortTest("44.128.0.20", 9091, "HTTP", device_id)]
    assert [request.url for request in lab.device.local_requests] == [
        "/local/comm_status?status=connecting",
        "/local/local_ip?address=192.168.77.10",
        "/local/port_forward_delete?internal_port=80",
        "/local/port_forward?external_ip=44.128.0.20&http_port=9091&https_port=9444"
        "&local_ip=192.168.77.10&internal_port=80",
        "/local/comm_status?status=portforwarded"]


def assert_published(lab: Lab, http_port: int = 9091, https_port: int = 9444,
                     others: Sequence[Mapping] = (), local_ip: str = network.DEVICE_ADDRESS,
                     external_ip: str = network.GATEWAY_WAN_ADDRESS) -> None:
    """Both ports are open at the gateway, in addition to `others`, and published everywhere."""
    internal = [int(lab.device.setting(f"INTERNAL_{kind}_PORT")) for kind in ("HTTP", "HTTPS")]
    assert lab.gateway.mappings() == sorted([
        *(Mapping("TCP", port, local_ip, inside)
          for port, inside in zip((http_port, https_port), internal)), *others])
    assert lab.central.record == Record(external_ip, local_ip, http_port, https_port)
    assert lab.device.setting("EXTERNAL_HTTP_PORT") == str(http_port)
    assert lab.device.setting("EXTERNAL_HTTPS_PORT") == str(https_port)
    assert lab.device.setting("EXTERNAL_IP") == external_ip
    assert lab.device.setting("LOCAL_IP") == local_ip
    assert "COMMUNICATION_STATUS=portforwarded\n" in DYNAMIC_COPY.read_text(errors="replace")
    assert [lab.names.resolve(name) for name in lab.account.names] == [external_ip] * 3


def assert_stops_clean(lab: Lab, number: signal.Signals = signal.SIGTERM,
                       left: Sequence[Mapping] = ()) -> None:
    """One signal ends the daemon, which first removes everything it has set up.

    The mappings in `left` are not its own, or it has lost track of them.
    """
    withdrawals = lab.central.withdrawals
    assert lab.stop_daemon(number) == number.name
    assert lab.gateway.mappings() == list(left)
    assert lab.central.record is None
    assert lab.central.withdrawals == withdrawals + 1
    assert lab.central.requests_for(PORT_FORWARD)[-1].argument("external_ip") == "NULL"
    assert lab.device.status == "disabled"
    assert lab.device.setting("EXTERNAL_HTTP_PORT") == "0"
    assert daemon.running("pelorus") == []
    assert_log_is_proper(lab)


def assert_log_is_proper(lab: Lab) -> None:
    """Every line comes from the daemon and reveals no secret."""
    assert {(message.ident, message.facility) for message in lab.device.messages.all} == {
        ("Pelorus", _LOCAL0)}
    lines = lab.device.messages.texts()
    for secret in lab.account.secrets:
        assert not [line for line in lines if secret in line]
