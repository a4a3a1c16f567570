"""Predicates for `Row.played`: the behaviour was met, seen at the end of the last cycle."""

from __future__ import annotations

import re
from collections.abc import Callable

from lab import network, web
from lab.checks import BOTH_MAPPED
from lab.scenario import Lab
from lab.zoo.row import CYCLES

_FOUND_AT = re.compile(r"IGD found at: http://[\d.]+:(\d+)/")


def not_provoked(lab: Lab) -> bool:
    """The device has asked for mappings, but in no way to which the gateway objects."""
    asked = {call.action for call in lab.gateway.calls() if call.action.startswith("Add")}
    return asked == {"AddPortMapping"} and not asked & set(lab.gateway.oddities())


def described_as_version_2(lab: Lab) -> bool:
    """The gateway's description has a connection service of version 2."""
    return "WANIPConnection:2" in (web.fetch(network.NEIGHBOUR, lab.gateway.description_url) or "")


def leased(forever: bool) -> Callable[[Lab], bool]:
    """The gateway lists both mappings, for ever or with a lease."""
    return lambda lab: [entry.lease == 0 for entry in lab.gateway.listing()
                        if entry.mapping in BOTH_MAPPED] == [forever, forever]


def found_elsewhere_each_time(lab: Lab) -> bool:
    """In each cycle the gateway was found at another port."""
    found = map(_FOUND_AT.search, lab.device.messages.texts())
    return len({match[1] for match in found if match}) == CYCLES
