"""The doctor at work beside the daemon, which must not notice it."""

from __future__ import annotations

import itertools
import os
import re
import signal
import threading
from collections.abc import Iterator
from contextlib import contextmanager
from dataclasses import dataclass

from lab import doctor
from lab.checks import (FAST, NO_TUNNEL, OPTIONS, PAUSE, assert_stops_clean, mapping_changes,
                        start)
from lab.messages import Message
from lab.scenario import Lab, Situation
from lab.scenarios.registry import scenario
from lab.support import wait_until

_CYCLES = 10
_DIRECT, _NOT_REACHED = 0, 2
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
    assert len(verdicts) > 1 and {_DIRECT} <= set(verdicts) <= {_DIRECT, _NOT_REACHED}, verdicts
    assert watched.lines == alone.lines
    assert watched == alone


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
    """Run the doctor meanwhile, one time after the other; the value has its exit statuses."""
    over, statuses = threading.Event(), list[int]()

    def examine() -> None:
        while not over.is_set():
            statuses.append(doctor.run(lab.device.messages, "--json").returncode)

    examiner = threading.Thread(target=examine)
    examiner.start()
    try:
        yield statuses
    finally:
        over.set()
        examiner.join()
