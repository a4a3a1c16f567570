"""Mappings that expire: they are renewed for as long as the daemon runs."""

from __future__ import annotations

import re
import signal
import threading
from collections.abc import Iterator
from contextlib import contextmanager
from dataclasses import dataclass

from lab import network, web
from lab.central import PORT_FORWARD, PortTest
from lab.checks import (BOTH_MAPPED, FAST, OPTIONS, PAGES, asked, assert_log_is_proper,
                        assert_published, assert_stops_clean, mapping_changes, pages_from_outside,
                        start, wait_for_log, wait_for_mapping_changes, wait_for_next_cycle)
from lab.gateway import GatewaySetup
from lab.natpmp import Grant
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_LEASE = 600
_TEN_LEASES = 10 * _LEASE
# Ten leases take 75 seconds; a renewal that is two seconds late still precedes the lease's end.
_CLOCK = 80
_A_WEEK = 7 * 24 * 3600
_TWO_DAYS = 2 * 24 * 3600
_RENEWAL = re.compile(
    r"::renewPortMapping - Renew (?:NAT-PMP )?port mapping PORTFORWARDED (HTTPS?): "
    r"mapPort returncode\[1\], internalPort\[(?:80|443)\], new externalPort\[(\d+)\], "
    r"now\[(\d+)\], previous start\[(\d+)\], previous lifetime\[(\d+)\], new lifetime\[(\d+)\]\.$")


@dataclass(frozen=True)
class _Renewal:
    """A successful renewal as logged, in device time."""

    service: str
    external_port: int
    now: int
    start: int
    lease: int
    asked_lease: int


@scenario(Situation(clock=_CLOCK))
def upnp_leases(lab: Lab) -> None:
    """UPnP mappings are renewed over ten leases; the device is reachable all the time."""
    _start_leasing(lab, _LEASE)
    changes = mapping_changes(lab)

    lab.step("a visitor fetches pages all the time, over ten leases")
    with _visitor():
        _wait_for_renewals(lab, _TEN_LEASES)
    with lab.daemon.held():
        renewals = _renewals(lab)
        _assert_in_time(renewals, {("HTTP", 9091), ("HTTPS", 9444)}, _LEASE, _LEASE)
        # The daemon asks for no lease, which this gateway takes as a week. Each renewal restarts
        # the week and keeps the rule and its name.
        assert mapping_changes(lab) == changes
        assert _descriptions(lab) == ["KavraSSL", "Kavra"]
        assert all(listed.lease > _A_WEEK - _LEASE for listed in lab.gateway.listing())
        gateway_log = lab.gateway.server.log.read_text()
        assert [gateway_log.count(f"updating existing port mapping {port} TCP")
                for port in (9091, 9444)] == [len(renewals) // 2] * 2
    assert_published(lab)
    lab.moment("the lease is short, so the mappings are renewed every few seconds")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), clock=_CLOCK))
def natpmp_leases(lab: Lab) -> None:
    """NAT-PMP mappings are renewed over ten leases, and expire after the daemon is killed."""
    _start_leasing(lab, _LEASE)
    changes = len(mapping_changes(lab))

    lab.step("a visitor fetches pages all the time, over ten leases")
    with _visitor():
        _wait_for_renewals(lab, _TEN_LEASES)
    with lab.daemon.held():
        renewals = _renewals(lab)
        _assert_in_time(renewals, {("HTTP", 9091), ("HTTPS", 9444)}, _LEASE, _LEASE)
        # This gateway replaces a mapping to renew it; an expired one would be gone for longer.
        replaced = [f"{what} {mapping}" for _ in renewals[::2] for mapping in BOTH_MAPPED
                    for what in ("no longer forwards", "forwards")]
        wait_for_mapping_changes(lab, replaced, changes)
    assert_published(lab)
    _assert_end_unrenewed(lab, BOTH_MAPPED)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded"]


_OTHER_PORTS = Grant(port=lambda asked: asked + 1000, lease=_LEASE)


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True, grant=_OTHER_PORTS), clock=FAST))
def natpmp_other_ports(lab: Lab) -> None:
    """A NAT-PMP gateway grants other ports and a short lease: those ports are used and renewed."""
    start(lab, "portforwarded")
    assert_published(lab, 10091, 10444)
    assert lab.central.port_tests == [
        PortTest(network.GATEWAY_WAN_ADDRESS, 10091, "HTTP", lab.account.device_id)]
    assert pages_from_outside(10091, 10444) == PAGES
    assert pages_from_outside() == [None, None]

    lab.step("the daemon asked for two days, but follows the granted lease")
    granted, changes = lab.gateway.mappings(), mapping_changes(lab)
    _wait_for_renewals(lab, _LEASE)
    _assert_in_time(_renewals(lab), {("HTTP", 10091), ("HTTPS", 10444)}, _LEASE, _TWO_DAYS)
    assert mapping_changes(lab) == changes
    assert asked(lab).count(PORT_FORWARD) == 2, "the withdrawal at the start, one publication"
    assert_published(lab, 10091, 10444)
    _assert_end_unrenewed(lab, granted)


@scenario(Situation(clock=FAST))
def renewal_without_name(lab: Lab) -> None:
    """A renewal restores mappings lost in a reboot, but unnamed: they stay open after the end."""
    _start_leasing(lab, 200)
    before = len(lab.central.requests)

    lab.step("the gateway loses the mappings; a renewal is due before the next port test")
    with lab.daemon.held():
        lab.gateway.reboot()
    lab.wait_for(lambda: lab.gateway.mappings() == BOTH_MAPPED, "the mappings to be back", 60)
    wait_for_next_cycle(lab)
    assert PORT_FORWARD not in asked(lab, before)
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert _descriptions(lab) == ["", ""]

    # The shutdown finds its mappings by name. The status is "disabled", but whoever knows the
    # address still gets in until the gateway drops the mappings.
    lab.step("a normal shutdown does not find them")
    assert_stops_clean(lab, left=BOTH_MAPPED)
    assert pages_from_outside() == PAGES

    lab.step("the next start reuses them; this gateway keeps them unnamed, so they stay again")
    start(lab, "portforwarded")
    assert_published(lab)
    assert _descriptions(lab) == ["", ""]
    assert_stops_clean(lab, left=BOTH_MAPPED)
    assert "failed" not in lab.device.statuses_sent()


def _start_leasing(lab: Lab, lease: int) -> None:
    """Start the daemon with a lease, and wait for the end of its second cycle or a later one.

    With a given lease the daemon does not look up its own address before the first cycle. The
    second cycle then takes the address for a new one, and maps, tests and publishes once more.
    """
    lab.start_daemon(*OPTIONS, "-t", str(lease))
    wait_for_log(lab, "Resetting HTTP allocated ports due to external or local IP change: [9091]")
    wait_for_next_cycle(lab)
    forwards = [f"forwards {mapping}" for mapping in BOTH_MAPPED]
    wait_for_mapping_changes(lab, [*forwards, *(f"no longer {change}" for change in forwards),
                                   *forwards])
    assert_published(lab)


@contextmanager
def _visitor() -> Iterator[None]:
    """Fetch both pages from the internet over and over meanwhile; every fetch must succeed."""
    urls = [f"{scheme}://{network.GATEWAY_WAN_ADDRESS}:{port}/"
            for scheme, port in (("http", 9091), ("https", 9444))]
    visits: list[list[str | None]] = []
    leaves = threading.Event()

    def visit() -> None:
        with network.inside(network.INTERNET):
            while not leaves.wait(0.05):
                # A packet lost while a rule is being replaced is sent again after a second.
                visits.append([web.fetch_from_here(url) for url in urls])

    thread = threading.Thread(target=visit)
    thread.start()
    try:
        yield
    finally:
        leaves.set()
        thread.join()
    assert [pages for pages in visits if pages != PAGES] == []
    assert len(visits) > 200


def _renewals(lab: Lab) -> list[_Renewal]:
    """Every successful renewal so far, in order."""
    found = filter(None, map(_RENEWAL.search, lab.device.messages.texts()))
    return [_Renewal(renewal[1], *map(int, renewal.groups()[1:])) for renewal in found]


def _wait_for_renewals(lab: Lab, seconds: int) -> None:
    """Wait until the HTTPS mapping, renewed second, has been kept this long, in device time."""

    def kept() -> int:
        renewals = [renewal for renewal in _renewals(lab) if renewal.service == "HTTPS"]
        return renewals[-1].now - renewals[0].start if renewals else 0

    lab.wait_for(lambda: kept() > seconds, f"renewals over {seconds} s of device time", 110)


def _assert_in_time(renewals: list[_Renewal], ports: set[tuple[str, int]], lease: int,
                    asked_lease: int) -> None:
    """Every renewal came after half of the lease and before its end, for both ports in turn."""
    assert [renewal.service for renewal in renewals] == ["HTTP", "HTTPS"] * (len(renewals) // 2)
    assert {(renewal.service, renewal.external_port) for renewal in renewals} == ports
    assert {(renewal.lease, renewal.asked_lease) for renewal in renewals} == {(lease, asked_lease)}
    late = [renewal for renewal in renewals
            if not lease / 2 < renewal.now - renewal.start < lease]
    assert late == []


def _assert_end_unrenewed(lab: Lab, mappings: list[Mapping]) -> None:
    """Kill the daemon: the gateway keeps the mappings for the rest of their lease, not longer."""
    lab.step("the daemon is killed: the mappings expire with their leases")
    lab.moment_follows()  # to hold the daemon would cost it a lease
    assert lab.stop_daemon(signal.SIGKILL) == "SIGKILL"
    assert lab.gateway.mappings() == mappings
    wait_until(lambda: lab.gateway.mappings() == [], "the leases to end", 30)
    assert_log_is_proper(lab)
    lab.moment("the daemon was killed, and its mappings have expired", "not-running")


def _descriptions(lab: Lab) -> list[str]:
    """The names that the gateway lists for the mappings."""
    return [listed.description for listed in lab.gateway.listing()]
