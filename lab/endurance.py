"""Long runs in the lab: many random faults, and device hours of changing weather.

scripts/endure starts it.
"""

from __future__ import annotations

import os
import random
import subprocess
import sys
import time
from collections import Counter
from collections.abc import Callable
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass, replace
from pathlib import Path

from lab import chart, daemon, faults, network, sandbox
from lab.chart import Series
from lab.checks import (IMPATIENT, MANUAL_PORTS, OPTIONS, PAGES, PAUSE, SILENT, TUNNEL_PID_FILE,
                        assert_published, assert_stops_clean, forward_by_hand,
                        page_through_the_tunnel, pages_from_outside, wait_for_next_cycle)
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.support import wait_until
from lab.timeline import Timeline

_HOUR = 3600
_GROWTH = 256  # KiB
_PICTURE = sandbox.PROJECT / "docs/long-life.svg"
# The tunnel comes up in real time, within the five device minutes that it is given.
_FAST = Situation(relay=True, clock=90)

_TROUBLED = Situation(relay=True, clock=IMPATIENT, hasty=True)
_HOMES = {
    "UPnP": _TROUBLED,
    "NAT-PMP": replace(_TROUBLED, gateway=GatewaySetup(upnp=False, natpmp=True)),
    "manual ports": replace(_TROUBLED, gateway=SILENT, dynamic=MANUAL_PORTS),
    "second NAT": _TROUBLED,
    "own router": replace(_TROUBLED, own_router=True, static={"DEVICETYPE": "5"})}
_FAULTS_IN_A_LAB = 5
_LAB_SECONDS = 400
_PATIENCE = 120
_ONE_LAB = "one-lab"
_PLAYED, _MET, _HOME, _MINUTES = "fault: ", "met: ", "home: ", "minutes: "


@dataclass(frozen=True)
class Sample:
    """The daemon as the kernel sees it in the pause after a cycle; `hour` is device time."""

    hour: float
    resident: int
    descriptors: int
    children: int
    zombies: int


class Life:
    """The daemon's life in one lab, sampled at the end of each of its cycles."""

    def __init__(self, lab: Lab) -> None:
        self.samples: list[Sample] = []
        self._lab = lab
        self._began = time.monotonic()
        lab.device.messages.listen(lambda message: self._look(message.text))

    @property
    def hour(self) -> float:
        """The device hours so far."""
        return (time.monotonic() - self._began) * self._lab.situation.clock / _HOUR

    def _look(self, line: str) -> None:
        if line.startswith(PAUSE):
            pid = self._lab.daemon.pid
            states = _states_of_children(pid)
            self.samples.append(Sample(
                self.hour, self._lab.daemon.memory("VmRSS"),
                len(list(Path(f"/proc/{pid}/fd").iterdir())), len(states), states.count("Z")))


def _states_of_children(parent: int) -> list[str]:
    found = []
    for file in Path("/proc").glob("[0-9]*/stat"):
        try:
            state, owner = file.read_text().rpartition(")")[2].split()[:2]
        except OSError:
            continue  # gone
        if int(owner) == parent:
            found.append(state)
    return found


def _reboot(lab: Lab) -> None:
    lab.gateway.reboot()


def _move(lab: Lab) -> None:
    here = lab.gateway.wan_address
    lab.gateway.move_to("44.128.0.30" if here == network.GATEWAY_WAN_ADDRESS
                        else network.GATEWAY_WAN_ADDRESS)


def _service_outage(lab: Lab) -> None:
    with faults.service_gone(lab):
        _sleep(lab, 1200)


def _disk_sleep(lab: Lab) -> None:
    lab.device.disk_sleeps()
    _sleep(lab, 2000)
    lab.device.disk_wakes()


def _relay_episode(lab: Lab) -> None:
    lab.gateway.fall_silent()
    lab.gateway.lose()
    _sleep(lab, 2400)
    lab.gateway.become(GatewaySetup())


def _quiet(_lab: Lab) -> None:
    """Nothing happens."""


_WEATHER: dict[str, Callable[[Lab], None]] = {
    "quiet": _quiet, "gateway reboots": _reboot, "internet address changes": _move,
    "service is down": _service_outage, "disk sleeps": _disk_sleep, "relay": _relay_episode}


def _sleep(lab: Lab, seconds: float) -> None:
    """Wait for so many seconds of device time."""
    time.sleep(seconds / lab.situation.clock)


def hours(count: int, seed: int) -> None:
    """Let the daemon live through device hours of changing weather, and draw what it used."""
    chance = random.Random(seed)
    lab = Lab(_FAST, Timeline())
    life = Life(lab)
    requests: list[int] = []
    weather: list[str] = []
    kinds: list[str] = []
    lab.start_daemon(*OPTIONS)
    for hour in range(count):
        # Two hours of three are quiet: the interval between port tests grows.
        kinds = kinds or chance.sample([*_WEATHER][1:], len(_WEATHER) - 1)
        kind = "quiet" if hour % 3 != 2 else kinds.pop()
        weather.append(kind)
        before = len(lab.central.requests)
        _WEATHER[kind](lab)
        lab.wait_for(lambda: life.hour >= hour + 1, "the end of the hour", 2 * _HOUR)
        requests.append(len(lab.central.requests) - before)
        print(f"hour {hour}: {kind}, {requests[-1]} requests, {life.samples[-1]}", flush=True)
    record = lab.wait_for(lambda: lab.central.record, "the device to be published", 60)
    assert record
    # Not always at the first port: those that fail their test are given up.
    assert_published(lab, record.http_port, record.https_port, external_ip=lab.gateway.wan_address)
    assert_stops_clean(lab)
    _PICTURE.write_text(chart.svg(f"{count} device hours in the lab", [
        Series("resident memory, KiB", [(s.hour, s.resident) for s in life.samples]),
        Series("open descriptors", [(s.hour, s.descriptors) for s in life.samples]),
        Series("child processes", [(s.hour, s.children) for s in life.samples]),
        Series("requests to the service in an hour",
               [(hour + 0.5, number) for hour, number in enumerate(requests)])], weather))
    _sum_up(life.samples, requests, weather)


def _sum_up(samples: list[Sample], requests: list[int], weather: list[str]) -> None:
    """Print one line, and fail unless everything stayed flat."""
    settled = [sample for sample in samples if sample.hour > len(requests) / 5]
    third = len(settled) // 3
    early, late = (max(sample.resident for sample in part)
                   for part in (settled[:third], settled[-third:]))
    quiet = [number for number, kind, earlier in zip(requests[1:], weather[1:], weather)
             if kind == earlier == "quiet"]
    least, most = min(quiet), max(quiet)
    first, highest = samples[0].resident, max(sample.resident for sample in samples)
    print(f"hours: {len(requests)} device hours, {len(samples)} cycles; resident "
          f"{first} KiB at the first pause, at most {highest}, {early} in an early and {late} in "
          f"the last third; descriptors {min(s.descriptors for s in settled)} to "
          f"{max(s.descriptors for s in settled)}; children at most "
          f"{max(s.children for s in samples)}, zombies {sum(s.zombies for s in samples)}; "
          f"{sum(requests)} requests, {least} to {most} in a quiet hour")
    assert highest <= first + _GROWTH and late <= early + _GROWTH // 2, "the daemon grows"
    assert max(s.descriptors for s in settled[-third:]) <= max(
        s.descriptors for s in settled[:third]), "descriptors grow"
    assert not any(s.zombies or s.children for s in samples)
    # A permission and a test, at the shortest interval.
    assert min(requests) >= 1 and most <= 2 * _HOUR // 240
    assert len({*weather}) >= min(len(_WEATHER), 1 + len(weather) // 3), "weather is missing"


def lab_faults(count: int, seed: int) -> int:
    """Play random faults, some in each of many labs; the number of labs that failed."""
    shares = [min(_FAULTS_IN_A_LAB, count - done) for done in range(0, count, _FAULTS_IN_A_LAB)]

    def play(number: int) -> subprocess.CompletedProcess[str]:
        share = [_ONE_LAB, str(shares[number]), str(seed + number)]
        return sandbox.run("lab.endurance", share, timeout=_LAB_SECONDS, capture=True)

    told: dict[str, list[str]] = {_PLAYED: [], _MET: [], _HOME: [], _MINUTES: []}
    failures = 0
    with ThreadPoolExecutor(os.cpu_count()) as pool:
        for number, done in enumerate(pool.map(play, range(len(shares)))):
            for line in (done.stdout or "").splitlines():
                for what, seen in told.items():
                    seen += [line.removeprefix(what)] if line.startswith(what) else []
            if done.returncode != 0:
                failures += 1
                print(f"{done.stdout}\nFAILED: scripts/endure lab-faults {shares[number]} "
                      f"{seed + number}", flush=True)
    played, met, homes = (Counter(told[what]) for what in (_PLAYED, _MET, _HOME))
    print("lab-faults, met of played:",
          ", ".join(f"{kind} {met[kind]} of {played[kind]}" for kind in sorted(played)))
    print(f"lab-faults: {met.total()} of {played.total()} faults met, {len(met)} of "
          f"{len(faults.ALL)} kinds, in {len(shares)} labs {dict(homes)}; reached again within "
          f"{max(map(float, told[_MINUTES]), default=0):.0f} device minutes; {failures} failed")
    return failures


def play_faults(count: int, seed: int) -> None:
    """Random faults at random moments in this lab; then the device is reached as before."""
    chance = random.Random(seed)
    home = chance.choice([*_HOMES])
    start = chance.choice([(), faults.CLOSED, faults.NO_SIGCHLD, None])
    # Once a clock that was ahead is right again, no port is tested: nothing would meet a fault.
    kinds = sorted(chance.choices([*faults.ALL], k=count), key="clock-ahead".__eq__)
    lab = Lab(_HOMES[home], Timeline())
    status = "relayed" if home == "second NAT" else "portforwarded"
    print(f"{_HOME}{home}", flush=True)
    try:
        if status == "relayed":
            lab.provider.insert()
        elif lab.situation.dynamic:
            forward_by_hand(lab)
        lab.start_daemon(*OPTIONS, through=(
            *(faults.foreign_locale() if start is None else start),
            *faults.adjustable_clock(lab)))
        _assert_reached(lab, status)
        for kind in kinds:
            time.sleep(chance.uniform(0, 4))
            print(f"{_PLAYED}{kind}", flush=True)
            with faults.ALL[kind](lab) as met:
                lab.wait_for(met, f"the daemon to meet {kind}", _PATIENCE)
                print(f"{_MET}{kind}", flush=True)
                time.sleep(chance.uniform(0, 4))
                _assert_bounded(lab)
        over = time.monotonic()
        _assert_reached(lab, status)
        minutes = (time.monotonic() - over) * lab.situation.clock / 60
        print(f"{_MINUTES}{minutes:.1f}", flush=True)
        assert_stops_clean(lab)
        assert not lab.situation.own_router or lab.own_router.mappings() == []
        wait_until(lambda: len(daemon.running("openvpn")) == 1, "the tunnel's end", 20)
    except Exception:
        print(lab.report())
        raise


def _assert_reached(lab: Lab, status: str) -> None:
    """The daemon makes the device reachable by the path of this status, and knows it."""

    def pages() -> list[str | None]:
        if status == "relayed":
            return [page_through_the_tunnel(lab), PAGES[1]]
        record = lab.central.record
        return pages_from_outside(record.http_port, record.https_port) if record else []

    # What an undisturbed cycle finds: before, the status may be left from better days.
    wait_for_next_cycle(lab, 2)
    lab.wait_for(lambda: lab.device.status == status and pages() == PAGES,
                 f"the device to be {status}", _PATIENCE)
    _assert_bounded(lab)


def _assert_bounded(lab: Lab) -> None:
    """The daemon lives, nothing unproven is published, no secret is told, one tunnel at most."""
    assert lab.daemon.ended() == ""
    record = lab.central.record
    assert record is None or any(
        test.passed(lab.account) and (test.address, test.port) == (
            record.external_ip, record.http_port) for test in lab.central.port_tests), record
    # One of them is the relay's; one that has been told to stop needs a moment.
    wait_until(lambda: len(daemon.running("openvpn")) <= 2, "at most one tunnel", 10)
    output = daemon.OUTPUT.read_text(errors="replace")
    lines = [*lab.device.messages.texts(), *output.splitlines()]
    assert not [line for line in lines for secret in lab.account.secrets if secret in line]
    for path in (daemon.PID_FILE, TUNNEL_PID_FILE.with_name("auth.txt")):
        assert not path.exists() or path.stat().st_mode & 0o777 == 0o600, path


def main() -> None:
    """Play a mode; the labs themselves are in sandboxes."""
    mode, count, seed = sys.argv[1], int(sys.argv[2]), int(sys.argv[3])
    if mode == "lab-faults":
        sys.exit(lab_faults(count, seed) != 0)
    if mode == _ONE_LAB:
        play_faults(count, seed)
    elif sandbox.is_inside():
        hours(count, seed)
    else:
        sys.exit(sandbox.run("lab.endurance", sys.argv[1:]).returncode)


if __name__ == "__main__":
    main()
