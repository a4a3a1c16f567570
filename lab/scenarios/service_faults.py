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
    _assert_fails_under(lab, (faults.certificate_expired, "service-certificate"),
                        (faults.authority_unknown, "service-certificate"),
                        (faults.tls_outdated, "service-unreachable"),
                        (faults.tls_missing, "service-unreachable"))
    assert lab.central.withdrawals == 0
    assert set(asked(lab)) == {WAIT}
    _assert_recovers(lab)


@scenario(_HASTY)
def service_stalls_or_floods(lab: Lab) -> None:
    """The service keeps silent, drips or floods: each request ends in time and in its bounds."""
    _assert_fails_under(lab, (faults.service_stalls, "service-unreachable"),
                        (faults.service_drips, "service-answers-nonsense"),
                        (faults.service_floods, "service-answers-nonsense"))
    _assert_recovers(lab)


@scenario(_HASTY)
def name_server_fails(lab: Lab) -> None:
    """The name server keeps silent, or leads to nobody or to the device itself: as without one."""
    _assert_fails_under(lab, (faults.names_time_out, "service-unresolved"),
                        (faults.names_lead_nowhere, "service-unreachable"),
                        (faults.names_lead_home, "service-unresolved"))
    assert lab.central.requests == []
    _assert_recovers(lab)


def _assert_fails_under(lab: Lab, *faults_and_causes: tuple[faults.Begin, str]) -> None:
    """Under each fault a cycle fails and publishes nothing, and SIGTERM ends the daemon.

    The doctor must name the cause that stands beside the fault.
    """
    for cycle, (fault, cause) in enumerate(faults_and_causes, 1):
        with fault(lab):
            before = lab.device.messages.count(PAUSE)
            lab.start_daemon(*OPTIONS)
            idle = lab.daemon.memory("VmHWM")
            wait_for_log(lab, PAUSE, before + 1)
            assert lab.daemon.memory("VmHWM") - idle < _MOST_GROWTH
            assert lab.device.status == "failed"
            assert lab.gateway.mappings() == []
            lab.moment(_last_fault(lab), cause)
            assert lab.stop_daemon() == "SIGTERM"
        assert lab.central.record is None
        assert lab.device.statuses_sent() == ["connecting", "failed", "disabled"] * cycle
        assert_log_is_proper(lab)


def _last_fault(lab: Lab) -> str:
    return [event.what for event in lab.timeline.events if event.who == "fault"][-1].rstrip(".")


def _assert_recovers(lab: Lab) -> None:
    lab.step("the fault is over while the daemon runs")
    with faults.service_gone(lab):
        lab.start_daemon(*OPTIONS)
        wait_for_status(lab, "failed")
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    assert_stops_clean(lab)
