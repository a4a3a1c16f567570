"""Plays the rows of the zoo, two at a time, and writes docs/gateways.md when all were played.

Without a name: all rows. The document gives what every run asserts, and the seconds of this one.
"""

from __future__ import annotations

import argparse
import math
import os
import re
import sys
import traceback
from concurrent.futures import ThreadPoolExecutor

from lab import demo, sandbox
from lab.scenario import Lab
from lab.support import LabError
from lab.timeline import Timeline
from lab.zoo import ROWS, SUBJECTS, ZOO
from lab.zoo.player import play
from lab.zoo.row import CLOCK, FAILED, LEFT_BEHIND, REACHED, RELAYED, Row

_DOCUMENT = sandbox.PROJECT / "docs/gateways.md"
_REPORTS = sandbox.PROJECT / "build/zoo"
_AT_ONCE = 2
_LAST_RESORT_SECONDS = 900
_WORDS = {REACHED: "reached directly", RELAYED: "reached through the relay", FAILED: "not reached"}
_HEAD = """# Home gateways

How Pelorus gets on with gateways that behave in ways of their own, as owners have reported them.
`scripts/zoo` plays each behaviour in the lab and writes this page when all have passed;
`scripts/demo zoo-{first}` plays and shows one, `scripts/demo --zoo` lists them.

In each run the daemon lives through four cycles and is then ended by SIGTERM. The relay works and
another computer at home holds a mapping of its own. Every run asserts that the gateway did what its
row says, or that the device gave it no occasion; the outcome and the line of the log that gives the
reason; that every cycle, search, mapping and clean-up ends in time
([bounds](security.md#hostile-neighbours)); that the neighbour's mapping stays; that nothing is
published, to the service or on the device, unless the service's latest test of that address and
HTTP port reached the device; that a page comes through the path that the status promises, with
HTTPS as well where it is direct; what stays at the gateway after SIGTERM; and that the log is
complete and reveals no secret.

"Reachable after" is when the device first reported that it could be reached, on either path, when
this page was written, rounded up to five seconds. The daemon's clock runs {clock}
times too fast there, but what waits in vain for NAT-PMP or a name server takes real time: for an
owner a tenth of what A2, N1, N3 to N14b and power-cut spend on that. Requests are all that the
gateway gets in four cycles; the run fails if there are more. "Left behind" is what stays at the
gateway after SIGTERM.
"""
_MEASURED = re.compile(r"first reachable after (\d+) s")
_TABLE_HEAD = """
## {subject}

| Row | Behaviour | The device is | reachable after | requests, at most | left behind | Advice |
| --- | --- | --- | --- | --- | --- | --- |
"""


def main() -> int:
    """Outside a sandbox: play the rows, each in one of its own. Inside: play one."""
    parser = argparse.ArgumentParser(prog="scripts/zoo", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("rows", nargs="*", metavar="ROW", help="a name, as P1")
    names = parser.parse_args().rows
    if unknown := set(names) - set(ROWS):
        parser.error(f"no row {', '.join(sorted(unknown))}; see scripts/demo --zoo")
    if sandbox.is_inside():
        return _play_here(ROWS[names[0]])
    if obstacle := demo.obstacle(next(iter(ZOO))):
        print(f"zoo: {obstacle}")
        return sandbox.FORBIDDEN
    if "PELORUS" not in os.environ and not demo.build():
        return 1
    with ThreadPoolExecutor(_AT_ONCE) as pool:
        passed = dict(zip(names or ROWS, pool.map(_play, names or ROWS)))
    failed = list(passed.values()).count("")
    print(f"{len(passed) - failed} rows passed, {failed} failed")
    if not names and not failed:
        _DOCUMENT.write_text(_document(passed))
        print(f"{_DOCUMENT.relative_to(sandbox.PROJECT)} written")
    return 1 if failed else 0


def _play(name: str) -> str:
    """What was seen, empty if the row failed. Played in a sandbox; the report is in build/zoo."""
    done = sandbox.run("lab.zoo.book", [name], timeout=_LAST_RESORT_SECONDS, capture=True)
    _REPORTS.mkdir(parents=True, exist_ok=True)
    report = _REPORTS / f"{name}.txt"
    report.write_text(done.stdout)
    last = done.stdout.splitlines()[-1] if done.stdout else "no output"
    print(f"{name:<5} {last if done.returncode == 0 else f'FAILED, see {report}: {last}'}",
          flush=True)
    return last if done.returncode == 0 else ""


def _play_here(row: Row) -> int:
    """Print the whole story, and in the last line what was seen or what did not hold."""
    lab = Lab(ZOO[f"zoo-{row.name}"].situation, Timeline())
    try:
        result = str(play(lab, row))
    except (LabError, AssertionError) as failure:
        where = traceback.extract_tb(failure.__traceback__)[-1]
        result = f"line {where.lineno}: {where.line} {failure}".splitlines()[0]
    print(f"{lab.report()}\n--- device log\n{lab.device.messages.file.read_text()}\n{result}")
    return int(result.startswith("line "))


def _document(seen: dict[str, str]) -> str:
    text = _HEAD.format(first=next(iter(ROWS)), clock=CLOCK)
    for subject, rows in SUBJECTS.items():
        text += _TABLE_HEAD.format(subject=subject)
        text += "".join(_line(row, seen[row.name]) for row in rows)
    return text


def _line(row: Row, seen: str) -> str:
    said = f" (`{row.why}`)" if row.why and row.outcome != REACHED else ""
    said += "" if row.https else " (HTTP only)"
    measured = _MEASURED.search(seen)
    reachable = f"{5 * math.ceil(int(measured[1]) / 5)} s" if measured else "never"
    left = ", ".join(str(mapping) + ("" if mapping in LEFT_BEHIND else " (not the daemon's)")
                     for mapping in row.left) or "nothing"
    cells = (row.name, row.title, _WORDS[row.outcome] + said, reachable, str(row.most_requests),
             left, row.advice)
    return f"| {' | '.join(cells)} |\n"


if __name__ == "__main__":
    sys.exit(main())
