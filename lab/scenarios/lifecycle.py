"""How the daemon starts and ends: on command, by a signal at any moment, by a power cut."""

from __future__ import annotations

import os
import random
import resource
import signal
from collections.abc import Iterator

from lab import daemon, network
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, Fault
from lab.checks import (BOTH_MAPPED, FAST, OPTIONS, PAGES, PUBLISHED, RELAYED, SILENT,
                        TUNNEL_PID_FILE, asked, assert_log_is_proper, assert_published,
                        assert_stops_clean, mapping_changes, page_through_the_tunnel,
                        pages_from_outside, start, tunnel_client, wait_for_client_end,
                        wait_for_cycle, wait_for_log, wait_for_next_cycle, wait_for_status)
from lab.clock import signal_in_gmtime
from lab.packet_filter import Mapping
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_SIGNALS = (signal.SIGTERM, signal.SIGINT, signal.SIGQUIT)
_CYCLE = "createConnection() - checking status"
_TUNNEL_NOT_UP = "openVPN initialization did not complete, waiting..."
_LOOKS_AT_THE_TUNNEL = 4 * 7


@scenario(Situation(clock=FAST))
def unmap_all(lab: Lab) -> None:
    """`pelorus -u` removes what a killed daemon left at the gateway and the service."""
    neighbours = Mapping("TCP", 7000, network.NEIGHBOUR_ADDRESS, 80)
    lab.neighbour.hold(neighbours.external_port, neighbours.internal_port)
    start(lab, "portforwarded")
    lab.moment("the ports are open: see what a daemon killed with kill -9 leaves, and what "
               "pelorus -u removes")

    lab.step("kill -9 leaves everything in place")
    _kill(lab)
    assert lab.gateway.mappings() == [neighbours, *BOTH_MAPPED]
    assert lab.central.record == PUBLISHED
    assert lab.device.status == "portforwarded"
    lab.moment("the daemon was killed with kill -9, and everything is left in place",
               "not-running")
    requests, sent = len(lab.central.requests), len(lab.device.local_requests)

    lab.step("pelorus -u cleans up and exits")
    _clean_up(lab)
    assert lab.gateway.mappings() == [neighbours]
    assert lab.central.record is None
    assert asked(lab, requests) == [COMM_STATUS, PORT_FORWARD]
    assert [request.url for request in lab.device.local_requests[sent:]] == [
        "/local/comm_status?status=disabled",
        "/local/local_ip?address=192.168.77.10",
        "/local/port_forward_delete?internal_port=80"]
    lab.moment("pelorus -u has removed everything", "not-running")

    lab.step("the user switches remote access off: the daemon ends at once")
    lab.device.change(ENABLEREMOTEACCESS="0")
    lab.start_daemon(*OPTIONS)
    assert wait_until(lab.daemon.ended, "the daemon to end", 60) == "exit 0"
    lab.moment("remote access is switched off", "switched-off")


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def unmap_all_while_relayed(lab: Lab) -> None:
    """A tunnel that outlives its daemon keeps working until `pelorus -u` stops it."""
    start(lab, "relayed")
    client = tunnel_client()
    lab.moment("the device is relayed: see what a daemon killed with kill -9 leaves",
               "no-gateway-protocol")
    _kill(lab)
    assert page_through_the_tunnel(lab) == PAGES[0]
    lab.moment("the daemon was killed, and its tunnel still works", "not-running")

    lab.step("pelorus -u cleans up and exits")
    _clean_up(lab)
    wait_for_client_end(client)
    assert not TUNNEL_PID_FILE.exists()


@scenario(Situation(gateway=SILENT, clock=FAST))
def stopped_in_discovery(lab: Lab) -> None:
    """SIGTERM, SIGINT or SIGQUIT during gateway discovery: it ends without trying anything else."""
    # A refusal would end the NAT-PMP search at once.
    lab.gateway.fall_silent()
    for time in _until_each_signal(lab, "during gateway discovery", "no-gateway-protocol"):
        wait_for_log(lab, "setting localIP to: [192.168.77.10]", time)
    assert lab.device.messages.count(_CYCLE) == 0
    assert lab.device.statuses_sent() == ["connecting", "disabled"] * len(_SIGNALS)


@scenario(Situation(clock=FAST))
def stopped_in_a_port_test(lab: Lab) -> None:
    """SIGTERM, SIGINT or SIGQUIT during a slow port test: published after it, then withdrawn."""
    lab.central.misbehave(PORT_TEST, Fault(delay=2))
    for time in _until_each_signal(lab, "while the service tests the port", "settling"):
        lab.wait_for(lambda: len(lab.central.requests_for(PORT_TEST)) == time,
                     "the port test", 60)
        assert lab.gateway.mappings() == BOTH_MAPPED[:1]
    assert len(lab.central.port_tests) == len(_SIGNALS)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded",
                                          "disabled"] * len(_SIGNALS)


@scenario(Situation(clock=FAST))
def stopped_in_a_handshake(lab: Lab) -> None:
    """SIGTERM while OpenSSL holds a lock in a handshake: it ends as at any other time."""
    signal_in_gmtime()
    lab.start_daemon(*OPTIONS)
    assert wait_until(lab.daemon.ended, "the daemon to end", 60) == "SIGTERM"
    assert lab.device.messages.count("sigTrap - Received SIGTERM signal.") == 1
    assert_log_is_proper(lab)
    lab.moment("SIGTERM ended the daemon in a handshake", "not-running")


# When the back end does not accept the ports, the relay is tried while both are mapped.
@scenario(Situation(static={"LOCAL_SETFORWARDURL": "http://127.0.0.1:1/",
                            "STARTCMD": "touch openvpn.out"}, clock=FAST))
def stopped_in_the_relay_start(lab: Lab) -> None:
    """SIGTERM, SIGINT or SIGQUIT while no tunnel comes up: it keeps trying for five minutes."""
    for time in _until_each_signal(lab, "while no tunnel comes up", "publishing-failed"):
        wait_for_log(lab, _TUNNEL_NOT_UP, (time - 1) * _LOOKS_AT_THE_TUNNEL + 1)
        assert lab.gateway.mappings() == BOTH_MAPPED
    assert lab.device.messages.count(_TUNNEL_NOT_UP) == len(_SIGNALS) * _LOOKS_AT_THE_TUNNEL
    assert lab.device.statuses_sent() == ["connecting", "failed", "disabled"] * len(_SIGNALS)


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def stopped_as_the_tunnel_starts(lab: Lab) -> None:
    """SIGTERM while the tunnel client starts: briefly relayed, then everything is torn down."""
    lab.start_daemon(*OPTIONS)
    lab.wait_for(lab.device.tunnel_output().exists, "the client", 60)
    lab.moment("the tunnel client is starting", "no-gateway-protocol")
    lab.step("SIGTERM before the daemon knows that the tunnel is up")
    assert_stops_clean(lab)
    assert lab.relay.connections() == 1
    assert lab.device.statuses_sent() == ["connecting", "relayed", "disabled"]
    assert not TUNNEL_PID_FILE.exists()
    wait_until(lambda: len(daemon.running("openvpn")) == 1, "only the relay's own process", 20)


@scenario(Situation(clock=FAST))
def stopped_in_its_sleep(lab: Lab) -> None:
    """SIGTERM, SIGINT or SIGQUIT between two cycles: it ends without another one."""
    for time in _until_each_signal(lab, "between two cycles", ""):
        wait_for_status(lab, "portforwarded")
        with lab.daemon.held():
            assert_published(lab)
        wait_for_cycle(lab, time)
    assert lab.device.messages.count(_CYCLE) == len(_SIGNALS)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded",
                                          "disabled"] * len(_SIGNALS)


@scenario(Situation(dynamic={"COMMUNICATION_STATUS": "portforwarded"}, clock=FAST))
def power_cut(lab: Lab) -> None:
    """Power is cut at any moment: the next start cleans up and makes the device reachable."""
    lab.start_daemon(*OPTIONS)
    wait_for_next_cycle(lab)
    lines, chance = len(lab.device.messages.all), random.Random(9091)
    for fifth in range(5):
        cut = round((fifth + chance.random()) * lines / 5)
        lab.step(f"power cut in the pause, and again at line {cut} of {lines} after the next start")
        _kill(lab)
        assert pages_from_outside() == PAGES
        end = len(lab.device.messages.all) + cut
        lab.start_daemon(*OPTIONS)
        wait_until(lambda: len(lab.device.messages.all) >= end, f"line {cut}", 60, 0.001)
        _kill(lab)
        # Once the gateway answers this, it has handled every request of the daemon.
        lab.gateway.listing()
        left = lab.gateway.mappings()
        lab.step(f"the power is back; left behind: {', '.join(map(str, left)) or 'no mapping'}")
        lab.start_daemon(*OPTIONS)
        wait_for_next_cycle(lab)
        lab.moment("power was cut twice: this start removed what was left, and mapped the ports "
                   "again")
        with lab.daemon.held():
            assert_published(lab)
            changes = [*(f"no longer forwards {mapping}" for mapping in left),
                       *(f"forwards {mapping}" for mapping in BOTH_MAPPED)]
            wait_until(lambda: mapping_changes(lab)[-len(changes):] == changes,
                       f"the changes {changes}", 5)
    assert_stops_clean(lab)


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def killed_while_relayed(lab: Lab) -> None:
    """The next daemon forgets a killed one's tunnel, which fights the new one until stopped."""
    start(lab, "relayed")
    old = tunnel_client()
    lab.moment("the device is relayed", "no-gateway-protocol")
    _kill(lab)
    assert page_through_the_tunnel(lab) == PAGES[0]

    lab.step("the next daemon starts its own client")
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, "openVPN has started successfully", 2)
    new = tunnel_client()
    assert new != old and old in daemon.running("openvpn")

    # A relay has one tunnel per device: a login disconnects the other client, which reconnects.
    lab.moment("two tunnel clients of one device: the killed daemon's and the new one's",
               "two-tunnels")
    lab.step("the old client is disconnected and reconnects")
    lab.wait_for(lambda: lab.relay.connections() >= 3, "the old client to be back", 60)

    # On SIGTERM it would remove the pid file, and the daemon would forget the new client too.
    lab.step("the old client is stopped by hand, with kill -9")
    os.kill(old, signal.SIGKILL)
    wait_for_client_end(old)
    lab.wait_for(lambda: page_through_the_tunnel(lab) == PAGES[0], "the device's page", 60)
    wait_for_next_cycle(lab)
    assert tunnel_client() == new
    lab.moment("only the new daemon's tunnel client is left", "no-gateway-protocol")
    assert_stops_clean(lab)
    wait_for_client_end(new)


def _until_each_signal(lab: Lab, phase: str, cause: str) -> Iterator[int]:
    """Start the daemon once for each signal, let the caller wait for the phase, and stop it.

    One signal must be enough. Before the first one the doctor must name this cause.
    """
    # SIGQUIT would leave a core file in the machine's root folder.
    resource.setrlimit(resource.RLIMIT_CORE, (0, 0))
    for time, number in enumerate(_SIGNALS, 1):
        lab.step(f"{number.name} {phase}")
        lab.start_daemon(*OPTIONS)
        yield time
        if time == 1:
            lab.moment(f"{phase}, before the signal", cause)
        assert_stops_clean(lab, number)


def _kill(lab: Lab) -> None:
    """Kill the daemon as a power cut would, except that the tunnel client lives on."""
    assert lab.stop_daemon(signal.SIGKILL) == "SIGKILL"


def _clean_up(lab: Lab) -> None:
    """Run `pelorus -u`, which exits by itself and leaves the device reported as disabled."""
    assert wait_until(lab.start_daemon("-u", *OPTIONS).ended, "pelorus -u to end", 60) == "exit 0"
    assert lab.device.status == "disabled"
    assert daemon.running("pelorus") == []
    assert_log_is_proper(lab)
