"""Plays the stories of docs/gallery.md one after another, and draws its pictures.

Without a name: all of them. The page is written when all were played.
"""

from __future__ import annotations

import argparse
import os
import sys
import textwrap

from lab import demo, sandbox
from lab.scenarios import SCENARIOS

PAGE = sandbox.PROJECT / "docs/gallery.md"
FOLDER = PAGE.with_suffix("")

# Each story with what to look at in its picture.
STORIES = {
    "upnp":
        "The ordinary start: find the gateway, map a port, have it tested from outside, map the "
        "other one, publish both, tell the device.",
    "ports-taken":
        "Where a neighbour holds a port, the device takes the next one, and never touches what "
        "belongs to the neighbour.",
    "forwarding-dies":
        "The gateway still lists the mapping, so only the test from outside shows that nothing "
        "comes through, and the device moves on to the next port.",
    "gateway-reboots":
        "The next port test finds the ports closed, and the same cycle maps, tests and publishes "
        "them again.",
    "gateway-falls-silent":
        "A gateway that no longer answers is no reason to give up ports that work; once a test "
        "finds them closed, the same cycle starts the tunnel.",
    "second-nat":
        "A test that fails while the service sees another address than the gateway reports "
        "reveals a second NAT: the device is relayed at once instead of trying a hundred ports.",
    "manual-and-back":
        "Ports that the user forwards by hand are tested and published like any others, but "
        "opening and closing them is left to the user.",
    "own-router":
        "A device that is itself the router opens its own ports and, at the end, closes them.",
    "service-is-gone":
        "Without the central service nothing can be tested, so nothing is published; the device "
        "keeps trying until the service is back.",
    "names-lead-elsewhere":
        "When the public names lead to another address, every connection is torn down, tested and "
        "built again.",
    "disk-asleep":
        "A test would wake the disk, so it waits until the disk is in use again, while the device "
        "stays reachable.",
    "unmap-all":
        "What a killed daemon leaves at the gateway and at the service is removed by one command.",
}

_HEAD = """# Gallery

Twelve of the stories that `scripts/demo --list` names, as they happened in the lab.
`scripts/gallery` plays them and draws this page; `scripts/demo NAME --svg FILE` draws any other.

In each picture, the sketch at the top says who has which address. Below it, the status of the
device changes over time, and each lane shows what one of the hosts did; the numbers lead to the
list. A dashed line begins a step of the story.
"""


def main() -> int:
    """Play the stories and write the page."""
    parser = argparse.ArgumentParser(prog="scripts/gallery", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("names", nargs="*", metavar="NAME", help="a story of the page")
    names = parser.parse_args().names or list(STORIES)
    if unknown := set(names) - set(STORIES):
        parser.error(f"not in the gallery: {', '.join(sorted(unknown))}")
    for name in names:
        if obstacle := demo.obstacle(name):
            print(f"gallery: {obstacle}")
            return sandbox.FORBIDDEN
    if "PELORUS" not in os.environ and not demo.build():
        return 1
    FOLDER.mkdir(exist_ok=True)
    if not all([_draw(name) for name in names]):
        return 1
    PAGE.write_text(page())
    print(f"{PAGE.relative_to(sandbox.PROJECT)} written")
    return 0


def page() -> str:
    """The text of the page."""
    return _HEAD + "".join(
        f"\n## {name}\n\n{textwrap.fill(sentence, 100)}\n\n"
        f"![{SCENARIOS[name].title}]({FOLDER.name}/{name}.svg)\n"
        for name, sentence in STORIES.items())


def _draw(name: str) -> bool:
    """Play a story and replace its picture; a failure keeps the old one."""
    picture = FOLDER / f"{name}.svg"
    new = picture.with_suffix(".new")
    done = demo.run([name], str(new), capture=True)
    if done.returncode != 0:
        new.unlink()
        print(f"{name}: failed\n{done.stdout}", flush=True)
        return False
    new.replace(picture)
    print(f"{name}: drawn", flush=True)
    return True


if __name__ == "__main__":
    try:
        sys.exit(main())
    except KeyboardInterrupt:
        sys.exit(130)
