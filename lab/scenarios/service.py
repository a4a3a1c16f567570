"""A central service and a name server that make the device wait, fail, or answer wrongly."""

from __future__ import annotations

import re

from lab import daemon, network
from lab.account import SERVICE_HOST
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT, Fault
from lab.checks import (BOTH_MAPPED, FAST, IMPATIENT, NOT_DUE, NOT_RELAYED, NO_TUNNEL, OPTIONS,
                        PAGES, PAUSE, PUBLISHED, RELAYED, SILENT, asked, assert_published,
                        assert_stops_clean, pages_from_outside, ports_tested, start, wait_for_cycle,
                        wait_for_log, wait_for_next_cycle, wait_for_status)
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_NO_RELAY = Situation(static=NO_TUNNEL, clock=FAST)
_ELSEWHERE = "44.128.0.99"
_LONGEST_ANSWER = 10238
# Three candidate ports, three tries each.
_TRIES = 9
_HERE = network.GATEWAY_WAN_ADDRESS

_CHECK = "ConnectionManager::checkDNS - "
_TORN_DOWN = "nslookup failed or does not match local value, kill existing connections."
_PROCEED = "Therefore using sleep time 0 secs."
_UNCLEAR = {
    "": f"failed to get response from central server. {_PROCEED}",
    "<wait_time>300</wait_time>": f"missing action from central server. {_PROCEED}",
    "<wait_time>300</wait_time><action>wait</action>":
        f"malformed wait_time from central server. {_PROCEED}",
    "<action>wait</action><wait_time>soon</wait_time>":
        f"received garbage sleep time from central server. {_PROCEED}",
    "<action>wait</action><wait_time>-300</wait_time>":
        f"received garbage sleep time from central server. {_PROCEED}",
    "<action>wait</action><wait_time>0</wait_time>": "sleep time from server is 0 secs.",
}


@scenario(Situation(clock=FAST))
def service_says_wait(lab: Lab) -> None:
    """The service says wait: no test, no relay; then proceed: forwarded; wait again: kept."""
    lab.central.wait_seconds = 300
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, f"{PAUSE}300 secs.")
    lab.moment("the service says wait: nothing is mapped or tested, and no tunnel is started",
               "service-asks-to-wait")
    lab.central.wait_seconds = 0
    assert asked(lab) == [COMM_STATUS, PORT_FORWARD, WAIT]
    assert lab.gateway.mappings() == []
    assert lab.device.messages.count("therefore openVPN will not be started") == 1
    assert lab.device.statuses_sent() == ["connecting"]

    lab.step("the pause is over, the service says proceed")
    wait_for_status(lab, "portforwarded")
    assert _questions(lab) == 2
    assert_published(lab)

    lab.step("the next port test is due, and the service says wait again")
    lab.central.wait_seconds = 300
    before = len(lab.central.requests)
    wait_for_log(lab, f"{PAUSE}300 secs.", 2)
    assert asked(lab, before) == [WAIT]
    assert lab.device.messages.count("testPort success 1, current connectionType 1.") == 1
    assert_published(lab)
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def service_says_wait_unclearly(lab: Lab) -> None:
    """The wait is missing, garbage, negative or zero: the device proceeds every time."""
    for answer, line in _UNCLEAR.items():
        lab.step(f"the answer is '{answer}'")
        lab.central.misbehave(WAIT, Fault(body=answer))
        before = lab.device.messages.count(line)
        start(lab, "portforwarded")
        assert lab.device.messages.count(line) == before + 1
        assert_published(lab)
        assert_stops_clean(lab)
    assert _questions(lab) == len(lab.central.port_tests) == len(_UNCLEAR)


@scenario(_NO_RELAY)
def service_is_gone(lab: Lab) -> None:
    """The service is down: failed, nothing published; forwarded once it is back."""
    lab.central.stop()
    _assert_fails(lab, "Error: [Couldn't connect to server]", _TRIES + 4)
    lab.moment("the service is down: nothing is published, the status is failed",
               "service-unreachable")
    lab.step("the service is back")
    lab.central.start()
    _assert_recovers(lab)


@scenario(_NO_RELAY)
def service_hangs_up(lab: Lab) -> None:
    """The service hangs up on every port test: failed; forwarded once it answers."""
    _play_fault(lab, Fault(drop=True), "Error: [Server returned nothing (no headers, no data)]",
                _TRIES, PORT_TEST)


@scenario(_NO_RELAY)
def service_resets_connections(lab: Lab) -> None:
    """The service resets the connection of every port test: failed; forwarded once it answers."""
    _play_fault(lab, Fault(reset=True), "Error: [Failure when receiving data from the peer]",
                _TRIES, PORT_TEST)


# One candidate port instead of three, since every try lasts 30 s.
@scenario(Situation(static={**NO_TUNNEL, "DEFAULT_PORTS_ONLY": "TRUE"}, clock=20, hasty=True))
def service_is_slow(lab: Lab) -> None:
    """The service answers later than the device waits: failed; forwarded once it is fast."""
    _play_fault(lab, Fault(delay=3, drop=True), "Error: [Timeout was reached]", 1 + 3,
                WAIT, PORT_TEST)


@scenario(_NO_RELAY)
def service_is_an_impostor(lab: Lab) -> None:
    """The service presents a wrong certificate: no authorisation sent, failed; then forwarded."""
    lab.central.show_certificate_of("elsewhere.example")
    _assert_fails(lab, "Error: [SSL peer certificate or SSH remote key was not OK]", _TRIES + 3)
    assert _questions(lab) == len(lab.central.requests)
    lab.moment("the service shows a wrong certificate: the device tells it no secret, the status "
               "is failed",
               "service-certificate")
    lab.step("the certificate is correct")
    lab.central.show_certificate_of(SERVICE_HOST)
    _assert_recovers(lab)


@scenario(_NO_RELAY)
def service_says_too_much(lab: Lab) -> None:
    """A passed test reported in 10239 bytes is ignored: failed; in 10238 bytes it counts."""
    lab.central.misbehave(PORT_TEST, Fault(body=_passed(lab, _LONGEST_ANSWER + 1)))
    _assert_fails(lab, "TavikClient curlRcvData - Buffer overrun detected, read buffer too small, "
                       "transfer aborted", _TRIES)
    lab.moment("the answer to a port test is a byte too long: it is ignored, the status is failed",
               "service-answers-nonsense")
    lab.step("the answer is a byte shorter")
    lab.central.misbehave(PORT_TEST, Fault(body=_passed(lab, _LONGEST_ANSWER)))
    _assert_recovers(lab)


@scenario(_NO_RELAY)
def service_talks_rubbish(lab: Lab) -> None:
    """The service answers with printf directives: logged verbatim, failed; then forwarded."""
    rubbish = "%s%n" * 2500
    _play_fault(lab, Fault(body=rubbish), f" -  failure response from server: [{rubbish[:1000]}",
                _TRIES, COMM_STATUS, PORT_FORWARD, WAIT, PORT_TEST)


@scenario(_NO_RELAY)
def service_goes_away_later(lab: Lab) -> None:
    """The service goes down while the device is forwarded: the next test fails, the ports close."""
    start(lab, "portforwarded")

    lab.step("the service goes down; until the next test nothing changes")
    lab.central.stop()
    wait_for_log(lab, NOT_DUE)
    assert lab.device.status == "portforwarded"
    assert lab.gateway.mappings() == BOTH_MAPPED

    lab.step("the test is due: it fails, and so do the search and the relay")
    wait_for_log(lab, NOT_RELAYED)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed"]
    assert lab.device.messages.count("port check failed, retrying in 5 seconds") == 3 + _TRIES
    assert lab.gateway.mappings() == []
    # The withdrawal did not get through: the service sends clients to closed ports for a while.
    assert lab.device.messages.count("failed to delete port mapping info.") == 1
    assert lab.central.record == PUBLISHED
    lab.moment("the service went down while the device was reached: the ports are closed again",
               "service-unreachable")

    lab.step("the service is back")
    lab.central.start()
    _assert_recovers(lab, "portforwarded", "failed")


@scenario(Situation(static={**NO_TUNNEL, "DEFAULT_PORTS_ONLY": "TRUE"}, clock=FAST))
def failed_test_leaves_https_open(lab: Lab) -> None:
    """Only the default ports are allowed, a later test fails: HTTP closes, HTTPS stays open."""
    start(lab, "portforwarded")

    lab.step("the ports no longer pass the test")
    lab.central.misbehave(PORT_TEST, Fault(drop=True))
    wait_for_log(lab, NOT_RELAYED)
    with lab.daemon.held():
        assert lab.device.status == "failed"
        assert lab.central.record is None
        # A wider search would have removed it before its second candidate.
        assert lab.gateway.mappings() == BOTH_MAPPED[1:]
        assert pages_from_outside() == [None, PAGES[1]]
        lab.moment("the test fails, and the HTTPS port stays open",
                   "service-silent")

    lab.step("a normal shutdown closes it")
    assert_stops_clean(lab)


@scenario(_NO_RELAY)
def publishing_fails(lab: Lab) -> None:
    """Tested ports cannot be published: they stay mapped, the relay is tried, a search recovers."""
    # The first of the two requests is the withdrawal at the start.
    lab.central.misbehave(PORT_FORWARD, Fault(drop=True, times=2))
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, NOT_RELAYED)
    with lab.daemon.held():
        assert lab.device.statuses_sent() == ["connecting", "failed"]
        assert lab.device.messages.count("failed to update mapping info, attempting to delete "
                                         "server mapping.") == 1
        # Nothing is deleted at that point; switching to the relay withdraws the record.
        assert _addresses_sent(lab) == ["NULL", _HERE, "NULL"]
        assert (lab.central.record, lab.central.withdrawals) == (None, 1)
        assert "/local/port_forward" not in {request.path for request in lab.device.local_requests}
        assert lab.gateway.mappings() == BOTH_MAPPED
        assert pages_from_outside() == PAGES

    lab.step("the relay attempt has forgotten the ports: the next search finds them again")
    wait_for_status(lab, "portforwarded")
    assert lab.device.messages.count(NOT_RELAYED) == 2
    assert _addresses_sent(lab) == ["NULL", _HERE, "NULL", "NULL", _HERE]
    assert ports_tested(lab) == [9091, 9091]
    assert lab.device.messages.count("Router::unmapPort() - success") == 0
    assert_published(lab)
    assert_stops_clean(lab)

    lab.step("another start, and it cannot publish them again")
    lab.central.misbehave(PORT_FORWARD, Fault(drop=True, times=2))
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, NOT_RELAYED, 3)
    lab.moment("the ports pass their test, but the service does not take their record",
               "publishing-failed")
    assert lab.stop_daemon() == "SIGTERM"


@scenario(Situation(gateway=SILENT, relay=True, clock=IMPATIENT))
def publishing_fails_while_relayed(lab: Lab) -> None:
    """A relayed device cannot publish its new ports: only the check of the names recovers."""
    start(lab, "relayed")

    lab.step("a gateway appears, the ports pass the test, the service does not accept the record")
    lab.central.misbehave(PORT_FORWARD, Fault(drop=True, times=1))
    lab.gateway.become(GatewaySetup())
    wait_for_log(lab, "failed to update mapping info")
    before = len(lab.central.requests)

    lab.step("the next cycle assumes that the ports are published and keeps them")
    wait_for_log(lab, "createConnection() - connection type changed to 1")
    with lab.daemon.held():
        assert lab.device.messages.count(NOT_DUE) == 1
        assert len(lab.central.requests) == before
        assert lab.central.record is None
        assert lab.gateway.mappings() == BOTH_MAPPED
        assert lab.device.status == "relayed"
        assert lab.relay.client_address()

    lab.step("the names still point to the relay: everything is rebuilt")
    wait_for_status(lab, "portforwarded")
    assert lab.device.messages.count(_TORN_DOWN) == 1
    assert asked(lab, before) == [PORT_FORWARD, WAIT, PORT_TEST, PORT_FORWARD]
    assert_published(lab)
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "failed", "portforwarded",
                                          "disabled"]


@scenario(Situation(clock=FAST))
def names_lead_elsewhere(lab: Lab) -> None:
    """The public names point elsewhere: everything is torn down, tested at once and rebuilt."""
    start(lab, "portforwarded")

    lab.step("the names point elsewhere, the disk sleeps, and a port test is slow")
    with lab.daemon.held():
        for name in lab.account.names:
            lab.names.pin(name, _ELSEWHERE)
        lab.device.disk_sleeps()
        lab.central.misbehave(PORT_TEST, Fault(delay=3, times=1))
        before = len(lab.central.requests)
    lab.wait_for(lambda: PORT_TEST in asked(lab, before), "a test within the interval", 60)
    assert lab.device.messages.texts().count(
        f"{_CHECK}DNS check failed for 4-level device domain name, DNS IP address is "
        f"{_ELSEWHERE}, local value of IP address is {_HERE}") == 1
    assert lab.device.messages.count(_TORN_DOWN) == 1
    assert lab.device.status == "failed"
    assert lab.gateway.mappings() == BOTH_MAPPED[:1]
    assert (lab.central.record, lab.central.withdrawals) == (None, 2)

    lab.step("the test passes; the connection type is as before: next name check in a day")
    wait_for_cycle(lab, 3)
    assert asked(lab, before) == [PORT_FORWARD, WAIT, PORT_TEST, PORT_FORWARD]
    assert lab.device.messages.count(f"{_CHECK}forceDNSCheck or exceeded nslookup check") == 1
    assert lab.central.record == PUBLISHED
    assert lab.gateway.mappings() == BOTH_MAPPED
    lab.moment("the device is reached directly, but its names still point elsewhere",
               "names-lead-elsewhere")
    for name in lab.account.names:
        lab.names.unpin(name)
    lab.moment("the names lead to the device again")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", "portforwarded", "failed",
                                          "portforwarded", "disabled"]


@scenario(Situation(clock=FAST))
def names_disagree(lab: Lab) -> None:
    """A name is missing, then one differs: torn down each time; correct again: left alone."""
    four_level, _, hashed = lab.account.names
    start(lab, "portforwarded", "-d", "60")

    lab.step("a name is missing: looked up three times")
    with lab.daemon.held():
        lab.names.pin(four_level, None)
        lab.moment("one of the public names is gone", "names-unresolved")
        before = _lookups(lab)
    wait_for_log(lab, _TORN_DOWN)
    assert [after - earlier for earlier, after in zip(before, _lookups(lab))] == [3, 1, 1]
    lab.names.unpin(four_level)
    assert lab.device.messages.texts().count(
        f"{_CHECK}nslookup 3-level and/or 4-level domain name IP addresses do not exist or do not "
        f"match, 3-level [{_HERE}], 4-level []") == 1

    lab.step("the hashed name points elsewhere")
    lab.names.pin(hashed, _ELSEWHERE)
    wait_for_log(lab, _TORN_DOWN, 2)
    lab.names.unpin(hashed)
    assert lab.device.messages.texts().count(
        f"{_CHECK}nslookup 3-level hashed domain name IP address does not exist or does not match "
        f"3-level and 4-level, 3-level [{_HERE}], 4-level [{_HERE}], 3-level hashed "
        f"[{_ELSEWHERE}]") == 1
    # Each of the three tries ended with a pause of ten seconds.
    (_, began), (ended, _) = _checks(lab)
    assert 30 <= ended - began < 120

    lab.step("all names are correct again")
    wait_for_log(lab, f"{_CHECK}DNS matches local value for device domain names, IP address is "
                      f"{_HERE}")
    wait_for_next_cycle(lab)
    assert _addresses_sent(lab) == ["NULL", _HERE] * 3
    assert_published(lab)
    lab.moment("all public names are right again")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", *["portforwarded", "failed"] * 2,
                                          "portforwarded", "disabled"]


@scenario(Situation(gateway=SILENT, relay=True, clock=RELAYED))
def relay_names_lead_elsewhere(lab: Lab) -> None:
    """The names of a relayed device point elsewhere: its tunnel ends, and another comes up."""
    start(lab, "relayed")
    before = set(daemon.running("openvpn"))

    lab.step("the names point elsewhere")
    with lab.daemon.held():
        for name in lab.account.names:
            lab.names.pin(name, _ELSEWHERE)
    wait_for_log(lab, _TORN_DOWN)
    assert lab.device.messages.texts().count(
        f"{_CHECK}DNS check failed for 4-level device domain name, DNS IP address is "
        f"{_ELSEWHERE}, local value of IP address is {network.RELAY_ADDRESS}") == 1
    wait_for_status(lab, "relayed")
    # The relay's own server stays.
    lab.wait_for(lambda: len(before & set(daemon.running("openvpn"))) == 1, "the old tunnel's end",
                 20)
    assert len(set(daemon.running("openvpn")) - before) == 1
    assert lab.relay.connections() == 2
    assert lab.relay.client_address()
    lab.moment("the device is relayed, but its names still point elsewhere",
               "names-lead-elsewhere")
    assert_stops_clean(lab)
    wait_until(lambda: not set(daemon.running("openvpn")) - before, "the tunnel to end", 20)
    assert lab.device.statuses_sent() == ["connecting", "relayed", "failed", "relayed", "disabled"]


def _play_fault(lab: Lab, fault: Fault, error: str, count: int, *operations: str) -> None:
    """Make operations fail until the device has met this error `count` times, then recover."""
    for operation in operations:
        lab.central.misbehave(operation, fault)
    _assert_fails(lab, error, count)
    lab.moment("the service misbehaves in each port test: the status is failed",
               "service-answers-nonsense" if fault.body else "service-silent")
    lab.step("the service answers properly")
    for operation in operations:
        lab.central.misbehave(operation, None)
    _assert_recovers(lab)


def _assert_fails(lab: Lab, error: str, count: int) -> None:
    """The first cycle meets this error `count` times; nothing is published or left behind."""
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, PAUSE)
    lines = lab.device.messages.texts()
    end = next(number for number, line in enumerate(lines) if line.startswith(PAUSE))
    assert sum(error in line for line in lines[:end]) == count
    assert sum(NOT_RELAYED in line for line in lines[:end]) == 1
    assert lab.device.statuses_sent() == ["connecting", "failed"]
    assert set(_addresses_sent(lab)) <= {"NULL"}
    assert lab.central.record is None
    assert lab.gateway.mappings() == []


def _assert_recovers(lab: Lab, *statuses: str) -> None:
    """The daemon that failed makes the device reachable, without a restart."""
    wait_for_status(lab, "portforwarded")
    assert_published(lab)
    lab.moment("the service is all right again, and the device is reached directly")
    assert_stops_clean(lab)
    assert lab.device.statuses_sent() == ["connecting", *(statuses or ["failed"]),
                                          "portforwarded", "disabled"]


def _questions(lab: Lab) -> int:
    """How often the device asked for permission; the URL holds only the device id."""
    seen = [(request.scheme, request.url) for request in lab.central.requests_for(WAIT)]
    assert set(seen) == {("http", f"/api/1.0/rest/{WAIT}/{lab.account.device_id}")}
    return len(seen)


def _addresses_sent(lab: Lab) -> list[str]:
    """The addresses that the device asked to publish, NULL for a withdrawal."""
    return [request.argument("external_ip") for request in lab.central.requests_for(PORT_FORWARD)]


def _passed(lab: Lab, size: int) -> str:
    """The answer of a passed port test, padded with blanks."""
    device = f"device_id>{lab.account.device_id}</"
    return f"Success<req_{device}req_device_id><resp_{device}resp_device_id>".ljust(size)


def _lookups(lab: Lab) -> list[int]:
    """How often the name server was asked for each of the device's names, from its home."""
    log = lab.names.server.log.read_text()
    return [log.count(f"query[A] {name} from {_HERE}\n") for name in lab.account.names]


def _checks(lab: Lab) -> list[tuple[int, int]]:
    """For each check of the names: when the previous one ended and when it began, device time."""
    found = (re.search(r"prevTime (\d+), .* currentTime (\d+)", line)
             for line in lab.device.messages.texts() if line.startswith(_CHECK))
    return [(int(times[1]), int(times[2])) for times in found if times]
