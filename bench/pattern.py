#!/usr/bin/python3
"""Measures what one device asks of the service, for each state it can be in.

Plays each state for some device hours in a lab of its own, with pauses that take a twelfth of their
time and a clock that runs ten times as fast, and writes bench/pattern.json.
"""

from __future__ import annotations

import json
import re
import subprocess
import sys
import time
from collections.abc import Callable
from concurrent.futures import ThreadPoolExecutor
from dataclasses import asdict, dataclass, field
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from lab import network, nft, sandbox  # noqa: E402
from lab.checks import OPTIONS, SILENT  # noqa: E402
from lab.scenario import Lab, Situation  # noqa: E402
from lab.support import LabError  # noqa: E402
from lab.timeline import Timeline  # noqa: E402

RESULT = sandbox.PROJECT / "bench/pattern.json"
_CLOCK, _PAUSES = 10, 12
_AT_ONCE = 2
_LAB_SECONDS = 1500
_END_OF_CYCLE = re.compile(r"DaemonControl::run - (?:retry connection after|sleep) (\d+) secs")
_COUNTERS = ("http", "https", "received", "sent")
_OPENS = "tcp flags & (syn | ack) == syn counter name"
_COUNT = f"""table inet count {{
    counter http {{}}
    counter https {{}}
    counter received {{}}
    counter sent {{}}
    chain input {{
        type filter hook input priority -200;
        ip daddr {network.SERVICE_ADDRESS} tcp dport {{ 80, 443 }} counter name received
        ip daddr {network.SERVICE_ADDRESS} tcp dport 80 {_OPENS} http
        ip daddr {network.SERVICE_ADDRESS} tcp dport 443 {_OPENS} https
    }}
    chain output {{
        type filter hook output priority 0;
        ip saddr {network.SERVICE_ADDRESS} tcp sport {{ 80, 443 }} counter name sent
    }}
}}"""


def _as_it_is(_lab: Lab) -> None:
    """Nothing is prepared."""


def _second_nat(lab: Lab) -> None:
    lab.provider.insert()


def _ports_closed(lab: Lab) -> None:
    for port in range(9091, 9191):
        lab.gateway.block(port)


def _wait(lab: Lab) -> None:
    lab.central.wait_seconds = 600


def _service_down(lab: Lab) -> None:
    lab.central.stop()


def _disk_asleep(lab: Lab) -> None:
    lab.device.disk_sleeps()


@dataclass(frozen=True)
class State:
    """A state, prepared before the daemon's start, or with `later` after its third cycle."""

    hours: float
    situation: Situation = field(default_factory=lambda: _situation(relay=True))
    prepare: Callable[[Lab], None] = _as_it_is
    later: Callable[[Lab], None] | None = None
    settled: float = 0.4  # hours after which the steady state is measured


def _situation(**differences: object) -> Situation:
    return Situation(clock=_CLOCK, pauses=_PAUSES, **differences)  # type: ignore[arg-type]


STATES = {
    "direct": State(3, settled=1.5),
    "direct, disk asleep": State(1, later=_disk_asleep),
    "relayed, no gateway answers": State(1, _situation(gateway=SILENT, relay=True)),
    "relayed, behind a second NAT": State(1, prepare=_second_nat),
    "relayed, ports closed": State(1.2, prepare=_ports_closed),
    "failing, no gateway, no relay": State(1.2, _situation(gateway=SILENT)),
    "failing, ports closed, no relay": State(1.2, _situation(), _ports_closed),
    "asked to wait 600 s": State(1.5, prepare=_wait),
    "service down": State(1.2, later=_service_down),
    "service down, no relay": State(1.2, _situation(), later=_service_down),
}


@dataclass(frozen=True)
class Sample:
    """At the end of a cycle: device time in hours, and what the service has got and sent so far."""

    hour: float
    http: int
    https: int
    received: int
    sent: int


class Watch:
    """The counters of the service's host at the end of each cycle."""

    def __init__(self, lab: Lab) -> None:
        nft.change(network.INTERNET, _COUNT)
        self.samples = [self._sample(0)]
        self._began = time.monotonic()
        self._skipped = 0.0
        lab.device.messages.listen(lambda message: self._look(message.text))

    def _look(self, line: str) -> None:
        end = _END_OF_CYCLE.match(line)
        if not end:
            return
        passed = (time.monotonic() - self._began) * _CLOCK + self._skipped
        self.samples.append(self._sample(passed / 3600))
        self._skipped += int(end[1]) - int(end[1]) // _PAUSES

    @staticmethod
    def _sample(hour: float) -> Sample:
        found = {entry["counter"]["name"]: entry["counter"] for entry in nft.listed(
            network.INTERNET, "counters", "table", "inet", "count") if "counter" in entry}
        return Sample(hour, found["http"]["packets"], found["https"]["packets"],
                      found["received"]["bytes"], found["sent"]["bytes"])


def _play(name: str) -> dict[str, object]:
    """The first cycle and the steady state of one device."""
    state = STATES[name]
    lab = Lab(state.situation, Timeline())
    state.prepare(lab)
    watch = Watch(lab)
    try:
        lab.start_daemon(*OPTIONS)
        first, settled = 0, state.settled
        if state.later:
            lab.wait_for(lambda: len(watch.samples) > 3, "the third cycle", 300)
            before = watch.samples[-1]
            state.later(lab)
            lab.wait_for(lambda: watch.samples[-1].https > before.https
                         or watch.samples[-1].hour > before.hour + 0.5, "an effect", 300)
            first = watch.samples.index(before)
            while watch.samples[first + 1].https == before.https and first + 2 < len(watch.samples):
                first += 1
            settled += watch.samples[-1].hour
        end = settled + state.hours - state.settled
        lab.wait_for(lambda: watch.samples[-1].hour > end, "the end", _LAB_SECONDS)
    except LabError:
        print(lab.report())
        raise
    status, last = lab.device.status, watch.samples[-1]
    tests = [test for test in lab.central.port_tests]
    lab.stop_daemon()
    steady = [sample for sample in watch.samples if sample.hour > settled]
    hours = steady[-1].hour - steady[0].hour
    a_cycle, after = watch.samples[first], watch.samples[first + 1]
    # The shutdown's requests come after the last cycle's.
    off = Watch._sample(0)  # pylint: disable=protected-access
    return {"status": status, "cycle_seconds": round(hours * 3600 / (len(steady) - 1), 1),
            "hours": round(hours, 2), "port_tests": len(tests),
            "first_cycle": {key: getattr(after, key) - getattr(a_cycle, key) for key in _COUNTERS},
            "per_hour": {key: round((getattr(steady[-1], key) - getattr(steady[0], key)) / hours, 1)
                         for key in _COUNTERS},
            "shutdown": {key: getattr(off, key) - getattr(last, key) for key in _COUNTERS},
            "samples": [asdict(sample) for sample in watch.samples]}


def main() -> None:
    """Play the states, some at a time."""
    if sandbox.is_inside():
        name, result = sys.argv[1:]
        Path(result).write_text(json.dumps(_play(name)))
        return
    names = sys.argv[1:] or [*STATES]
    folder = sandbox.PROJECT / "build/pattern"
    folder.mkdir(parents=True, exist_ok=True)

    def play(name: str) -> subprocess.CompletedProcess[str]:
        return sandbox.run("bench.pattern", [name, str(folder / f"{name}.json")],
                           timeout=_LAB_SECONDS, capture=True)

    with ThreadPoolExecutor(_AT_ONCE) as pool:
        for name, done in zip(names, pool.map(play, names)):
            print(name, "played" if done.returncode == 0 else f"failed:\n{done.stdout}", flush=True)
    measured = json.loads(RESULT.read_text()) if RESULT.exists() else {}
    for name in names:
        if (folder / f"{name}.json").exists():
            measured[name] = json.loads((folder / f"{name}.json").read_text())
            del measured[name]["samples"]
    RESULT.write_text(json.dumps(measured, indent=1) + "\n")


if __name__ == "__main__":
    main()
