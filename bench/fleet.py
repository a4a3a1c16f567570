#!/usr/bin/python3
"""Simulates what a fleet of devices asks of the service, from the pattern measured of one.

Reads bench/pattern.json, simulates 20,000 devices, each standing for 50 of a million, draws
docs/fleet-power-cut.svg and docs/fleet-outage.svg and fills the tables of docs/fleet.md. Devices do
not influence each other, so the load is in proportion to their number.
"""

from __future__ import annotations

import json
import random
import sys
from collections.abc import Callable
from dataclasses import dataclass
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import sandbox  # noqa: E402

_DOCS = sandbox.PROJECT / "docs"
_PATTERN = json.loads((sandbox.PROJECT / "bench/pattern.json").read_text())
_DEVICES, _MILLION = 20_000, 1_000_000
_MIX = {"direct": 75, "relayed, no gateway answers": 10, "relayed, behind a second NAT": 6,
        "relayed, ports closed": 4, "failing, no gateway, no relay": 3,
        "failing, ports closed, no relay": 2}
_BIN = 5           # seconds
_INCIDENT = 600    # seconds from the beginning of a simulation
_OUTAGE = 1800     # seconds
_END = 2 * 3600
_WINDOW = 1800     # seconds over which a policy spreads the devices

# As in src/, and what the lab's service takes to find a port closed.
_PAUSE, _SHORTEST, _LONGEST, _STEP, _UNCHANGED = 120, 240, 960, 120, 3
_DISCOVERY, _NO_GATEWAY, _RETRY, _CLOSED, _TUNNEL, _NO_TUNNEL = 2, 8, 5, 7.5, 5, 294

# A device's id, 0 to 1, and the time since the incident: seconds to wait, or 0.
Policy = Callable[[float, float], float]


def _fixed(_device: float, since: float) -> float:
    return 600 if since < 600 else 0


def _random(_device: float, since: float) -> float:
    return random.uniform(400, _WINDOW) if since < 400 else 0


def _slot(device: float, since: float) -> float:
    return max(device * _WINDOW - since, 0)


POLICIES: dict[str, Policy] = {
    "no wait": lambda _device, _since: 0, "600 s for all": _fixed,
    "400 to 1800 s at random": _random, "until the device's own second": _slot}


@dataclass(frozen=True)
class Service:
    """The service is down for some seconds before it is `back`; then it asks devices to wait."""

    policy: Policy = POLICIES["no wait"]
    back: int = _END
    down: int = 0

    def is_down(self, now: float) -> bool:
        """Whether a request fails at once."""
        return self.back - self.down <= now < self.back

    def wait(self, device: float, now: float) -> float:
        """The answer to a request for permission."""
        return self.policy(device, now - self.back) if now >= self.back else 0


class Load:
    """What arrives at the service, by bins of time, and how many devices are direct."""

    def __init__(self) -> None:
        self.http, self.https, self.direct = ([0] * (_END // _BIN) for _ in range(3))

    def add(self, when: float, http: int, https: int) -> None:
        """Requests at a moment."""
        if 0 <= when < _END:
            self.http[int(when / _BIN)] += http
            self.https[int(when / _BIN)] += https

    def add_direct(self, begin: float, end: float) -> None:
        """A device is direct meanwhile."""
        for index in range(int(begin / _BIN), int(min(end, _END) / _BIN)):
            self.direct[index] += 1

    def series(self, values: list[int]) -> list[float]:
        """Per second, for a million devices."""
        return [value / _BIN * _MILLION / _DEVICES for value in values]

    def rates(self) -> list[float]:
        """All requests per second, for a million devices."""
        return self.series([http + https for http, https in zip(self.http, self.https)])


class Device:
    """One device; its cycles follow each other as in the daemon."""

    def __init__(self, kind: str, load: Load, service: Service) -> None:
        self._load, self._service = load, service
        self._gateway = "no gateway" not in kind
        self._relay = "no relay" not in kind
        self._passes = kind == "direct"
        self._second_nat = "second NAT" in kind
        self._id = random.random()
        self._status = "connecting"
        self._interval, self._unchanged, self._tested = _SHORTEST, 0, 0.0

    def settle(self) -> None:
        """Have run for hours."""
        self._status = ("direct" if self._passes else "relayed" if self._relay else "failed")
        self._interval, self._tested = _LONGEST, -random.uniform(0, _LONGEST)

    def live(self, now: float) -> None:
        """Run from the daemon's start, or on, to the end."""
        if self._status == "connecting":
            # The status, and the withdrawal of a record that may be left; no permission is needed.
            # Without a gateway the withdrawal is left out here, but not in the search.
            self._load.add(now, 0, 2 if self._gateway else 1)
        since = now
        while now < _END:
            before = self._status
            work, wait = self._cycle(now)
            if self._status != before:
                self._interval, self._unchanged = _SHORTEST, 0
            elif self._status in ("direct", "relayed"):
                self._unchanged += 1
                if self._unchanged > _UNCHANGED:
                    self._unchanged, self._interval = 0, min(self._interval + _STEP, _LONGEST)
            if before == "direct" != self._status:
                self._load.add_direct(since, now)
            if before != self._status == "direct":
                since = now + work
            now += work + max(_PAUSE, wait)
        if self._status == "direct":
            self._load.add_direct(since, _END)

    def _cycle(self, now: float) -> tuple[float, float]:
        """The seconds that the cycle's work takes, and those that the service asks to wait."""
        # Answers take a while, which differs from cycle to cycle.
        work = random.random() + (_DISCOVERY if self._gateway else _NO_GATEWAY)
        if self._status == "direct" and now - self._tested <= self._interval:
            return work, 0
        if not self._gateway and self._status == "relayed":
            return work, 0
        self._load.add(now + work, 1, 0)
        wait = self._service.wait(self._id, now)
        if wait > 0:
            return work, wait
        seconds, passed = self._test(now + work) if self._gateway else (0, False)
        work += seconds
        if not passed and self._status != "relayed":
            self._load.add(now + work, 0, 1)
            self._status = "relayed" if self._relay else "failed"
            work += _TUNNEL if self._relay else _NO_TUNNEL
        return work, 0

    def _test(self, begin: float) -> tuple[float, bool]:
        """Test ports until one passes; the seconds spent on failures, and whether one passed."""
        searched_after = 3 if self._status == "direct" else 0
        seconds = 0.0
        for number in range(searched_after + 9):
            now = begin + seconds
            self._load.add(now, 0, 1)
            down = self._service.is_down(now)
            if self._passes and not down:
                # The record, unless it is the test of a port that is published.
                self._load.add(now, 0, int(number >= searched_after))
                self._status, self._tested = "direct", now
                return seconds, True
            if self._second_nat and not down:
                break
            seconds += _RETRY if down else _RETRY + _CLOSED
        return seconds, False


def simulate(kinds: dict[str, int], service: Service, starts_within: float = 0) -> Load:
    """A fleet that is settled, or that starts at the incident within so many seconds."""
    random.seed(1)
    load = Load()
    for kind in random.choices([*kinds], [*kinds.values()], k=_DEVICES):
        device = Device(kind, load, service)
        if starts_within:
            device.live(_INCIDENT + random.uniform(0, starts_within))
        else:
            device.settle()
            device.live(random.uniform(0, _PAUSE))
    return load


def _bytes(http: float, https: float, key: str) -> float:
    """The measured bytes of so many requests."""
    plain, tls = _PATTERN["asked to wait 600 s"]["per_hour"], _PATTERN["direct"]["shutdown"]
    return float(http * plain[key] / plain["http"] + https * tls[key] / tls["https"])


def _number(value: float) -> str:
    return f"{value:,.0f}" if value >= 10 else f"{value:.2g}"


def _states() -> list[str]:
    """The measured states, and a million, ten and a hundred million devices in each of them."""
    lines = ["| State | first cycle | requests in an hour | in a cycle of | 1 M: /s | kB/s | 10 M: /s "
             "| 100 M: /s |", "| --- | --- | --- | --- | --- | --- | --- | --- |"]
    for name, one in _PATTERN.items():
        first, hourly = one["first_cycle"], one["per_hour"]
        asked = hourly["http"] + hourly["https"]
        size = (hourly["received"] + hourly["sent"]) / 3600 * _MILLION / 1000
        rates = " | ".join(_number(asked / 3600 * count * _MILLION) for count in (1, 10, 100))
        rate, rest = rates.split(" | ", 1)
        lines.append(f"| {name} | {first['http']} + {first['https']} | {hourly['http']:g} + "
                     f"{hourly['https']:g} | {one['cycle_seconds']:.0f} s | {rate} | "
                     f"{_number(size)} | {rest} |")
    return lines


def _peaks(loads: dict[str, Load], back: int) -> list[str]:
    """The greatest load once the service is back, and when the direct homes are direct again."""
    lines = ["| Waits | 1 M: peak, requests/s | of them TLS | MB/s | peak from minute 5 on "
             "| 10 M: peaks | 100 M: peaks | 99 % direct again |",
             "| --- | --- | --- | --- | --- | --- | --- | --- |"]
    first = back // _BIN
    for name, load in loads.items():
        rates, tls, most = load.rates(), load.series(load.https), max(load.direct)
        peak = max(range(first, len(rates)), key=lambda index: rates[index])
        later = max(rates[first + 300 // _BIN:])
        tens, hundreds = (f"{_number(factor * rates[peak])}, then {_number(factor * later)}"
                          for factor in (10, 100))
        size = sum(_bytes(rates[peak] - tls[peak], tls[peak], key) for key in ("received", "sent"))
        back_at = next(index for index in range(first, len(load.direct))
                       if load.direct[index] >= 0.99 * most)
        lines.append(f"| {name} | {_number(rates[peak])} | {_number(tls[peak])} | {size / 1e6:.0f} "
                     f"| {_number(later)} | {tens} | {hundreds} "
                     f"| after {(back_at - first) * _BIN / 60:.0f} min |")
    return lines


def _draw(name: str, title: str, loads: dict[str, Load], minutes: int) -> None:
    count = minutes * 60 // _BIN
    times = [index * _BIN / 60 for index in range(count)]
    panels = [plot.Panel("requests to the service in a second, a million devices", "minutes",
                         {policy: [*zip(times, load.rates())] for policy, load in loads.items()}),
              plot.Panel("% of the devices reached directly", "minutes",
                         {policy: [(when, 100 * direct / _DEVICES)
                                   for when, direct in zip(times, load.direct)]
                          for policy, load in loads.items()})]
    (_DOCS / f"fleet-{name}.svg").write_text(plot.svg(title, panels, columns=1, height=250))


def main() -> None:
    """Simulate, draw, fill in the tables."""
    quiet = simulate(_MIX, Service())
    mean = sum(quiet.rates()) / len(quiet.rates())
    measured = sum(share / 100 * (_PATTERN[kind]["per_hour"]["http"]
                                  + _PATTERN[kind]["per_hour"]["https"]) for kind, share in
                   _MIX.items()) / 3600 * _MILLION
    back = _INCIDENT + _OUTAGE
    cuts = {name: simulate(_MIX, Service(policy, _INCIDENT), starts_within=60)
            for name, policy in POLICIES.items()}
    outages = {name: simulate(_MIX, Service(policy, back, _OUTAGE))
               for name, policy in POLICIES.items()}
    refused = max(outages["no wait"].rates()[_INCIDENT // _BIN:back // _BIN])
    tables = {"states": _states(), "quiet": [
        f"A million devices in this mix send {mean:.1f} requests/s in the simulation; their "
        f"measured patterns add up to {measured:.1f}. While the service is down they try at most "
        f"{refused:,.0f} times in a second."],
        "power-cut": _peaks(cuts, _INCIDENT), "outage": _peaks(outages, back)}
    _draw("power-cut", "After a power cut: a million devices start within a minute", cuts, 60)
    _draw("outage", "After 30 minutes in which the service was down", outages, 90)
    page = _DOCS / "fleet.md"
    text = page.read_text()
    for name, lines in tables.items():
        print(name, *lines, sep="\n")
        before, _, rest = text.partition(f"<!-- {name} -->\n")
        after = rest.partition("<!-- end -->")[2]
        text = "\n".join([f"{before}<!-- {name} -->", *lines, f"<!-- end -->{after}"])
    page.write_text(text)


if __name__ == "__main__":
    main()
