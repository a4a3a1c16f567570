#!/usr/bin/python3
"""Measures whether any cost of the daemon grows faster than what it depends on.

Runs bench/growth.cpp, prints a table with a verdict for each measure, and draws docs/growth.svg.
Exit status 1 when something grows faster than linearly.
"""

from __future__ import annotations

import math
import statistics
import subprocess
import sys
from collections import defaultdict
from dataclasses import dataclass
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import sandbox  # noqa: E402

_PROGRAM = sandbox.PROJECT / "build/bench/bench/growth"
_PICTURE = sandbox.PROJECT / "docs/growth.svg"
_SIZES = (10, 50, 100, 250, 500, 1000, 2000, 5000)
# Above 1 by what noise adds, and by the logarithm in sorting keys.
_STEEPEST = 1.15


@dataclass(frozen=True)
class Measure:
    """What `growth` measures when called with each of `sizes`."""

    name: str
    title: str
    x_name: str
    sizes: tuple[int, ...] = _SIZES
    repetitions: int = 5

    def points(self) -> list[tuple[float, float]]:
        """Sizes and medians in microseconds."""
        found: dict[int, list[float]] = defaultdict(list)
        for size in self.sizes * self.repetitions:
            output = subprocess.run([_PROGRAM, self.name, str(size)], check=True,
                                    capture_output=True, text=True).stdout
            for line in output.splitlines():
                number, micros = line.split()
                found[int(number)].append(float(micros))
        # The axes are logarithmic, and with all 99 ports bad there is nothing to search.
        return [(size, statistics.median(times)) for size, times in sorted(found.items())
                if size and (self.name, size) != ("bad", 99)]


_MEASURES = (
    Measure("table", "First cycle, with its clean-up", "entries in the gateway's table"),
    Measure("steady", "A cycle in which nothing changes", "entries in the gateway's table"),
    Measure("keys", "A cycle that reads changed settings", "keys in the settings"),
    Measure("bad", "A search for ports that work", "ports known to be bad", (1000,), 3),
    Measure("uptime", "All cycles since the start", "cycles", (10000,), 3),
)


def slope(points: list[tuple[float, float]]) -> float:
    """The exponent of the power law that fits the upper half (by logarithm) of the sizes best.

    1 for a cost in proportion to the size, 0 for a constant one.
    """
    logs = [(math.log(x), math.log(y)) for x, y in points]
    middle = (logs[0][0] + logs[-1][0]) / 2
    upper = [point for point in logs if point[0] >= middle - 1e-9]
    return statistics.linear_regression([x for x, _ in upper], [y for _, y in upper]).slope


def main() -> int:
    """Build, measure, judge, draw."""
    for command in (["cmake", "--preset", "bench"],
                    ["cmake", "--build", "--preset", "bench", "--target", "growth"]):
        subprocess.run(command, cwd=sandbox.PROJECT, stdout=subprocess.DEVNULL, check=True)
    panels, worst = [], 0.0
    print(f"{'microseconds of CPU':<38} {'least':>16} {'most':>18}  slope")
    for measure in _MEASURES:
        points = measure.points()
        steepness = slope(points)
        worst = max(worst, steepness)
        ends = [f"{y:,.0f} at {x:,.0f}" for x, y in (points[0], points[-1])]
        verdict = "ok" if steepness <= _STEEPEST else "FASTER THAN LINEAR"
        print(f"{measure.title:<38} {ends[0]:>16} {ends[1]:>18}  {steepness:5.2f}  {verdict}")
        panels.append(plot.Panel(f"{measure.title}, µs", measure.x_name, {"": points},
                                 logarithmic=True, marks=True))
    _PICTURE.write_text(plot.svg("What a cycle costs as its surroundings grow (CPU time)", panels,
                                 columns=3, height=250))
    return int(worst > _STEEPEST)


if __name__ == "__main__":
    sys.exit(main())
