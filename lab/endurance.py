"""Long runs in the lab: many random faults, and device hours of changing weather.

scripts/endure starts it.
"""

from __future__ import annotations

import random
import sys
import threading
import time
from collections.abc import Callable
from contextlib import ExitStack
from dataclasses import dataclass
from pathlib import Path

from lab import chart, daemon, faults, network, sandbox
from lab.chart import Series
from lab.checks import (NO_TUNNEL, OPTIONS, PAUSE, assert_log_is_proper, assert_published,
                        assert_stops_clean)
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.support import LabError, wait_until
from lab.timeline import Timeline

_HOUR = 3600
_PICTURE = sandbox.PROJECT / "docs/long-life.svg"
# The tunnel comes up in real time, within the five device minutes that it is given.
_FAST = Situation(relay=True, clock=90)


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
    lab.start_daemon(*OPTIONS)
    for hour in range(count):
        # Two hours of three are quiet: the interval between port tests grows.
        kind = "quiet" if hour % 3 != 2 else chance.choice([*_WEATHER][1:])
        weather.append(kind)
        before = len(lab.central.requests)
        try:
            _WEATHER[kind](lab)
        except LabError as error:
            print(f"hour {hour}: {error}", flush=True)
        lab.wait_for(lambda: life.hour >= hour + 1, "the end of the hour", 2 * _HOUR)
        requests.append(len(lab.central.requests) - before)
        print(f"hour {hour}: {kind}, {requests[-1]} requests, {life.samples[-1]}", flush=True)
    lab.wait_for(lambda: lab.central.record, "the device to be published", 60)
    external_ip = lab.gateway.wan_address
    assert_published(lab, external_ip=external_ip)
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
    print(f"hours: {len(requests)} device hours, {len(samples)} cycles; resident "
          f"{samples[0].resident} KiB at the first pause, at most {early} in an early and {late} in "
          f"the last third; descriptors {min(s.descriptors for s in settled)} to "
          f"{max(s.descriptors for s in settled)}; children at most "
          f"{max(s.children for s in samples)}, zombies {sum(s.zombies for s in samples)}; "
          f"{sum(requests)} requests, {min(quiet)} to {max(quiet)} in a quiet hour")
    assert late <= early * 1.05 + 128, "the daemon grows"
    assert max(s.descriptors for s in settled[-third:]) <= max(
        s.descriptors for s in settled[:third]), "descriptors grow"
    assert not any(s.zombies or s.children for s in samples)
    assert max(quiet) <= 2 * _HOUR // 240


def main() -> None:
    """Play a mode, in this sandbox."""
    mode, count, seed = sys.argv[1], int(sys.argv[2]), int(sys.argv[3])
    if not sandbox.is_inside():
        sys.exit(sandbox.run("lab.endurance", sys.argv[1:]).returncode)
    if mode == "hours":
        hours(count, seed)


if __name__ == "__main__":
    main()
