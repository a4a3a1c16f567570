#!/usr/bin/python3
"""Measures the daemon beside what a device would use instead: tables in docs/performance.md.

Each run is a lab of its own. Most labs run side by side in real time, because a faster clock is a
library in the daemon's own memory. It takes 16 minutes and plays the release build that is there.
"""

from __future__ import annotations

import json
import os
import queue
import re
import statistics
import subprocess
import sys
import time
from collections.abc import Callable, Sequence
from concurrent.futures import ThreadPoolExecutor
from contextlib import nullcontext
from pathlib import Path
from typing import Any

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import daemon, network, sandbox  # noqa: E402
from lab.checks import (PAGES, SILENT, page_through_the_tunnel, pages_from_outside,  # noqa: E402
                        tunnel_client)
from lab.faults import traced  # noqa: E402
from lab.gateway import GatewaySetup  # noqa: E402
from lab.scenario import Lab, Situation  # noqa: E402
from lab.support import wait_until  # noqa: E402
from lab.timeline import Timeline  # noqa: E402

_PARTS = sandbox.PROJECT / "build/compare"
_PAGE = sandbox.PROJECT / "docs/performance.md"
_PICTURE = sandbox.PROJECT / "docs/compare.svg"
_RUNS = 5
_PATIENCE = 1500  # seconds
_PAUSE_SECONDS = 120
_CYCLES = 5
_UPNPC_RUNS = 5
_END_OF_CYCLE = re.compile(r"DaemonControl::run - (?:retry connection after|sleep) (\d+) secs")
_BEGAN, _CALLS = Path("/run/lab/began"), Path("/run/lab/calls")
_STAMPED = ("sh", "-c", f'date +%s%N > {_BEGAN}; exec "$@"', "sh")
_NEW_ADDRESS = "44.128.0.30"
_CLOCK, _PAUSES = 10, 12  # of the reboots: by then the tests are 976 s apart
_SETTLED, _TEST_SECONDS = 4000, 976
_PATTERN = json.loads((sandbox.PROJECT / "bench/pattern.json").read_text())
_MARK, _END = "<!-- compare -->", "<!-- end -->"
_Numbers = dict[str, float]

_STARTS = {"UPnP": (GatewaySetup(), 5.0, 0.15),
           "NAT-PMP": (GatewaySetup(upnp=False, natpmp=True), 17.0, 0.1)}
# By the names of pattern.json.
_STATES = {"direct": Situation(),
           "direct, disk asleep": Situation(),
           "relayed, no gateway answers": Situation(SILENT, relay=True),
           "failing, no gateway, no relay": Situation(SILENT)}
_FAILING = "failing, no gateway, no relay"
_COSTS = {"cpu": "CPU, ms", "children": "CPU of its commands, ms", "wakes": "wake-ups",
          "calls": "system calls", "written": "bytes written"}
_EVENTS = ("WAN address changes", "tunnel client dies", "relay restarts", "gateway reboots")
_PROGRAMS = (("direct", "pelorus"), ("relayed, no gateway answers", "pelorus"),
             ("direct", "miniupnpd"), ("direct", "upnpc"),
             ("relayed, no gateway answers", "openvpn"))


class _Life:
    """A daemon in a lab, cycle by cycle."""

    def __init__(self, situation: Situation) -> None:
        self.lab = Lab(situation, Timeline())
        self._ends: queue.SimpleQueue[int] = queue.SimpleQueue()
        self._began, self._skipped = time.monotonic(), 0
        self.lab.device.messages.listen(lambda message: self._look(message.text))
        self.lab.start_daemon("-l", "6", "-f", "30")

    def _look(self, line: str) -> None:
        if end := _END_OF_CYCLE.match(line):
            self._skipped += self.jump(int(end[1]))
            self._ends.put(int(end[1]))

    def jump(self, pause: int) -> int:
        """By how much the device's clock jumps in a pause."""
        return pause - pause // self.lab.situation.pauses

    def now(self) -> float:
        """Device seconds; those of a pause that has begun are over."""
        return (time.monotonic() - self._began) * self.lab.situation.clock + self._skipped

    def cycle(self) -> int:
        """Wait for the end of a cycle; the seconds of the pause that begins."""
        return self._ends.get(timeout=_PATIENCE)

    def usage(self) -> _Numbers:
        """What the kernel has counted so far; the commands' CPU time only to 10 ms."""
        time.sleep(1)  # from the line that ends a cycle to the sleep
        process = Path(f"/proc/{self.lab.daemon.pid}")
        stat = (process / "stat").read_text().rpartition(")")[2].split()
        # The CPU clock of a process, which no header of Python's names: see clock_getcpuclockid(3).
        return {"cpu": time.clock_gettime(~self.lab.daemon.pid << 3 | 2) * 1000,
                "children": (int(stat[13]) + int(stat[14])) * 1000 / os.sysconf("SC_CLK_TCK"),
                "wakes": _counted(process / "status", "voluntary_ctxt_switches"),
                "written": _counted(process / "io", "wchar"),
                "requests": len(self.lab.central.requests)}


def _counted(file: Path, name: str) -> int:
    return next(int(line.split()[1]) for line in file.read_text().splitlines()
                if line.startswith(f"{name}:"))


def _memory(pid: int) -> _Numbers:
    """KiB."""
    rollup = Path(f"/proc/{pid}/smaps_rollup")
    return {name: _counted(rollup, name) for name in ("Rss", "Private_Dirty")}


def _start(protocol: str) -> dict[str, object]:
    """Seconds from the process's start to "portforwarded", and where the log stood still."""
    lab = Lab(Situation(_STARTS[protocol][0]), Timeline())
    done: queue.SimpleQueue[float] = queue.SimpleQueue()
    lab.timeline.listen(lambda event: done.put(time.time()) if event.what ==
                        "status: portforwarded" else None)
    lab.start_daemon("-l", "7", "-f", "30", through=_STAMPED)
    seconds = done.get(timeout=60) - int(_BEGAN.read_text()) / 1e9
    lines = [message for message in lab.device.messages.all]
    gaps = sorted(((later.when - line.when, line.text, later.text)
                   for line, later in zip(lines, lines[1:])), reverse=True)
    lab.stop_daemon()
    return {"seconds": seconds, "gaps": gaps[:20]}


def _live(name: str, number: int, with_calls: bool) -> dict[str, object]:
    """What each cycle of a state costs; with the system calls, nothing else is true."""
    life = _Life(_STATES[name])
    lab = life.lab
    # The first cycle sets up, the second looks up the names.
    for _ in range(1 if name == _FAILING else 2):
        life.cycle()
        if "asleep" in name:
            lab.device.disk_sleeps()
    cycles = []
    before = life.usage()
    for _ in range(1 if name == _FAILING else _CYCLES):
        with (traced(lab.daemon.pid, "-c", "-o", str(_CALLS)) if with_calls else nullcontext()):
            life.cycle()
            after = life.usage()
        cycles.append({cost: after[cost] - before[cost] for cost in after})
        if with_calls:
            wait_until(_CALLS.read_text, "the system calls", 5)
            cycles[-1]["calls"] = sum(int(line.split()[3]) for line in
                                      _CALLS.read_text().splitlines()[2:-2])
            _CALLS.unlink()
        before = life.usage()
    memory = {"pelorus": _memory(lab.daemon.pid)}
    found: dict[str, object] = {"status": lab.device.status, "cycles": cycles, "memory": memory}
    if name in _AFTERWARDS and not with_calls:
        found |= _AFTERWARDS[name](lab, (number + 0.5) / _RUNS * _PAUSE_SECONDS, memory)
    return found


def _seconds(lab: Lab, done: Callable[[], bool]) -> float:
    began = time.monotonic()
    lab.wait_for(done, "the device to be reachable", 600)
    return time.monotonic() - began


def _direct_afterwards(lab: Lab, phase: float, memory: dict[str, _Numbers]) -> dict[str, object]:
    """Another address, `phase` seconds into the pause; before it, upnpc beside the daemon."""
    began = time.monotonic()
    memory["miniupnpd"] = _memory(daemon.running("miniupnpd")[0])
    upnpc = [_upnpc(memory) for _ in range(_UPNPC_RUNS)]
    time.sleep(max(0, began + phase - time.monotonic()))
    lab.gateway.move_to(_NEW_ADDRESS)
    moved = _seconds(lab, lambda: lab.central.record is not None and
                     lab.central.record.external_ip == _NEW_ADDRESS)
    assert pages_from_outside(address=_NEW_ADDRESS) == PAGES
    return {"upnpc": upnpc, "WAN address changes": [phase, moved]}


def _upnpc(memory: dict[str, _Numbers]) -> float:
    """The CPU time of mapping one port, ms."""
    with network.inside(network.DEVICE):
        client = subprocess.Popen(["upnpc", "-a", network.DEVICE_ADDRESS, "80", "9191", "TCP"],
                                  stdout=subprocess.DEVNULL)
    time.sleep(1)  # half of its search
    memory["upnpc"] = _memory(client.pid)
    _, status, used = os.wait4(client.pid, 0)
    client.returncode = status
    assert status == 0
    return float(used.ru_utime + used.ru_stime) * 1000


def _relayed_afterwards(lab: Lab, phase: float, memory: dict[str, _Numbers]) -> dict[str, object]:
    """The tunnel client dies `phase` seconds into the pause; later the relay restarts."""
    client = tunnel_client()
    memory["openvpn"] = _memory(client)
    time.sleep(phase)
    started = lab.device.messages.count(_TUNNEL_UP)
    os.kill(client, 9)
    died = _seconds(lab, lambda: lab.device.messages.count(_TUNNEL_UP) > started and
                    page_through_the_tunnel(lab) == PAGES[0])
    time.sleep(5)
    connections = lab.relay.connections()
    lab.relay.server.stop()
    lab.relay.start()
    returned = _seconds(lab, lambda: lab.relay.connections() > connections and
                        page_through_the_tunnel(lab) == PAGES[0])
    return {"tunnel client dies": [phase, died], "relay restarts": [phase, returned]}


_TUNNEL_UP = "openVPNConnection() - openVPN has started successfully"
_AFTERWARDS = {"direct": _direct_afterwards, "relayed, no gateway answers": _relayed_afterwards}


def _reboot(number: int) -> dict[str, object]:
    """Device seconds until the mappings are back; the moments are spread between two tests."""
    life = _Life(Situation(clock=_CLOCK, pauses=_PAUSES))
    phase = (number + 0.5) / _RUNS * _TEST_SECONDS
    pause = 0
    while life.now() < _SETTLED + phase:
        pause = life.cycle()
    rebooted = life.now() - life.jump(pause)  # the pause has just begun
    life.lab.gateway.reboot()
    life.lab.wait_for(lambda: len(life.lab.gateway.mappings()) == 2, "the mappings", _PATIENCE)
    seconds = life.now() - rebooted
    assert pages_from_outside() == PAGES
    return {"gateway reboots": [phase, seconds]}


def _play(arguments: Sequence[str]) -> dict[str, object]:
    kind, name, number = arguments
    if kind == "start":
        return _start(name)
    if kind == "reboot":
        return _reboot(int(number))
    return _live(name, int(number), kind == "calls")


_LIVES = [*(("live", name, str(run)) for name in reversed(_STATES) for run in range(_RUNS)),
          *(("calls", name, "0") for name in reversed(_STATES))]
_ALONE = [*(("start", name, str(run)) for run in range(_RUNS) for name in _STARTS),
          *(("reboot", "reboot", str(run)) for run in range(_RUNS))]


def _measure(delay: float, *arguments: str) -> None:
    time.sleep(delay)
    done = sandbox.run("bench.compare", [*arguments], _PATIENCE, True)
    print(*arguments, "played" if done.returncode == 0 else f"failed:\n{done.stdout}", flush=True)
    done.check_returncode()


def _measure_all() -> None:
    """Play everything: the starts and the reboots one by one, while the other labs wait."""
    _PARTS.mkdir(parents=True, exist_ok=True)
    with ThreadPoolExecutor(len(_LIVES)) as pool, ThreadPoolExecutor(1) as one:
        jobs = [pool.submit(_measure, 2.5 * number, *job) for number, job in enumerate(_LIVES)]
        jobs += [one.submit(_measure, 2.5 * len(_LIVES) * (number == 0), *job)
                 for number, job in enumerate(_ALONE)]
    for job in jobs:
        job.result()


def _spread(values: Sequence[float], places: int = 0) -> str:
    middle, least, most = (f"{value:,.{places}f}" for value in (
        statistics.median(values), min(values), max(values)))
    return f"{middle} ({least}..{most})"


def _hour(name: str, run: dict[str, Any], cost: str) -> float:
    """The cost of an hour in the steady state, of cycles with and without a port test."""
    pattern = _PATTERN[name]
    cycles, tests = 3600 / pattern["cycle_seconds"], pattern["per_hour"]["http"]
    quiet, busy = ([cycle[cost] for cycle in run["cycles"] if bool(cycle["requests"]) == asked]
                   for asked in (False, True))
    if not quiet:
        return float(cycles * statistics.mean(busy))
    more = statistics.mean(busy) - statistics.mean(quiet) if busy else 0
    return float(cycles * statistics.mean(quiet) + tests * more)


def _tables(runs: dict[str, list[dict[str, Any]]]) -> list[str]:
    lines = ["| Start to \"portforwarded\" | required waits, s | whole time, s | over the waits, s "
             "| goal |", "| --- | --- | --- | --- | --- |"]
    for protocol, (_, waits, goal) in _STARTS.items():
        times = [run["seconds"] for run in runs[protocol]]
        lines.append(f"| {protocol} | {waits:.1f} | {_spread(times, 2)} | "
                     f"{_spread([time - waits for time in times], 2)} | {goal} |")
    live = {name: [run for run in runs[name] if "calls" not in run["cycles"][0]]
            for name in _STATES}
    own = [_hour("direct", run, "cpu") for run in live["direct"]]
    cycles = 3600 / _PATTERN["direct"]["cycle_seconds"]
    upnpc = [statistics.median(run["upnpc"]) * cycles for run in live["direct"]]
    lines += ["", "| CPU of an hour | ms | of `upnpc` |", "| --- | --- | --- |",
              f"| the daemon, direct | {_spread(own)} | "
              f"{statistics.median(own) / statistics.median(upnpc):.2f} (goal: 0.5) |",
              f"| one `upnpc -a` in each cycle | {_spread(upnpc)} | 1 |",
              "", "| Event | seconds until reachable |", "| --- | --- |"]
    lines += [f"| {event} | {_spread([seconds for _, seconds in _moments(runs, event)])} |"
              for event in _EVENTS]
    lines += ["", f"| An hour of | requests | bytes | {' | '.join(_COSTS.values())} |",
              "| --- " * (3 + len(_COSTS)) + "|"]
    for name in _STATES:
        asked = _PATTERN[name]["per_hour"]
        cells = [f"{asked['http'] + asked['https']:.0f}",
                 f"{asked['received'] + asked['sent']:,.0f}"]
        for cost in _COSTS:
            chosen = live[name] if cost != "calls" else [
                run for run in runs[name] if run not in live[name]]
            hours = [_hour(name, run, cost) for run in chosen]
            cells.append(_spread(hours) if len(hours) > 1 else f"{hours[0]:,.0f}")
        lines.append(f"| {name} | {' | '.join(cells)} |")
    lines += ["", "| Memory, KiB | resident | private dirty |", "| --- | --- | --- |"]
    for state, program in _PROGRAMS:
        cells = [_spread([run["memory"][program][kind] for run in live[state]])
                 for kind in ("Rss", "Private_Dirty")]
        lines.append(f"| {program}, {state} | {' | '.join(cells)} |")
    return lines


def _moments(runs: dict[str, list[dict[str, Any]]], event: str) -> plot.Points:
    return sorted(run[event] for found in runs.values() for run in found if event in run)


def _picture(runs: dict[str, list[dict[str, Any]]]) -> str:
    def over(protocol: str) -> plot.Points:
        return [(number, (run["seconds"] - _STARTS[protocol][1]) * 1000)
                for number, run in enumerate(runs[protocol], start=1)]

    panels = [plot.Panel('Start to "portforwarded" over the required waits, ms', "run",
                         {protocol: over(protocol) for protocol in _STARTS})]
    panels += [plot.Panel("Seconds until reachable", x_name, {
        event: _moments(runs, event) for event in events}) for x_name, events in (
            ("seconds into the pause at the event", _EVENTS[:3]),
            ("seconds into the time between two tests", _EVENTS[3:]))]
    return plot.svg("From the start, and from an event, to a device that is reached", panels,
                    columns=1, height=150)


def main() -> None:
    """Measure, then write the tables and the picture."""
    if sandbox.is_inside():
        Path(_PARTS, "-".join(sys.argv[1:])).write_text(json.dumps(_play(sys.argv[1:])))
        return
    if why := sandbox.why_forbidden():
        sys.exit(f"compare: no lab on this machine: {why}")
    if sys.argv[1:] != ["--again"]:
        _measure_all()
    runs: dict[str, list[dict[str, Any]]] = {}
    for job in (*_LIVES, *_ALONE):
        runs.setdefault(job[1], []).append(json.loads(Path(_PARTS, "-".join(job)).read_text()))
    lines = _tables(runs)
    print("\n".join(lines))
    before, _, rest = _PAGE.read_text().partition(_MARK)
    _PAGE.write_text("\n".join([before + _MARK, *lines, "", _END + rest.partition(_END)[2]]))
    _PICTURE.write_text(_picture(runs))


if __name__ == "__main__":
    main()
