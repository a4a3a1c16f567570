#!/usr/bin/python3
"""Measures with growth.cpp whether a cost of the daemon grows faster than what it depends on.

Writes the table in docs/performance.md and draws docs/growth.svg. Exit status 1 when
something grows faster than linearly.
"""

from __future__ import annotations

import argparse
import math
import re
import statistics
import subprocess
import sys
from collections import defaultdict
from pathlib import Path

sys.dont_write_bytecode = True
sys.path.insert(0, str(Path(__file__).resolve().parent.parent))

from bench import plot  # noqa: E402
from lab import sandbox  # noqa: E402

_PAGE = sandbox.PROJECT / "docs/performance.md"
_PROGRAM = sandbox.PROJECT / "build/bench/bench/growth"
_SIZES = (10, 50, 100, 250, 500, 1000, 2000, 5000)
_RUNS = [*(("table", size, 60) for size in _SIZES), *(("keys", size, 60) for size in _SIZES),
         ("bad", 0, 1000), ("uptime", 0, 10000)]
_REPETITIONS = 5
# Above 1 by what noise adds, and by the logarithm in sorting keys.
_STEEPEST = 1.15
_MEASURES = {"first": ("the first cycle, with its clean-up", "entries in the gateway's table"),
             "steady": ("a cycle in which nothing changes", "entries in the gateway's table"),
             "keys": ("a cycle that reads changed settings", "keys in the settings"),
             "bad": ("a search for ports that work", "ports known to be bad"),
             "uptime": ("all cycles since the start", "cycles")}


def slope(points: plot.Points) -> float:
    """The exponent of the power law that fits the upper half (by logarithm) of the sizes best."""
    logs = [(math.log(x), math.log(y)) for x, y in points]
    upper = [point for point in logs if point[0] >= (logs[0][0] + logs[-1][0]) / 2 - 1e-9]
    return statistics.linear_regression([x for x, _ in upper], [y for _, y in upper]).slope


def _milliseconds(micros: float) -> str:
    places = 0 if micros >= 10_000 else 1 if micros >= 1000 else 2
    return f"{micros / 1000:,.{places}f} ms"


def main() -> int:
    """Build, measure, judge, draw."""
    argparse.ArgumentParser(prog="bench/growth.py", description=__doc__).parse_args()
    for command in (["cmake", "--preset", "bench"],
                    ["cmake", "--build", "--preset", "bench", "--target", "growth"]):
        subprocess.run(command, cwd=sandbox.PROJECT, stdout=subprocess.DEVNULL, check=True)
    found: dict[str, dict[int, list[float]]] = defaultdict(lambda: defaultdict(list))
    for run in _RUNS * _REPETITIONS:
        output = subprocess.run([_PROGRAM, *map(str, run)], check=True, capture_output=True,
                                text=True).stdout
        for name, size, micros in map(str.split, output.splitlines()):
            found[name][int(size)].append(float(micros))
    # The axes are logarithmic, and with all 99 ports bad there is nothing to search.
    found["bad"] = {size: found["bad"][size] for size in found["bad"] if 0 < size < 99}
    panels, worst = [], 0.0
    rows = ["| CPU time of | depends on | least | most | slope |",
            "| --- | --- | --- | --- | --- |"]
    for name, (title, x_name) in _MEASURES.items():
        points = [(size, statistics.median(times)) for size, times in sorted(found[name].items())]
        worst = max(worst, slope(points))
        ends = [f"{_milliseconds(y)} at {x:,.0f}" for x, y in (points[0], points[-1])]
        rows.append(f"| {title} | {x_name} | {ends[0]} | {ends[1]} | {slope(points):.2f} |")
        heading = f"{title[0].upper()}{title[1:]}, µs"
        panels.append(plot.Panel(heading, x_name, {"": points}, logarithmic=True))
    table = "\n".join(rows)
    print(table)
    _PAGE.write_text(re.sub("(?<=<!-- growth -->\n).*?(?=\n\n<!-- end -->)", lambda _: table,
                            _PAGE.read_text(), flags=re.DOTALL))
    (sandbox.PROJECT / "docs/growth.svg").write_text(plot.svg(
        "What a cycle costs as its surroundings grow (CPU time)", panels, columns=3, height=250))
    return int(worst > _STEEPEST)


if __name__ == "__main__":
    sys.exit(main())
