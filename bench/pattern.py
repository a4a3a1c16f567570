#!/usr/bin/python3
"""Measures what one device asks of the service in each of its states: bench/pattern.json.

Plays each state, or those named, in a lab of its own. Pauses take a twelfth of their time, and the
rest of the device's time runs ten times as fast.
"""

from __future__ import annotations

import argparse
import json
import re
import sys
import time
from collections.abc import Callable
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from lab import network, nft, sandbox  # noqa: E402
from lab.checks import OPTIONS, SILENT  # noqa: E402
from lab.gateway import GatewaySetup  # noqa: E402
from lab.scenario import Lab, Situation  # noqa: E402
from lab.timeline import Timeline  # noqa: E402

_RESULT = sandbox.PROJECT / "bench/pattern.json"
_PARTS = sandbox.PROJECT / "build/pattern"
_CLOCK, _PAUSES = 10, 12
_PATIENCE = 1500  # seconds
_END_OF_CYCLE = re.compile(r"DaemonControl::run - (?:retry connection after|sleep) (\d+) secs")
_COUNTERS = ("http", "https", "received", "sent")
_OPENS = "tcp flags & (syn | ack) == syn counter name"
_NAMED = "\n    ".join(f"counter {name} {{ }}" for name in _COUNTERS)
_COUNT = f"""table inet count {{
    {_NAMED}
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


def _close_ports(lab: Lab) -> None:
    for port in range(9091, 9191):
        lab.gateway.block(port)


@dataclass(frozen=True)
class _State:
    """Prepared before the start, or with `later` after the third cycle; steady after `settled`.

    Measured for `hours`, as far as they are whole periods.
    """

    gateway: GatewaySetup = GatewaySetup()
    relay: bool = True
    prepare: Callable[[Lab], object] = lambda lab: None
    later: Callable[[Lab], object] | None = None
    settled: float = 0.6  # hours
    hours: float = 0.8


_STATES = {
    "direct": _State(settled=1.5, hours=1.5),
    "direct, disk asleep": _State(later=lambda lab: lab.device.disk_sleeps()),
    "relayed, no gateway answers": _State(SILENT),
    "relayed, behind a second NAT": _State(prepare=lambda lab: lab.provider.insert()),
    "relayed, ports closed": _State(prepare=_close_ports),
    "failing, no gateway, no relay": _State(SILENT, relay=False),
    "failing, ports closed, no relay": _State(relay=False, prepare=_close_ports),
    "asked to wait 600 s": _State(prepare=lambda lab: setattr(lab.central, "wait_seconds", 600)),
    "service down": _State(later=lambda lab: lab.central.stop()),
    "service down, no relay": _State(relay=False, later=lambda lab: lab.central.stop())}


def _counted() -> dict[str, float]:
    found = {entry["counter"]["name"]: entry["counter"] for entry in nft.listed(
        network.INTERNET, "counters", "table", "inet", "count") if "counter" in entry}
    return {name: found[name]["packets" if "http" in name else "bytes"] for name in _COUNTERS}


def _whole_periods(samples: list[dict[str, float]]) -> list[dict[str, float]]:
    """From the first cycle that asks for anything to the last; all if there are not two."""
    asked = [number for number in range(1, len(samples))
             if samples[number]["http"] + samples[number]["https"]
             > samples[number - 1]["http"] + samples[number - 1]["https"]]
    return samples[asked[0]:asked[-1] + 1] if len(asked) > 1 else samples


def _play(state: _State) -> dict[str, object]:
    """What a cycle that begins the state asks, and an hour of the steady state."""
    lab = Lab(Situation(state.gateway, state.relay, clock=_CLOCK, pauses=_PAUSES), Timeline())
    state.prepare(lab)
    nft.change(network.INTERNET, _COUNT)
    samples: list[dict[str, float]] = [_counted() | {"hour": 0}]
    began, skipped = time.monotonic(), 0

    def look(line: str) -> None:
        nonlocal skipped
        if end := _END_OF_CYCLE.match(line):
            passed = (time.monotonic() - began) * _CLOCK + skipped
            samples.append(_counted() | {"hour": passed / 3600})
            skipped += int(end[1]) - int(end[1]) // _PAUSES

    lab.device.messages.listen(lambda message: look(message.text))
    lab.start_daemon(*OPTIONS)
    settled, first = state.settled, 0
    if state.later:
        lab.wait_for(lambda: len(samples) > 3, "the third cycle", _PATIENCE)
        first, settled = len(samples) - 1, settled + samples[-1]["hour"]
        state.later(lab)
    lab.wait_for(lambda: samples[-1]["hour"] > settled + state.hours, "the end", _PATIENCE)
    # The first cycle that asks for anything.
    begin = next((number for number in range(first, len(samples) - 1)
                  if samples[number + 1]["https"] > samples[number]["https"]), first)
    steady = _whole_periods([sample for sample in samples if sample["hour"] > settled])
    hours = steady[-1]["hour"] - steady[0]["hour"]
    last, status = samples[-1], lab.device.status
    lab.stop_daemon()
    shutdown = _counted()
    return {"status": status, "cycle_seconds": round(hours * 3600 / (len(steady) - 1), 1),
            "first_cycle": {key: samples[begin + 1][key] - samples[begin][key]
                            for key in _COUNTERS},
            "per_hour": {key: round((steady[-1][key] - steady[0][key]) / hours, 1)
                         for key in _COUNTERS},
            "shutdown": {key: shutdown[key] - last[key] for key in _COUNTERS}}


def main() -> None:
    """Play the states, two at a time."""
    parser = argparse.ArgumentParser(
        prog="bench/pattern.py", description=__doc__, epilog=f"The states: {'; '.join(_STATES)}.")
    parser.add_argument("names", nargs="*", metavar="NAME", help="a state; without one, all")
    names = parser.parse_args().names or [*_STATES]
    if unknown := set(names) - set(_STATES):
        parser.error(f"no state {', '.join(sorted(unknown))}")
    if sandbox.is_inside():
        Path(_PARTS, names[0]).write_text(json.dumps(_play(_STATES[names[0]])))
        return
    if why := sandbox.why_forbidden():
        sys.exit(f"pattern: no lab on this machine: {why}")
    _PARTS.mkdir(parents=True, exist_ok=True)
    with ThreadPoolExecutor(2) as pool:
        played = pool.map(lambda name: sandbox.run("bench.pattern", [name], _PATIENCE, True), names)
        for name, done in zip(names, played):
            print(name, "played" if done.returncode == 0 else f"failed:\n{done.stdout}", flush=True)
            done.check_returncode()
    measured = json.loads(_RESULT.read_text()) if _RESULT.exists() else {}
    measured |= {name: json.loads(Path(_PARTS, name).read_text()) for name in names}
    _RESULT.write_text(json.dumps(measured, indent=1) + "\n")


if __name__ == "__main__":
    main()
