#!/usr/bin/python3
"""Measures the daemon beside what a device would use instead: tables in docs/performance.md.

Each run is a lab of its own. Most labs run side by side in real time, because a faster clock is a
library in the daemon's own memory. It takes 16 minutes and plays the release build that is there.
With kinds as arguments (start, live, calls, reboot) it measures only those again.
"""

from __future__ import annotations

import argparse
import json
import os
import queue
import re
import subprocess
import sys
import time
from collections import defaultdict
from collections.abc import Callable, Sequence
from concurrent.futures import ThreadPoolExecutor
from contextlib import nullcontext
from pathlib import Path
from statistics import mean, median
from typing import Any

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import checks, daemon, network, sandbox  # noqa: E402
from lab.faults import traced  # noqa: E402
from lab.gateway import GatewaySetup  # noqa: E402
from lab.scenario import Lab, Situation  # noqa: E402
from lab.timeline import Timeline  # noqa: E402

_PARTS = sandbox.PROJECT / "build/compare"
_PAGE, _PICTURE = (sandbox.PROJECT / "docs" / name for name in ("performance.md", "compare.svg"))
_MARK, _END = "<!-- compare -->", "<!-- end -->"
_PATTERN = json.loads((sandbox.PROJECT / "bench/pattern.json").read_text())
_CYCLE_SECONDS = _PATTERN["direct"]["cycle_seconds"]
_RUNS, _CYCLES = 5, 5
_PATIENCE, _PAUSE_SECONDS = 1500, 120
_OPTIONS, _NEW_ADDRESS = ("-l", "6", "-f", "30"), "44.128.0.30"
_END_OF_CYCLE = re.compile(r"DaemonControl::run - (retry connection after|sleep) \d+ secs")
_TUNNEL_UP = "openVPNConnection() - openVPN has started successfully"
_BEGAN, _CALLS = Path("/run/lab/began"), Path("/run/lab/calls")
_REBOOTS = Situation(clock=10, pauses=12)
# Cycles after which the time between two port tests no longer grows, and that time.
_SETTLED, _TEST_CYCLES = 33, 8

# The gateway, the required waits and the goal above them, in seconds.
_STARTS = {"UPnP": (GatewaySetup(), 5.0, 0.15),
           "NAT-PMP": (GatewaySetup(upnp=False, natpmp=True), 17.0, 0.1)}
# By the names of pattern.json. The slowest come last, and are started first.
_DIRECT, _RELAYED, _FAILING = ("direct", "relayed, no gateway answers",
                               "failing, no gateway, no relay")
_STATES = {_DIRECT: Situation(), "direct, disk asleep": Situation(),
           _RELAYED: Situation(checks.SILENT, relay=True), _FAILING: Situation(checks.SILENT)}
_LIVES = [*(("live", name, str(run)) for name in reversed(_STATES) for run in range(_RUNS)),
          *(("calls", name, "0") for name in reversed(_STATES))]
_ALONE = [*(("start", name, str(run)) for run in range(_RUNS) for name in _STARTS),
          *(("reboot", "reboot", str(run)) for run in range(_RUNS))]
_COSTS = {"cpu": "CPU, ms", "children": "its commands, ms", "wakes": "wake-ups, main thread",
          "calls": "system calls", "written": "bytes written"}
_EVENTS = ("WAN address changes", "tunnel client dies", "relay restarts", "gateway reboots")
_PROGRAMS = ((_DIRECT, "pelorus"), (_RELAYED, "pelorus"), (_DIRECT, "miniupnpd"),
             (_DIRECT, "upnpc"), (_RELAYED, "openvpn"))
_Run = dict[str, Any]
_Runs = dict[tuple[str, str], list[_Run]]


def _begin(situation: Situation) -> tuple[Lab, Callable[[], object], queue.SimpleQueue[str]]:
    """A daemon in a lab; a function that waits for the end of a cycle; further ends."""
    lab = Lab(situation, Timeline())
    ends: queue.SimpleQueue[str] = queue.SimpleQueue()
    lab.device.messages.listen(lambda message: ends.put(message.text)
                               if _END_OF_CYCLE.match(message.text) else None)
    lab.start_daemon(*_OPTIONS)
    return lab, lambda: ends.get(timeout=_PATIENCE), ends


def _usage(lab: Lab) -> dict[str, float]:
    """What the kernel has counted so far; the CPU time of commands in steps of 10 ms."""
    time.sleep(1)  # from the line that ends a cycle to the pause
    pid = lab.daemon.pid
    stat = Path(f"/proc/{pid}/stat").read_text().rpartition(")")[2].split()
    # The CPU clock of another process, as clock_getcpuclockid(3) would return it.
    return {"cpu": time.clock_gettime(~pid << 3 | 2) * 1000,
            "children": (int(stat[13]) + int(stat[14])) * 1000 / os.sysconf("SC_CLK_TCK"),
            "wakes": _counted(Path(f"/proc/{pid}/status"), "voluntary_ctxt_switches"),
            "written": _counted(Path(f"/proc/{pid}/io"), "wchar"),
            "requests": len(lab.central.requests)}


def _counted(file: Path, name: str) -> int:
    return next(int(line.split()[1]) for line in file.read_text().splitlines()
                if line.startswith(f"{name}:"))


def _memory(pid: int) -> dict[str, float]:
    """KiB."""
    rollup = Path(f"/proc/{pid}/smaps_rollup")
    return {name: _counted(rollup, name) for name in ("Rss", "Private_Dirty")}


def _start(protocol: str, _number: int) -> _Run:
    """Seconds from the process's start to "portforwarded"."""
    lab = Lab(Situation(_STARTS[protocol][0]), Timeline())
    done: queue.SimpleQueue[float] = queue.SimpleQueue()
    lab.timeline.listen(lambda event: done.put(time.time())
                        if event.what == "status: portforwarded" else None)
    lab.start_daemon(*_OPTIONS, through=(
        "sh", "-c", f'date +%s%N > {_BEGAN}; exec "$@"', "sh"))
    return {"seconds": done.get(timeout=60) - int(_BEGAN.read_text()) / 1e9}


def _live(name: str, number: int, with_calls: bool = False) -> _Run:
    """What each cycle of a state costs; with the system calls, all else is distorted."""
    lab, cycle, _ = _begin(_STATES[name])
    # The first cycle sets up, the second looks up the names.
    for _ in range(1 if name == _FAILING else 2):
        cycle()
        if "asleep" in name:
            lab.device.disk_sleeps()
    cycles, upnpc = [], []
    memory: _Run = {}
    before = _usage(lab)
    for _ in range(1 if name == _FAILING else _CYCLES):
        if name == _DIRECT:
            time.sleep(_PAUSE_SECONDS / 2)  # as long after its last run as the daemon
            upnpc.append(_upnpc(memory))
        with (traced(lab.daemon.pid, "-c", "-o", str(_CALLS)) if with_calls else nullcontext()):
            cycle()
            after = _usage(lab)
        cycles.append({cost: after[cost] - before[cost] for cost in after})
        if with_calls:
            summary = _CALLS.read_text().splitlines()[2:-2]
            cycles[-1]["calls"] = sum(int(line.split()[3]) for line in summary)
        before = _usage(lab)
    memory["pelorus"] = _memory(lab.daemon.pid)
    phase = (number + 0.5) / _RUNS * _PAUSE_SECONDS
    more = _AFTERWARDS[name](lab, phase, memory) if name in _AFTERWARDS and not with_calls else {}
    return {"cycles": cycles, "upnpc": upnpc, "memory": memory, **more}


def _seconds(lab: Lab, done: Callable[[], bool]) -> float:
    began = time.monotonic()
    lab.wait_for(done, "the device to be reachable", 600)
    return time.monotonic() - began


def _direct_afterwards(lab: Lab, phase: float, memory: _Run) -> _Run:
    """Another address, `phase` seconds into the pause."""
    began = time.monotonic()
    memory["miniupnpd"] = _memory(daemon.running("miniupnpd")[0])
    time.sleep(max(0, began + phase - time.monotonic()))
    lab.gateway.move_to(_NEW_ADDRESS)
    moved = _seconds(lab, lambda: _NEW_ADDRESS in str(lab.central.record))
    assert checks.pages_from_outside(address=_NEW_ADDRESS) == checks.PAGES
    return {"WAN address changes": [phase, moved]}


def _upnpc(memory: _Run) -> float:
    """The CPU time of mapping one port, ms."""
    with network.inside(network.DEVICE):
        client = subprocess.Popen(["upnpc", "-a", network.DEVICE_ADDRESS, "80", "9191", "TCP"],
                                  stdout=subprocess.DEVNULL)
    time.sleep(1)  # half of its search
    memory["upnpc"] = _memory(client.pid)
    _, client.returncode, used = os.wait4(client.pid, 0)
    assert client.returncode == 0
    return float(used.ru_utime + used.ru_stime) * 1000


def _relayed_afterwards(lab: Lab, phase: float, memory: _Run) -> _Run:
    """The tunnel client dies `phase` seconds into the pause; later the relay restarts."""
    client, count = checks.tunnel_client(), lab.device.messages.count
    memory["openvpn"] = _memory(client)
    time.sleep(phase)
    started = count(_TUNNEL_UP)
    os.kill(client, 9)
    died = _seconds(lab, lambda: count(_TUNNEL_UP) > started
                    and checks.page_through_the_tunnel(lab) == checks.PAGES[0])
    lab.relay.server.stop()
    lab.relay.start()
    returned = _seconds(lab, lambda: checks.page_through_the_tunnel(lab) == checks.PAGES[0])
    return {"tunnel client dies": [phase, died], "relay restarts": [phase, returned]}


_AFTERWARDS = {_DIRECT: _direct_afterwards, _RELAYED: _relayed_afterwards}


def _reboot(_name: str, number: int) -> _Run:
    """Device seconds until the mappings are back; the moments are spread between two tests."""
    lab, cycle, ends = _begin(_REBOOTS)
    phase = (number + 0.5) / _RUNS * _TEST_CYCLES
    for _ in range(_SETTLED + round(phase)):
        cycle()
    began = time.monotonic()
    lab.gateway.reboot()
    _seconds(lab, lambda: len(lab.gateway.mappings()) == 2)
    seconds = (time.monotonic() - began) * _REBOOTS.clock
    # The clock has jumped in the pause that had begun, and in each since.
    jumped = (1 + ends.qsize()) * _PAUSE_SECONDS * (1 - 1 / _REBOOTS.pauses)
    assert checks.pages_from_outside() == checks.PAGES
    return {"gateway reboots": [phase * _CYCLE_SECONDS, seconds + jumped]}


_PLAYS: dict[str, Callable[[str, int], _Run]] = {
    "start": _start, "live": _live, "reboot": _reboot,
    "calls": lambda name, number: _live(name, number, with_calls=True)}


def _measure(kinds: Sequence[str]) -> None:
    """Play the starts and the reboots one by one, while the other labs wait."""
    def play(delay: float, *job: str) -> None:
        time.sleep(delay)
        done = sandbox.run("bench.compare", [*job], _PATIENCE, True)
        print(*job, "played" if done.returncode == 0 else f"failed:\n{done.stdout}", flush=True)
        done.check_returncode()

    lives, alone = ([job for job in jobs if job[0] in kinds] for jobs in (_LIVES, _ALONE))
    _PARTS.mkdir(parents=True, exist_ok=True)
    with ThreadPoolExecutor(len(_LIVES)) as pool, ThreadPoolExecutor(1) as one:
        begun = [pool.submit(play, 2.5 * number, *job) for number, job in enumerate(lives)]
        begun += [one.submit(time.sleep, 2.5 * len(lives)),
                  *(one.submit(play, 0, *job) for job in alone)]
    for each in begun:
        each.result()


def _spread(values: Sequence[float], places: int = 0) -> str:
    middle, least, most = (f"{value:,.{places}f}" for value in (
        median(values), min(values), max(values)))
    return middle if least == most else f"{middle} ({least} to {most})"


def _hour(name: str, run: _Run, cost: str) -> float:
    """The cost of an hour in the steady state, of cycles with and without a port test."""
    pattern = _PATTERN[name]
    cycles, tests = 3600 / pattern["cycle_seconds"], pattern["per_hour"]["http"]
    quiet, busy = ([cycle[cost] for cycle in run["cycles"] if bool(cycle["requests"]) == asked]
                   for asked in (False, True))
    more = tests * (mean(busy) - mean(quiet)) if quiet and busy else 0
    return float(cycles * mean(quiet or busy) + more)


def _table(head: Sequence[str], *rows: Sequence[str]) -> list[str]:
    return ["", *(f"| {' | '.join(row)} |" for row in (head, ["---"] * len(head), *rows))]


def _tables(runs: _Runs) -> list[str]:
    def costs(name: str) -> list[str]:
        asked = _PATTERN[name]["per_hour"]
        hours = [[_hour(name, run, cost) for run in runs[
            "calls" if cost == "calls" else "live", name]] for cost in _COSTS]
        return [f"{asked['http'] + asked['https']:.0f}",
                f"{asked['received'] + asked['sent']:,.0f}", *map(_spread, hours)]

    upnpc = [median(run["upnpc"]) * 3600 / _CYCLE_SECONDS for run in runs["live", _DIRECT]]
    starts = [[name, f"{waits:g}", *(_spread([run["seconds"] - less for run in runs["start", name]],
                                             2) for less in (0, waits)), f"{goal:g}"]
              for name, (_, waits, goal) in _STARTS.items()]
    memory = [[f"{program}, {name}", *(_spread([run["memory"][program][kind]
                                                for run in runs["live", name]])
                                       for kind in ("Rss", "Private_Dirty"))]
              for name, program in _PROGRAMS]
    return [*_table(["Start", "required waits, s", "portforwarded after, s", "over the waits, s",
                     "goal"], *starts),
            *_table(["Event", "reachable after, s"], *(
                [event, _spread([y for _, y in _moments(runs, event)])] for event in _EVENTS)),
            *_table(["An hour of", "requests", "bytes", *_COSTS.values()], *(
                [name, *costs(name)] for name in _STATES),
                ["one `upnpc -a` in each cycle", "", "", _spread(upnpc), *[""] * 4]),
            *_table(["Memory, KiB", "resident", "private dirty"], *memory), ""]


def _moments(runs: _Runs, event: str) -> plot.Points:
    return sorted(run[event] for found in runs.values() for run in found if event in run)


def main() -> None:
    """Measure, then write the tables and the picture."""
    if sandbox.is_inside():
        kind, name, number = sys.argv[1:]
        Path(_PARTS, "-".join(sys.argv[1:])).write_text(json.dumps(_PLAYS[kind](name, int(number))))
        return
    parser = argparse.ArgumentParser(prog="bench/compare.py", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("kind", nargs="*", help=f"what to measure: {', '.join(_PLAYS)}")
    kinds = parser.parse_args().kind
    if unknown := [kind for kind in kinds if kind not in _PLAYS]:
        parser.error(f"no such kind: {unknown[0]}")
    _measure(kinds or [*_PLAYS])
    runs: _Runs = defaultdict(list)
    for kind, name, number in (*_LIVES, *_ALONE):
        runs[kind, name].append(json.loads(Path(_PARTS, f"{kind}-{name}-{number}").read_text()))
    print(text := "\n".join(_tables(runs)))
    _PAGE.write_text(re.sub(f"(?<={_MARK}).*?(?={_END})", lambda _: f"{text}\n", _PAGE.read_text(),
                            flags=re.S))
    _PICTURE.write_text(plot.svg("From an event to a device that is reached again, seconds", [
        plot.Panel("", x_name, {event: _moments(runs, event) for event in events})
        for x_name, events in (("seconds into the pause, at the event", _EVENTS[:3]),
                               ("seconds after cycle 33, at the event", _EVENTS[3:]))],
        columns=1, height=160))


if __name__ == "__main__":
    main()
