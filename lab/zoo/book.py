"""Plays the rows of the zoo, two at a time, and writes docs/gateways.md when all were played.

Without a name: all rows. The document gives what every run asserts, so playing again does not
change it; what was seen this time is printed.
"""

from __future__ import annotations

import argparse
import os
import sys
import traceback
from concurrent.futures import ThreadPoolExecutor

from lab import demo, sandbox
from lab.scenario import Lab
from lab.support import LabError
from lab.timeline import Timeline
from lab.zoo import ROWS, SUBJECTS, ZOO
from lab.zoo.player import play
from lab.zoo.row import FAILED, REACHED, RELAYED, Row

_DOCUMENT = sandbox.PROJECT / "docs/gateways.md"
_REPORTS = sandbox.PROJECT / "build/zoo"
_AT_ONCE = 2
_LAST_RESORT_SECONDS = 900
_WORDS = {REACHED: "reached directly", RELAYED: "reached through the relay", FAILED: "not reached"}
_HEAD = """# Home gateways

How Pelorus gets on with gateways that behave in ways of their own, as owners have reported them.
`scripts/zoo` plays each behaviour in the lab and writes this page when all were played;
`scripts/demo zoo-{first}` plays and shows one, `scripts/demo --zoo` lists them.

In each run the daemon lives through four cycles and is then ended by SIGTERM. The relay works and
another computer at home holds a mapping of its own. Every run asserts the outcome and the line of
the log that gives the reason; that every cycle, and every call to the gateway, ends in time
([bounds](security.md#hostile-neighbours)); that the neighbour's mapping is untouched; that nothing
is published, to the service or on the device, before the service has reached the device at that
address and HTTP port; what stays at the gateway after SIGTERM; and that the log is complete and
reveals no secret.

"Within" is the time until the device can first be reached from outside, at most, on an idle
machine; a relayed device needs ten seconds of it for its tunnel. Requests are all that the gateway
gets in four cycles, at most. "Left behind" is what stays at the gateway after SIGTERM.
"""
_TABLE_HEAD = """
## {subject}

| Row | Behaviour | The device is | within | requests | left behind | What the owner can do |
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
        passed = list(pool.map(_play, names or ROWS))
    print(f"{passed.count(True)} rows passed, {passed.count(False)} failed")
    if not names and all(passed):
        _DOCUMENT.write_text(_document())
        print(f"{_DOCUMENT.relative_to(sandbox.PROJECT)} written")
    return 0 if all(passed) else 1


def _play(name: str) -> bool:
    """Play a row in a sandbox; its report is kept in build/zoo."""
    done = sandbox.run("lab.zoo.book", [name], timeout=_LAST_RESORT_SECONDS, capture=True)
    _REPORTS.mkdir(parents=True, exist_ok=True)
    report = _REPORTS / f"{name}.txt"
    report.write_text(done.stdout)
    last = done.stdout.splitlines()[-1] if done.stdout else "no output"
    print(f"{name:<5} {last if done.returncode == 0 else f'FAILED, see {report}: {last}'}",
          flush=True)
    return done.returncode == 0


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


def _document() -> str:
    text = _HEAD.format(first=next(iter(ROWS)))
    for subject, rows in SUBJECTS.items():
        text += _TABLE_HEAD.format(subject=subject) + "".join(map(_line, rows))
    return text


def _line(row: Row) -> str:
    said = f" (`{row.why}`)" if row.why and row.outcome != REACHED else ""
    within = "-" if row.outcome == FAILED else f"{row.within} s"
    left = ", ".join(map(str, row.left)) or "nothing"
    cells = (row.name, row.title, _WORDS[row.outcome] + said, within, str(row.most_requests), left,
             row.advice)
    return f"| {' | '.join(cells)} |\n"


if __name__ == "__main__":
    sys.exit(main())
