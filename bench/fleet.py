#!/usr/bin/python3
"""Simulates what a fleet of devices asks of the service, from the pattern measured of one.

Reads bench/pattern.json, simulates 20,000 devices, each standing for 50 of a million, draws
docs/fleet-power-cut.svg and docs/fleet-outage.svg and fills the tables of docs/fleet.md. Devices do
not influence each other, so the load is in proportion to their number.
"""

from __future__ import annotations

import argparse
import json
import random
import sys
from collections.abc import Callable
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import sandbox  # noqa: E402

_PAGE = sandbox.PROJECT / "docs/fleet.md"
_PATTERN = json.loads((sandbox.PROJECT / "bench/pattern.json").read_text())
_DEVICES, _SHARE = 20_000, 50
_MIX = {"direct": 75, "relayed, no gateway answers": 10, "relayed, behind a second NAT": 6,
        "relayed, ports closed": 4, "failing, no gateway, no relay": 3,
        "failing, ports closed, no relay": 2}
# Seconds. What happens at the incident lasts for the outage; a policy spreads over the window.
_BIN, _INCIDENT, _OUTAGE, _WINDOW, _END = 5, 600, 1800, 1800, 7200

# As in src/, and what the lab's service takes to find a port closed.
_PAUSE, _SHORTEST, _LONGEST, _STEP, _UNCHANGED = 120, 240, 960, 120, 3
_DISCOVERY, _NO_GATEWAY, _RETRY, _CLOSED, _TUNNEL, _NO_TUNNEL = 2, 8, 5, 7.5, 5, 294

# A device's id, 0 to 1, and the seconds since the service was back: how long it has to wait.
_POLICIES: dict[str, Callable[[float, float], float]] = {
    "no wait": lambda device, since: 0,
    "600 s for all": lambda device, since: 600 if since < 600 else 0,
    "400 to 1800 s at random":
        lambda device, since: random.uniform(400, _WINDOW) if since < 400 else 0,
    "until the device's own second": lambda device, since: max(device * _WINDOW - since, 0)}


class Service:
    """It is down for `outage` seconds until it is `back`, and counts what arrives, by bins."""

    def __init__(self, policy: str = "no wait", back: int = _END, outage: int = 0) -> None:
        self.back = back
        self._policy, self._outage = _POLICIES[policy], outage
        self.http, self.https, self.direct = ([0] * (_END // _BIN + 1) for _ in range(3))

    def is_down(self, now: float) -> bool:
        """Whether a request fails at once."""
        return self.back - self._outage <= now < self.back

    def wait(self, device: float, now: float) -> float:
        """The answer to a request for permission."""
        self.ask(now, self.http)
        return self._policy(device, now - self.back) if now >= self.back else 0

    @staticmethod
    def ask(now: float, kind: list[int], count: int = 1) -> None:
        """Count requests; those out of the picture in the last bin."""
        kind[int(now / _BIN) if 0 <= now < _END else -1] += count

    def rates(self) -> list[float]:
        """Requests in a second, for a million devices."""
        return [(http + https) * _SHARE / _BIN for http, https in zip(self.http, self.https)][:-1]


class Device:
    """One device, settled or about to start; its cycles follow each other as in the daemon."""

    def __init__(self, kind: str, service: Service, settled: bool) -> None:
        self._service = service
        self._gateway, self._relay = "no gateway" not in kind, "no relay" not in kind
        self._passes, self._second_nat = kind == "direct", "second NAT" in kind
        self._id, self._unchanged, self._status = random.random(), 0, kind.split(",")[0]
        self._interval, self._tested = _LONGEST, -random.uniform(0, _LONGEST)
        if not settled:
            self._status, self._interval = "connecting", _SHORTEST

    def live(self, now: float) -> None:
        """Run to the end."""
        if self._status == "connecting":
            # Its status and, with a gateway, the withdrawal of a record that may be left.
            self._service.ask(now, self._service.https, 1 + self._gateway)
        while now < _END:
            begin, before = now, self._status
            now = self._cycle(now)
            self._unchanged += 1
            if self._status != before:
                self._interval, self._unchanged = _SHORTEST, 0
            elif self._unchanged > _UNCHANGED:
                self._unchanged, self._interval = 0, min(self._interval + _STEP, _LONGEST)
            if self._status == "direct":
                begin = begin if before == "direct" else self._tested
                for index in range(max(int(begin / _BIN), 0), min(int(now / _BIN), _END // _BIN)):
                    self._service.direct[index] += 1

    def _cycle(self, now: float) -> float:
        """When the next one begins."""
        # Answers take a while, which differs from cycle to cycle.
        now += random.random() + (_DISCOVERY if self._gateway else _NO_GATEWAY)
        if ((self._status == "direct" and now - self._tested <= self._interval)
                or (self._status == "relayed" and not self._gateway)):
            return now + _PAUSE
        wait = self._service.wait(self._id, now)
        if wait > 0:
            return now + max(wait, _PAUSE)
        now = self._test(now) if self._gateway else now
        if self._tested != now and self._status != "relayed":
            self._service.ask(now, self._service.https)
            self._status = "relayed" if self._relay else "failed"
            now += _TUNNEL if self._relay else _NO_TUNNEL
        return now + _PAUSE

    def _test(self, now: float) -> float:
        """Test ports until one passes, which is noted; the time afterwards."""
        known = 3 if self._status == "direct" else 0
        for number in range(known + 9):
            # With the record, unless it is the one that is known.
            passes = self._passes and not self._service.is_down(now)
            self._service.ask(now, self._service.https, 1 + (passes and number >= known))
            if passes:
                self._status, self._tested = "direct", now
            if passes or (self._second_nat and not self._service.is_down(now)):
                break
            now += _RETRY + (0 if self._service.is_down(now) else _CLOSED)
        return now


def simulate(service: Service, starts_within: float = 0) -> Service:
    """A fleet that is settled, or that starts at the incident within so many seconds."""
    random.seed(1)
    for kind in random.choices([*_MIX], [*_MIX.values()], k=_DEVICES):
        begin = _INCIDENT + random.uniform(0, starts_within) if starts_within else (
            random.uniform(-_PAUSE, 0))
        Device(kind, service, not starts_within).live(begin)
    return service


def _row(*cells: object) -> str:
    texts = (f"{cell:,.{0 if cell >= 10 else 1}f}" if isinstance(cell, float) else str(cell)
             for cell in cells)
    return f"| {' | '.join(texts)} |"


def _states() -> list[str]:
    """The measured states, and a million, ten and a hundred million devices in each of them."""
    rows = [_row("State", "first cycle", "an hour", "a cycle takes", "1 M: requests/s", "kB/s",
                 "10 M: requests/s", "100 M: requests/s"), "|" + " --- |" * 8]
    for name, one in _PATTERN.items():
        first, hourly = one["first_cycle"], one["per_hour"]
        rate = (hourly["http"] + hourly["https"]) / 3600 * 1e6
        rows.append(_row(name, f"{first['http']} + {first['https']}",
                         f"{hourly['http']:g} + {hourly['https']:g}",
                         f"{one['cycle_seconds']:.0f} s", rate,
                         (hourly["received"] + hourly["sent"]) / 3.6, 10 * rate, 100 * rate))
    return rows


def _peaks(name: str, title: str, minutes: int, services: dict[str, Service]) -> list[str]:
    """Draw the load; its greatest values, and when the direct homes are direct again."""
    plain, tls = _PATTERN["asked to wait 600 s"]["per_hour"], _PATTERN["direct"]["shutdown"]
    http_size, tls_size = ((one["received"] + one["sent"]) / (one["http"] + one["https"])
                           for one in (plain, tls))
    rows = [_row("Waits", "1 M: peak, requests/s", "of them TLS", "MB/s", "peak from minute 4 on",
                 "from minute 5 on", "10 M: the three peaks", "100 M", "99 % direct again"),
            "|" + " --- |" * 9]
    for policy, service in services.items():
        rates, first = service.rates(), service.back // _BIN
        # Those that are direct at once test again after the shortest interval.
        peaks = [max(rates[first + since // _BIN:]) for since in (0, _SHORTEST, _SHORTEST + 60)]
        peak = peaks[0]
        secure = service.https[rates.index(peak, first)] * _SHARE / _BIN
        again = next(index for index, direct in enumerate(service.direct[first:])
                     if direct >= 0.99 * max(service.direct)) * _BIN / 60
        rows.append(_row(policy, peak, secure,
                         ((peak - secure) * http_size + secure * tls_size) / 1e6, *peaks[1:],
                         *(", ".join(f"{each * n / 1e6:.2g} M" for each in peaks)
                           for n in (10, 100)),
                         f"{again:.0f} min"))
    times = [index * _BIN / 60 for index in range(minutes * 60 // _BIN)]
    panels = [plot.Panel(what, "minutes", {policy: [*zip(times, values(service))]
                                           for policy, service in services.items()})
              for what, values in (
                  ("requests to the service in a second, a million devices", Service.rates),
                  ("% of the devices reached directly",
                   lambda service: [100 * direct / _DEVICES for direct in service.direct]))]
    (_PAGE.parent / f"fleet-{name}.svg").write_text(plot.svg(title, panels, 1, height=250))
    return rows


def main() -> None:
    """Simulate, draw, fill in the tables."""
    argparse.ArgumentParser(prog="bench/fleet.py", description=__doc__).parse_args()
    rates, back = simulate(Service()).rates(), _INCIDENT + _OUTAGE
    measured = sum(share / 100 * (_PATTERN[kind]["per_hour"]["http"] + _PATTERN[kind]["per_hour"]
                                  ["https"]) for kind, share in _MIX.items()) / 3600 * 1e6
    cuts = {policy: simulate(Service(policy, _INCIDENT), starts_within=60) for policy in _POLICIES}
    outages = {policy: simulate(Service(policy, back, _OUTAGE)) for policy in _POLICIES}
    refused = max(outages["no wait"].rates()[_INCIDENT // _BIN:back // _BIN])
    tables = {
        "states": _states(),
        "quiet": [f"A million devices in this mix send {sum(rates) / len(rates):,.0f} requests/s "
                  f"in the simulation; their measured patterns add up to {measured:,.0f}. While "
                  f"the service is down they try at most {refused:,.0f} times in a second."],
        "power-cut": _peaks("power-cut", "After a power cut: a million devices start within a "
                            "minute", 60, cuts),
        "outage": _peaks("outage", "The service is down from minute 10 to 40", 90, outages)}
    text = _PAGE.read_text()
    for name, lines in tables.items():
        print(*lines, sep="\n")
        before, _, rest = text.partition(f"<!-- {name} -->\n")
        after = rest.partition("<!-- end -->")[2]
        text = "\n".join([f"{before}<!-- {name} -->", *lines, f"<!-- end -->{after}"])
    _PAGE.write_text(text)


if __name__ == "__main__":
    main()
