"""The packet filter of a host: rules go in as nft's language, its state comes out as JSON."""

from __future__ import annotations

import json
import subprocess
from collections.abc import Iterator
from typing import Any

from lab import network
from lab.support import run_tool

Object = dict[str, Any]


def change(host: str, rules: str) -> None:
    """Apply rules to a host's packet filter; all of them or, on an error, none."""
    run_tool(*network.command(host, "nft", "-f", "-"), text=rules)


def listed(host: str, *what: str) -> list[Object]:
    """What `nft list` shows on a host; each entry is keyed by its kind ("rule", "map")."""
    found = network.output(host, "nft", "-j", "-a", "list", *what)
    entries: list[Object] = json.loads(found)["nftables"]
    return entries


def monitor(host: str, what: str) -> Iterator[tuple[str, Object]]:
    """Every change to the "rules" or "elements" of a host from now on: its verb, its subject."""
    command = network.command(host, "nft", "-j", "monitor", what)
    with subprocess.Popen(command, stdout=subprocess.PIPE, text=True) as process:
        assert process.stdout is not None
        for line in process.stdout:
            yield from json.loads(line).items()
