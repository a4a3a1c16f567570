"""A home router that maps nothing: the device is reached through the relay."""

from __future__ import annotations

from pathlib import Path

import pytest
from checks import (OPTIONS, assert_log_is_proper, assert_published, assert_stops_clean,
                    wait_for_log, wait_for_next_cycle, wait_for_status)

from lab import daemon, network, web
from lab.central import PORT_TEST
from lab.gateway import NO_PORT, GatewaySetup
from lab.scenario import Lab, Situation
from lab.support import wait_until

pytestmark = pytest.mark.skipif(not Path("/dev/net/tun").exists(),
                                reason="this machine has no tunnel device")

# The tunnel comes up in real time while the daemon counts ten fast seconds between its looks.
SILENT = Situation(gateway=GatewaySetup(upnp=False), relay=True, clock=10)
REFUSING = Situation(gateway=GatewaySetup(permissions=NO_PORT), relay=True, clock=10)


def page_through_the_tunnel(lab: Lab) -> str | None:
    """The device's page as the relay gets it at the device's end of the tunnel."""
    address = lab.relay.client_address()
    return web.fetch(network.INTERNET, f"http://{address}/", seconds=2) if address else None


def test_no_gateway_protocol_leads_to_the_relay(play):
    lab = play(SILENT)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "relayed", 60)
    assert page_through_the_tunnel(lab) == "welcome to mynas, over http"
    assert Path("/run/device/openvpn/auth.txt").read_text() == "".join(
        f"{line}\n" for line in lab.account.secrets[:2])
    client, = (pid for pid in daemon.running("openvpn")
               if str(pid) == Path("/run/device/openvpn/openvpn.pid").read_text().strip())
    assert lab.central.record is None
    assert lab.central.requests_for(PORT_TEST) == []
    assert [lab.names.resolve(name) for name in lab.account.names] == [network.RELAY_ADDRESS] * 3
    wait_for_log(lab, "ConnectionManager::checkDNS - DNS matches local value for device domain "
                      f"names, IP address is {network.RELAY_ADDRESS}", 60)
    wait_for_next_cycle(lab, 60)
    assert client in daemon.running("openvpn")
    assert_tunnel_stops(lab, client)
    assert lab.device.statuses_told() == ["connecting", "relayed", "disabled"]


def assert_tunnel_stops(lab: Lab, client: int) -> None:
    """SIGTERM ends the daemon by that signal, and the tunnel with it."""
    assert lab.stop_daemon() == "SIGTERM"
    wait_until(lambda: client not in daemon.running("openvpn"), "the tunnel client to end", 10)
    assert not Path("/run/device/openvpn/openvpn.pid").exists()
    assert lab.central.record is None
    assert lab.device.status == "disabled"
    assert daemon.running("pelorus") == []
    assert_log_is_proper(lab)


def test_refusing_gateway_leads_to_the_relay_and_is_used_when_it_gives_in(play):
    lab = play(REFUSING)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "relayed", 60)
    assert lab.gateway.mappings() == []
    assert lab.central.requests_for(PORT_TEST) == []
    assert page_through_the_tunnel(lab) == "welcome to mynas, over http"
    lab.gateway.become(GatewaySetup())
    wait_for_status(lab, "portforwarded", 90)
    assert_published(lab)
    assert lab.device.statuses_told() == ["connecting", "relayed", "portforwarded"]
    lab.wait_for(lambda: lab.relay.client_address() == "" or page_through_the_tunnel(lab) is None,
                 "the tunnel to be down", 10)
    assert_stops_clean(lab)
