"""What happens at home between two cycles."""

from __future__ import annotations

from collections.abc import Callable

from lab import packet_filter
from lab.packet_filter import ASKED_FOR, Mapping
from lab.scenario import Lab

Event = Callable[[Lab], None]


def all_of(*events: Event) -> Event:
    """These events, one after the other."""

    def happen(lab: Lab) -> None:
        for event in events:
            event(lab)

    return happen


def restart(lab: Lab) -> None:
    """The gateway's services come back on another port; mappings stay."""
    lab.gateway.become(lab.gateway.setup)


def reboot(lab: Lab) -> None:
    """The gateway comes back without mappings."""
    lab.gateway.reboot()


def fall_silent(lab: Lab) -> None:
    """The gateway answers nothing on the LAN."""
    lab.gateway.fall_silent()


def go_deaf(lab: Lab) -> None:
    """The gateway hears no search any more."""
    lab.gateway.go_deaf()


def go_offline(lab: Lab) -> None:
    """The gateway has no internet address."""
    lab.gateway.go_offline()


def go_online(lab: Lab) -> None:
    """The gateway has its internet address again."""
    lab.gateway.go_online()


def reload_firewall(_lab: Lab) -> None:
    """The gateway lists its mappings, and forwards nothing any more."""
    packet_filter.flush(ASKED_FOR)


def keep(mapping: Mapping) -> Event:
    """The gateway has this mapping from somebody else, or from an earlier day."""
    return lambda lab: lab.gateway.keep(mapping)


def lose(*external_ports: int) -> Event:
    """The gateway forgets these mappings."""
    return lambda lab: lab.gateway.lose(*external_ports)
