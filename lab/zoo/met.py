"""Predicates for `Row.played`: the behaviour was met, seen at the end of the last cycle."""

from __future__ import annotations

from collections.abc import Callable

from lab import network, web
from lab.checks import BOTH_MAPPED
from lab.scenario import Lab


def not_provoked(lab: Lab) -> bool:
    """The device has asked for mappings, but in no way to which the gateway objects."""
    return {note.partition(":")[0] for note in lab.gateway.diary
            if note.startswith(("Add", "odd Add"))} == {"AddPortMapping"}


def described_as_version_2(lab: Lab) -> bool:
    """The gateway's description has a connection service of version 2."""
    return "WANIPConnection:2" in (web.fetch(network.NEIGHBOUR, lab.gateway.description_url) or "")


def leased(forever: bool) -> Callable[[Lab], bool]:
    """The gateway lists both mappings, for ever or with a lease."""
    return lambda lab: [entry.lease == 0 for entry in lab.gateway.listing()
                        if entry.mapping in BOTH_MAPPED] == [forever, forever]
