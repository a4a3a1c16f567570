"""A service or a name server that fails in every request: bounded, nothing published, recovered."""

from __future__ import annotations

from lab import faults
from lab.central import WAIT
from lab.checks import (FAST, NO_TUNNEL, OPTIONS, PAUSE, asked, assert_log_is_proper,
                        assert_published, assert_stops_clean, wait_for_log, wait_for_status)
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario

_ONE_PORT = {**NO_TUNNEL, "DEFAULT_PORTS_ONLY": "TRUE"}
# A transfer ends after half a second of real time.
_HASTY = Situation(static=_ONE_PORT, clock=FAST, hasty=True)
_MOST_GROWTH = 16 * 1024  # KiB, of which the libraries at their first use take half


@scenario(Situation(static=_ONE_PORT, clock=FAST))
def service_cannot_prove_itself(lab: Lab) -> None:
    """The service's TLS is expired, forged, downgraded or missing: it gets no authorisation."""
    _assert_fails_under(lab, faults.certificate_expired, faults.authority_unknown,
                        faults.tls_outdated, faults.tls_missing)
    assert lab.central.withdrawals == 0
    assert set(asked(lab)) == {WAIT}
    _assert_recovers(lab)


@scenario(_HASTY)
def service_stalls_or_floods(lab: Lab) -> None:
    """The service keeps silent, drips or floods: each request ends in time and in its bounds."""
    _assert_fails_under(lab, faults.service_stalls, faults.service_drips, faults.service_floods)
    _assert_recovers(lab)


@scenario(_HASTY)
def name_server_fails(lab: Lab) -> None:
    """The name server keeps silent, or leads to nobody or to the device itself: as without one."""
    _assert_fails_under(lab, faults.names_time_out, faults.names_lead_nowhere,
                        faults.names_lead_home)
    assert lab.central.requests == []
    _assert_recovers(lab)


def _assert_fails_under(lab: Lab, *causes: faults.Begin) -> None:
    """Under each fault a cycle fails and publishes nothing, and SIGTERM ends the daemon."""
    for cycle, cause in enumerate(causes, 1):
        with cause(lab):
            lab.start_daemon(*OPTIONS)
            idle = lab.daemon.memory("VmHWM")
            wait_for_log(lab, PAUSE, cycle)
            assert lab.daemon.memory("VmHWM") - idle < _MOST_GROWTH
            assert lab.device.status == "failed"
            assert lab.gateway.mappings() == []
            assert lab.stop_daemon() == "SIGTERM"
        assert lab.central.record is None
        assert lab.device.statuses_sent() == ["connecting", "failed", "disabled"] * cycle
        assert_log_is_proper(lab)


def _assert_recovers(lab: Lab) -> None:
    lab.step("the fault is over while the daemon runs")
    with faults.service_gone(lab):
        lab.start_daemon(*OPTIONS)
        wait_for_status(lab, "failed")
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    assert_stops_clean(lab)
