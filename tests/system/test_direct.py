"""A home router that maps ports: the device is reached directly."""

from __future__ import annotations

from checks import (BOTH_MAPPED, OPTIONS, assert_published, assert_stops_clean, wait_for_log,
                    wait_for_next_cycle, wait_for_status)

from lab import network, web
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT, PortTest
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation

UPNP = Situation(gateway=GatewaySetup(upnp=True), clock=20)
# A request waits a quarter of a second for its first answer; a faster clock would starve it.
NATPMP = Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=8)


def assert_told_in_order(lab: Lab) -> None:
    """The service hears: here I am, clean slate, may I, test my port, publish; each once."""
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


def test_upnp_gateway_makes_the_device_reachable(play):
    lab = play(UPNP)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "portforwarded", 30)
    assert_told_in_order(lab)
    assert_published(lab)
    assert_stops_clean(lab)
    assert lab.device.statuses_told() == ["connecting", "portforwarded", "disabled"]


def test_natpmp_gateway_makes_the_device_reachable(play):
    lab = play(NATPMP)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "portforwarded", 30)
    assert_told_in_order(lab)
    assert_published(lab)
    assert lab.device.messages.count("Router::upnp_discover - UPnP Discover failed") > 0
    assert_stops_clean(lab)
    assert lab.device.statuses_told() == ["connecting", "portforwarded", "disabled"]


def test_next_cycle_checks_the_names_and_changes_nothing(play):
    lab = play(UPNP)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "portforwarded", 30)
    requests, told = list(lab.central.requests), list(lab.device.local_requests)
    wait_for_log(lab, "ConnectionManager::checkDNS - DNS matches local value for device domain "
                      "names, IP address is 44.128.0.20", 30)
    wait_for_next_cycle(lab, 30)
    assert (lab.central.requests, lab.device.local_requests) == (requests, told)
    assert lab.gateway.mappings() == BOTH_MAPPED
    assert_stops_clean(lab)


def test_device_page_is_fetched_from_the_internet_through_both_ports(play):
    lab = play(UPNP)
    urls = ["http://44.128.0.20:9091/", "https://44.128.0.20:9444/"]

    def pages() -> list[str | None]:
        return [web.fetch(network.INTERNET, url, seconds=1) for url in urls]

    assert pages() == [None, None]
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "portforwarded", 30)
    assert pages() == ["welcome to mynas, over http", "welcome to mynas, over https"]
    assert_stops_clean(lab)
    assert pages() == [None, None]
