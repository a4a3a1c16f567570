"""A device in trouble: the daemon does what it can, and recovers when the trouble is over."""

from __future__ import annotations

import re
from collections.abc import Iterator
from contextlib import contextmanager
from pathlib import Path

from lab import daemon, faults
from lab.central import PORT_TEST
from lab.checks import (BOTH_MAPPED, FAST, IMPATIENT, MANUAL_PORTS, NOT_RELAYED, NO_TUNNEL, OPTIONS,
                        PAGES, PAUSE, RELAYED, SILENT, TUNNEL_PID_FILE, assert_log_is_proper,
                        assert_published, assert_stops_clean, forward_by_hand,
                        page_through_the_tunnel, pages_from_outside, start, start_direct,
                        tunnel_client, wait_for_client_end, wait_for_log, wait_for_next_cycle,
                        wait_for_status)
from lab.device import DYNAMIC_COPY
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import run_tool, wait_until

_NO_RELAY = Situation(static=NO_TUNNEL, clock=FAST)
_WRITES = re.compile(r"O_WRONLY|O_RDWR|O_CREAT|O_TRUNC| (creat|f?truncate|fallocate|(un)?link(at)?|"
                     r"symlink(at)?|rename(at2?)?|mk(dir|nod)(at)?|rmdir|f?l?ch(mod|own)(at)?|"
                     r"utime(s|nsat)?|futimesat|f?l?(set|remove)xattr)\(")
# What the accelerated clock needs in every process.
_OF_THE_LAB = re.compile(r'["<]/dev/(null"|shm/)|"/run/lab/signal_in_gmtime"')
_STOPS = "closeVPNConnection() - attempting to stop process with PID"
_NOT_YET_VALID = "Error: [SSL peer certificate or SSH remote key was not OK]"


@scenario(_NO_RELAY)
def started_oddly(lab: Lab) -> None:
    """Started without open descriptors, with SIGCHLD ignored or in a locale: as always."""
    for through in (faults.CLOSED, faults.NO_SIGCHLD, faults.foreign_locale()):
        lab.step(f"started through {through[-2:]}")
        _start(lab, through)
        assert lab.device.messages.count("unable to check drive status") == 0
        wait_for_next_cycle(lab)
        assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"] * 3


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def started_oddly_while_relayed(lab: Lab) -> None:
    """With SIGCHLD ignored and no open descriptors, a tunnel is started and stopped as always."""
    lab.start_daemon(*OPTIONS, through=(*faults.CLOSED, *faults.NO_SIGCHLD))
    wait_for_status(lab, "relayed")
    assert page_through_the_tunnel(lab) == PAGES[0]
    client = tunnel_client()
    lab.moment("no gateway answers, so the device is relayed", "no-gateway-protocol")
    lab.step("the gateway maps ports: the tunnel ends at the first attempt")
    lab.gateway.become(GatewaySetup())
    wait_for_status(lab, "portforwarded")
    wait_for_client_end(client)
    assert lab.device.messages.count(_STOPS) == 1
    assert lab.device.messages.count("failed to stop openVPN process with PID") == 0
    assert_stops_clean(lab)


@scenario(_NO_RELAY)
def tmp_cannot_be_written(lab: Lab) -> None:
    """/tmp is full or read-only: there is no pid file, and all else is as always."""
    for trouble in (faults.tmp_full, faults.tmp_read_only):
        with trouble(lab):
            _start(lab)
            assert not daemon.PID_FILE.exists() or daemon.PID_FILE.read_text() == ""
            wait_for_next_cycle(lab)
            lab.moment("there is no pid file, and the device is reached all the same")
        assert_stops_clean(lab)
        daemon.PID_FILE.unlink(missing_ok=True)


@scenario(_NO_RELAY)
def copy_cannot_be_written(lab: Lab) -> None:
    """No space for the copy of the settings: it does not start, and leaves no part of a copy."""
    _own_file_system(DYNAMIC_COPY.parent)
    with faults.full(DYNAMIC_COPY.parent):
        lab.start_daemon(*OPTIONS)
        assert wait_until(lab.daemon.ended, "the daemon to end", 10) == "exit 1"
        assert lab.device.messages.count("main - config file failed to load.") == 1
        assert not DYNAMIC_COPY.exists()
        lab.moment("there is no space for the copy of the settings: the daemon has ended",
                   "settings-unreadable")
    assert lab.central.requests == []
    lab.step("there is space again")
    _start(lab)
    assert_stops_clean(lab)


@scenario(Situation(gateway=SILENT, relay=True, clock=IMPATIENT))
def tunnel_files_cannot_be_written(lab: Lab) -> None:
    """No space for the tunnel's credentials and output: failed; relayed once there is some."""
    folder = TUNNEL_PID_FILE.parent
    kept = {path.name: path.read_bytes() for path in folder.iterdir()}
    _own_file_system(folder)
    for name, content in kept.items():
        (folder / name).write_bytes(content)
    with faults.full(folder):
        lab.start_daemon(*OPTIONS)
        wait_for_status(lab, "failed")
        wait_until(lambda: len(daemon.running("openvpn")) == 1, "only the relay's own process", 20)
    lab.moment("there is no space for the tunnel's files: the status is failed",
               "tunnel-files-unwritable")
    lab.step("there is space again")
    wait_for_status(lab, "relayed")
    client = tunnel_client()
    lab.moment("there is space again, and the device is relayed", "no-gateway-protocol")
    assert len(daemon.running("openvpn")) == 2
    assert (folder / "auth.txt").stat().st_mode & 0o777 == 0o600
    assert_stops_clean(lab)
    wait_for_client_end(client)


@scenario(Situation(gateway=SILENT, relay=True, clock=FAST))
def relay_cannot_be_used(lab: Lab) -> None:
    """No openvpn, then no tunnel device: no tunnel comes up, the status is failed."""
    for fault, what, cause in (
            (faults.openvpn_missing, "openvpn is not installed", "relay-client-missing"),
            (faults.tunnel_device_missing, "there is no tunnel device", "tunnel-device-missing")):
        lab.step(what)
        failures = lab.device.messages.count(NOT_RELAYED)
        with fault(lab):
            lab.start_daemon(*OPTIONS)
            wait_for_log(lab, NOT_RELAYED, failures + 1)
            wait_until(lambda: len(daemon.running("openvpn")) == 1, "only the relay's own process",
                       20)
            assert lab.device.status == "failed"
            lab.moment(f"{what}: the status is failed", cause)
            assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "failed", "disabled"] * 2


@scenario(_NO_RELAY)
def log_goes_away(lab: Lab) -> None:
    """Nobody receives the log, at the start and later: all goes on, and the log comes back."""
    with faults.log_gone(lab):
        lab.start_daemon(*OPTIONS)
        wait_for_status(lab, "portforwarded")
    wait_for_next_cycle(lab)
    tests = len(lab.central.requests_for(PORT_TEST))
    with faults.log_gone(lab):
        lab.wait_for(lambda: len(lab.central.requests_for(PORT_TEST)) > tests, "a port test", 60)
    wait_for_next_cycle(lab)
    assert_published(lab)
    assert_stops_clean(lab)


@scenario(_NO_RELAY)
def descriptors_exhausted(lab: Lab) -> None:
    """The daemon can open nothing for two cycles: it recovers by itself."""
    _assert_recovers_from(lab, faults.descriptors_exhausted)


@scenario(_NO_RELAY)
def memory_exhausted(lab: Lab) -> None:
    """The daemon gets no memory for two cycles: it recovers by itself."""
    _assert_recovers_from(lab, faults.memory_exhausted)


@scenario(_NO_RELAY)
def processes_exhausted(lab: Lab) -> None:
    """The daemon can start no process and no thread for two cycles: it recovers by itself."""
    _assert_recovers_from(lab, faults.processes_exhausted)


@scenario(_NO_RELAY)
def cable_unplugged(lab: Lab) -> None:
    """The network interface is down for two cycles: the device is reached again soon after."""
    _assert_recovers_from(lab, faults.cable_unplugged, "no-network")
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


@scenario(_NO_RELAY)
def clock_jumps(lab: Lab) -> None:
    """The clock is a year behind at the start, later ahead: reached once it is right."""
    through = faults.adjustable_clock(lab)
    with faults.clock_behind(lab):
        lab.start_daemon(*OPTIONS, through=through)
        wait_for_log(lab, PAUSE)
        assert lab.device.status == "failed"
        assert lab.device.messages.count(_NOT_YET_VALID) > 0
        assert lab.central.record is None
        lab.moment("the clock is a year behind: certificates are not valid yet, the status is "
                   "failed", "clock-wrong", -faults.YEAR)
    lab.step("the clock is set")
    wait_for_status(lab, "portforwarded")
    wait_for_next_cycle(lab)
    with faults.clock_ahead(lab):
        wait_for_next_cycle(lab, 2)
        assert_published(lab)
        lab.step("the clock is set back")
    wait_for_next_cycle(lab, 2)
    assert_published(lab)
    with faults.host_renamed(lab):
        wait_for_next_cycle(lab)
    assert pages_from_outside() == PAGES
    lab.moment("the clock is right again, and the device is reached directly")
    assert_stops_clean(lab)


@scenario(_NO_RELAY)
def quiet_cycle(lab: Lab) -> None:
    """Cycles in which nothing changes: the kernel sees no file opened for writing, none touched."""
    _assert_touches_nothing(lab, "portforwarded")


@scenario(Situation(gateway=GatewaySetup(upnp=False, natpmp=True), static=NO_TUNNEL, clock=FAST))
def quiet_cycle_with_natpmp(lab: Lab) -> None:
    """The same while a gateway that speaks NAT-PMP forwards the ports."""
    _assert_touches_nothing(lab, "portforwarded")


@scenario(Situation(gateway=SILENT, static=NO_TUNNEL, dynamic=MANUAL_PORTS, clock=FAST))
def quiet_cycle_with_manual_ports(lab: Lab) -> None:
    """The same while the ports are forwarded by hand."""
    forward_by_hand(lab)
    _assert_touches_nothing(lab, "portforwarded")


@scenario(Situation(gateway=SILENT, relay=True, clock=IMPATIENT))
def quiet_cycle_while_relayed(lab: Lab) -> None:
    """The same while no gateway answers and the device is relayed."""
    _assert_touches_nothing(lab, "relayed")


def _assert_touches_nothing(lab: Lab, status: str) -> None:
    """Watch three cycles that begin with this status, with a port test unless it is relayed."""
    start(lab, status)
    wait_for_next_cycle(lab, 2)
    tests = len(lab.central.port_tests)
    with _traced(lab) as calls:
        if status != "relayed":
            lab.wait_for(lambda: len(lab.central.port_tests) > tests, "a port test", 60)
        wait_for_next_cycle(lab, 3)
    seen = calls.read_text().splitlines()
    # It does look at files, its own settings among them.
    assert any(f'"{DYNAMIC_COPY}"' in line for line in seen)
    written = [line for line in seen if _WRITES.search(line) and not _OF_THE_LAB.search(line)]
    assert written == [], written
    assert lab.device.statuses_sent() == ["connecting", status]
    lab.moment(f"nothing changes, and the device stays {status}",
               "no-gateway-protocol" if status == "relayed" else "")
    assert_stops_clean(lab)


def _start(lab: Lab, through: tuple[str, ...] = ()) -> None:
    """Start the daemon, which makes the device reachable."""
    lab.start_daemon(*OPTIONS, through=through)
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    assert lab.gateway.mappings() == BOTH_MAPPED


@contextmanager
def _traced(lab: Lab) -> Iterator[Path]:
    """Record the calls of the daemon and its children that name a file or could change one."""
    calls = Path("/run/lab/calls")
    with faults.traced(lab.daemon.pid, "-o", str(calls), "-y", "-e",
                       "trace=%file,fchmod,fchown,ftruncate,fallocate,futimesat"):
        yield calls


def _own_file_system(folder: Path) -> None:
    run_tool("mount", "-t", "tmpfs", "-o", "mode=770", "lab-small", str(folder))


def _assert_recovers_from(lab: Lab, trouble: faults.Begin, cause: str = "") -> None:
    """The running daemon lives through two cycles of the fault, and then does its work.

    The doctor sees the fault if it has a cause.
    """
    start_direct(lab)
    with trouble(lab) as met:
        lab.device.change(NICKNAME="box")  # has the settings read again
        wait_for_next_cycle(lab, 2)
        lab.wait_for(met, "the daemon to meet the fault", 60)
        assert len(daemon.running("pelorus")) == 1
        if cause:
            lab.moment("while the fault lasts", cause)
    lab.step("the fault is over")
    wait_for_next_cycle(lab, 2)
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    assert pages_from_outside() == PAGES
    assert_log_is_proper(lab)
    lab.moment("the fault is over, and the device is reached directly")
    assert_stops_clean(lab)
