"""Plays scenarios, asks pelorus-doctor in each telling moment, and prints what it names.

Without a name: all of them, and the table in docs/doctor.md is replaced. Two per processor play at
a time. Exit status 1 when a scenario fails: the doctor names another cause than the story tells,
for example.
"""

from __future__ import annotations

import argparse
import json
import os
import re
import sys
import traceback
from collections.abc import Iterable
from concurrent.futures import ThreadPoolExecutor
from dataclasses import astuple

from lab import demo, sandbox
from lab.scenario import Lab, Moment
from lab.scenarios import SCENARIOS
from lab.timeline import Timeline

PAGE = sandbox.PROJECT / "docs/doctor.md"
BEGIN, END = "<!-- diagnoses -->", "<!-- end -->"
_HEAD = ("| scenario | moment | cause | first fact |", "| --- | --- | --- | --- |")
_FIRST_STOP = "before the daemon is stopped"
# What differs from one run to the next.
_VOLATILE = ((r"\d+ (s|min) ago", "N s ago"), (r"\b(pid|names) \d+", r"\1 N"),
             (r"\d+ (s|min) \(pid", "N s (pid"), (r"\d{4}-\d\d-\d\d", "DATE"))


def main() -> int:
    """Outside a sandbox: play each story in one of its own. Inside: play one, print its moments."""
    parser = argparse.ArgumentParser(prog="scripts/diagnoses", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("names", nargs="*", metavar="NAME", help="a name of scripts/demo --list")
    names = parser.parse_args().names
    if sandbox.is_inside():
        return _play(names[0])
    if unknown := set(names) - set(SCENARIOS):
        parser.error(f"no scenario {', '.join(sorted(unknown))}; see scripts/demo --list")
    for name in names or SCENARIOS:
        if obstacle := demo.obstacle(name):
            print(f"diagnoses: {obstacle}")
            return sandbox.FORBIDDEN
    if "PELORUS" not in os.environ and not demo.build():
        return 1
    with ThreadPoolExecutor(2 * (os.cpu_count() or 1)) as pool:
        found = dict(zip(names or SCENARIOS, pool.map(_diagnose, names or SCENARIOS)))
    lines = table(found)
    print("\n".join(lines))
    if not all(found.values()):
        return 1
    if not names:
        text = PAGE.read_text()
        before, behind = text[:text.index(BEGIN)], text[text.index(END):]
        PAGE.write_text("\n".join([f"{before}{BEGIN}", *lines, behind]))
    return 0


def table(found: dict[str, list[Moment]]) -> list[str]:
    """The lines of the table, a row for each moment that differs from the others."""
    return [*_HEAD, *dict.fromkeys(_row(name, *astuple(moment))
                                   for name, moments in found.items() for moment in moments)]


def without_facts(lines: Iterable[str]) -> list[str]:
    """The first cells of a table's rows: which cause is named when."""
    return list(dict.fromkeys(" | ".join(line.split(" | ")[:3]) for line in lines))


def documented(name: str) -> list[str]:
    """The rows about a scenario in docs/doctor.md."""
    return [line for line in PAGE.read_text().splitlines() if line.startswith(f"| {name} |")]


def _row(name: str, what: str, cause: str, fact: str) -> str:
    cells = (name, what or _FIRST_STOP, f"`{cause}`" if cause else "none", _steady(fact))
    return "".join(f"| {cell} " for cell in (cell.replace("|", "\\|") for cell in cells)) + "|"


def _steady(fact: str) -> str:
    for pattern, word in _VOLATILE:
        fact = re.sub(pattern, word, fact)
    return fact


def _diagnose(name: str) -> list[Moment]:
    """Play a story in a sandbox; its moments, or none if it fails."""
    done = sandbox.run("lab.diagnoses", [name], capture=True)
    if done.returncode != 0:
        print(f"{name}: failed\n{done.stdout}", file=sys.stderr, flush=True)
        return []
    return [Moment(*moment) for moment in json.loads(done.stdout.splitlines()[-1])]


def _play(name: str) -> int:
    lab = Lab(SCENARIOS[name].situation, Timeline())
    lab.asks_doctor = True
    try:
        SCENARIOS[name].play(lab)
    except Exception:
        print(lab.report())
        traceback.print_exc()
        return 1
    print(f"\n{json.dumps([astuple(moment) for moment in lab.moments])}")
    return 0


if __name__ == "__main__":
    try:
        sys.exit(main())
    except KeyboardInterrupt:
        sys.exit(130)
