"""The doctor at work beside the daemon, which must not notice it."""

from __future__ import annotations

import itertools
import os
import re
import signal
import threading
from collections.abc import Iterator, Sequence
from contextlib import contextmanager
from dataclasses import dataclass
from pathlib import Path

from lab import doctor
from lab.account import DOMAIN, SERVICE_HOST
from lab.central import MY_IP, PORT_TEST
from lab.checks import (FAST, NOT_RELAYED, NO_TUNNEL, OPTIONS, PAUSE, asked, assert_stops_clean,
                        mapping_changes, start, start_direct, wait_for_log, wait_for_next_cycle)
from lab.device import DYNAMIC_COPY, DYNAMIC_FILE, STATIC_FILE
from lab.messages import Message
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_CYCLES = 10
_DIRECT, _NOT_REACHED, _UNKNOWN = 0, 2, 3
# The sandbox has no user but root. Files with mode 0 are not nobody's to read.
_NOBODY = ("unshare", "--user", "--map-user=65534", "--map-group=65534")
_ADDRESS = re.compile(r"\d+\.\d+\.\d+\.\d+|\w\w:\w\w:\w\w:\w\w:\w\w:\w\w")
# What differs from run to run of the daemon: pids, seconds that have passed, seconds since 1970.
_CHANGING = re.compile(r"(?<=[PS]ID: \[)\d+|(?<=Elapsed time )\d+|\b1\d{9}\b")


@dataclass(frozen=True)
class _Run:
    """What the daemon did from its start to its end."""

    lines: list[str]
    requests: list[str]
    local_requests: list[str]
    changes: list[str]


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def doctor_beside(lab: Lab) -> None:
    """The doctor runs again and again for ten cycles: the daemon does what it does without it."""
    start(lab, "portforwarded")  # the first start of all also creates the copy of the settings
    assert_stops_clean(lab)

    lab.step(f"{_CYCLES} cycles without the doctor")
    alone = _run(lab)
    lab.step(f"{_CYCLES} cycles with it, from the first moment")
    with _examined(lab) as verdicts:
        watched = _run(lab)
    # At the start and at the end the device is not reached.
    assert len(verdicts) >= _CYCLES // 2, verdicts
    assert {_DIRECT} <= set(verdicts) <= {_DIRECT, _NOT_REACHED}, verdicts
    assert watched.lines == alone.lines
    assert watched == alone


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def doctor_asks_service(lab: Lab) -> None:
    """The doctor has the service test the port: it passes, then another device answers."""
    start_direct(lab)
    with lab.daemon.held():
        lab.moment("the doctor may ask the service for a port test, which passes")
        before = len(lab.central.requests)
        found = lab.diagnosis("--ask-service")
        assert (found.status, found.cause) == (_DIRECT, ""), found
        assert "port test: the service reaches port 9091" in found.checks("ok"), found
        assert sorted(asked(lab, before)) == sorted([MY_IP, PORT_TEST])

        lab.step("the gateway has given the port to another device of this kind")
        lab.gateway.lose(9091)
        lab.neighbour.pretend("0815")
        lab.neighbour.hold(9091, 80)
        found = lab.diagnosis("--ask-service")
        assert (found.status, found.cause) == (_NOT_REACHED, "another-device-answers"), found

        lab.step("nothing answers any more")
        lab.gateway.block(9091)
        found = lab.diagnosis("--ask-service")
        assert (found.status, found.cause) == (_NOT_REACHED, "mapping-lost"), found
        assert "port test: the service does not reach port 9091" in found.checks("problem"), found
    assert lab.stop_daemon() == "SIGTERM"


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def doctor_shares(lab: Lab) -> None:
    """What the doctor prints for others has no address, no host name and no secret in it."""
    start_direct(lab)
    lab.central.stop()
    wait_for_log(lab, NOT_RELAYED)
    lab.names.pin(SERVICE_HOST, None)
    wait_for_next_cycle(lab)
    lab.step("neither on the device nor from its log elsewhere")
    with lab.daemon.held():
        for options, settings in (((), STATIC_FILE), (("--no-probes",), Path("/nonexistent"))):
            for output in _shared(lab, options, settings):
                assert not _named_in(lab, output), output
    lab.moment("the service is gone, and so is its name", "service-unresolved")
    assert lab.stop_daemon() == "SIGTERM"


@scenario(Situation(static=NO_TUNNEL, clock=FAST))
def doctor_without_root(lab: Lab) -> None:
    """Without root the doctor names no cause for what it could not look at, and says so."""
    start_direct(lab)
    with lab.daemon.held():
        lab.moment("as root the doctor knows that the device is reached directly")
        for path in (STATIC_FILE, DYNAMIC_FILE, DYNAMIC_COPY, lab.device.messages.syslog):
            path.chmod(0)
        found = lab.diagnosis(through=_NOBODY)
    assert (found.status, found.cause) == (_UNKNOWN, ""), found
    assert found.checks("problem") == [], found
    assert "need root" in str(found), found
    for untrue in ("names no host", "is no URL", "on 80"):
        assert untrue not in str(found), found
    assert_stops_clean(lab)


def _shared(lab: Lab, options: Sequence[str], settings: Path) -> list[str]:
    """The note, the picture's note, the object for programs, and the picture."""
    picture = Path("/run/lab/history.svg")
    outputs = [doctor.run(lab.device.messages, "--share", *options, *more,
                          static_file=settings).stdout
               for more in ((), ("--json",), ("--svg", str(picture)))]
    outputs.append(picture.read_text())
    assert min(map(len, outputs)) > 300, outputs
    return outputs


def _named_in(lab: Lab, text: str) -> set[str]:
    """The addresses, host names and secrets in a text."""
    names = {SERVICE_HOST, DOMAIN.removeprefix("."), lab.account.host_name, *lab.account.names,
             *lab.account.secrets}
    return {name for name in names if name in text} | set(_ADDRESS.findall(text))


def _run(lab: Lab) -> _Run:
    """Start the daemon, and end it as soon as it says that the last cycle is over."""
    seen, cycles = _seen(lab), itertools.count(1)

    def end_in_time(message: Message) -> None:
        if PAUSE in message.text and next(cycles) == _CYCLES:
            os.kill(lab.daemon.pid, signal.SIGTERM)

    lab.device.messages.listen(end_in_time)
    lab.start_daemon(*OPTIONS)
    assert wait_until(lab.daemon.ended, f"the end after {_CYCLES} cycles", 120) == "SIGTERM"
    assert lab.central.record is None
    now = _seen(lab)
    return _Run(*(getattr(now, name)[len(before):] for name, before in vars(seen).items()))


def _seen(lab: Lab) -> _Run:
    """Everything so far."""
    return _Run([_CHANGING.sub("*", str(message)) for message in lab.device.messages.all],
                [f"{request.scheme} {request.url}" for request in lab.central.requests],
                [request.url for request in lab.device.local_requests], mapping_changes(lab))


@contextmanager
def _examined(lab: Lab) -> Iterator[list[int]]:
    """Run doctors meanwhile, one after the other in two rows; the value has their exit statuses."""
    over, statuses = threading.Event(), list[int]()

    def examine() -> None:
        while not over.is_set():
            statuses.append(doctor.run(lab.device.messages, "--json").returncode)

    examiners = [threading.Thread(target=examine) for _ in range(2)]
    for examiner in examiners:
        examiner.start()
    try:
        yield statuses
    finally:
        over.set()
        for examiner in examiners:
            examiner.join()
