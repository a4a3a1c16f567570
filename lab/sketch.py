"""The network of a story as a small drawing: the hosts, and the addresses each has had."""

from __future__ import annotations

import re
from collections.abc import Sequence
from dataclasses import dataclass, field

from lab import network, provider
from lab.scenario import Situation
from lab.sheet import ACTOR_COLOURS, OTHER, PALE, QUIET, Sheet
from lab.timeline import Event

HEIGHT = 104

_HOME, _INTERNET = "home network", "internet"
_SHOWN = 2
_BUS, _BOX, _LINE, _LETTER, _GAP = 24, 38, 16, 7.2, 18
_ADDRESS = re.compile(r"\b(?:192\.168|44\.128)\.\d+\.\d+\b")
# Who gets an address in an event, by the words before it.
_NEW_ADDRESSES = tuple((who, re.compile(words + r" ([\d.]+)")) for who, words in (
    ("device", r"now has the LAN address"), ("gateway", r"rebooted at"),
    ("gateway", r"has the internet address"), ("gateway", r"puts the gateway, now"),
    ("provider", r"behind")))


@dataclass
class Host:
    """A box of the sketch; `networks` are those that it is connected to."""

    who: str
    name: str
    networks: tuple[str, ...]
    addresses: list[str] = field(default_factory=list)

    def lines(self) -> list[str]:
        """The addresses, those at home above those on the internet."""
        at_home = [address for address in self.addresses if address.startswith("192.168.")]
        others = [address for address in self.addresses if address not in at_home]
        return [_listed(some) for some in (at_home, others) if some]

    @property
    def width(self) -> float:
        """Width of the box."""
        return max(len(line) for line in (f"{self.name}__", *self.lines())) * _LETTER + 20


def hosts(situation: Situation, events: Sequence[Event]) -> list[Host]:
    """The hosts of a story from home to the internet, each with all its addresses."""
    told = " ".join(event.what for event in events)
    actors = {event.who for event in events}
    home = Host("device", "device", (_HOME,), [network.DEVICE_ADDRESS])
    gateway = Host("gateway", "gateway", (_HOME, _INTERNET),
                   [network.GATEWAY_LAN_ADDRESS, network.GATEWAY_WAN_ADDRESS])
    if situation.own_router:
        gateway = Host("device", "device, its own router", (_HOME, _INTERNET),
                       [network.DEVICE_ADDRESS, network.GATEWAY_WAN_ADDRESS])
    found = [] if situation.own_router else [home]
    if "neighbour" in actors or network.NEIGHBOUR_ADDRESS in told:
        found.append(Host("neighbour", "neighbour", (_HOME,), [network.NEIGHBOUR_ADDRESS]))
    found.append(gateway)
    if "provider" in actors:
        gateway.networks = (_HOME, "provider's network")
        found.append(Host("provider", "provider's NAT", (*gateway.networks[1:], _INTERNET),
                          [provider.ADDRESS]))
    found += [Host("central", "central service, name server", (_INTERNET,),
                   [network.SERVICE_ADDRESS]),
              Host("relay", "relay", (_INTERNET,), [network.RELAY_ADDRESS])]
    for who, words in _NEW_ADDRESSES:
        for host in (host for host in found if host.who == who):
            host.addresses += [new for new in words.findall(told) if new not in host.addresses]
    return _with_strangers(found, told)


def draw(sheet: Sheet, found: Sequence[Host], left: float, right: float, top: float) -> None:
    """Draw the hosts in a row below the lines of the networks that connect them."""
    gap = (right - left - sum(host.width for host in found)) / max(1, len(found) - 1)
    ends: dict[str, list[float]] = {}
    x = left
    for host in found:
        for number, name in enumerate(host.networks, 1):
            drop = x + host.width * number / (len(host.networks) + 1)
            ends.setdefault(name, []).append(drop)
            sheet.draw("line", x1=drop, x2=drop, y1=top + _BUS, y2=top + _BOX, stroke=QUIET)
        _draw_box(sheet, host, x, top + _BOX)
        x += host.width + max(gap, _GAP)
    for name, drops in ends.items():
        sheet.draw("line", x1=drops[0], x2=drops[-1], y1=top + _BUS, y2=top + _BUS, stroke=QUIET,
                   stroke_width=2)
        sheet.write(name, (drops[0] + drops[-1]) / 2, top + _BUS - 7, font_size=12, fill=QUIET,
                    text_anchor="middle")


def _with_strangers(found: list[Host], told: str) -> list[Host]:
    """Add a box for addresses that none of the hosts has, at home and on the internet."""
    known = {address for host in found for address in host.addresses}
    unknown = [address for address in dict.fromkeys(_ADDRESS.findall(told)) if address not in known]
    at_home = [address for address in unknown if address.startswith("192.168.")]
    elsewhere = [address for address in unknown if address not in at_home]
    return [*([Host("", "others at home", (_HOME,), at_home)] if at_home else []), *found,
            *([Host("", "somebody else", (_INTERNET,), elsewhere)] if elsewhere else [])]


def _listed(addresses: list[str]) -> str:
    """The first addresses, and how many more there are."""
    shown = addresses[:_SHOWN]
    return " or ".join(shown if len(shown) == len(addresses) else [
        *shown, f"{len(addresses) - _SHOWN} more"])


def _draw_box(sheet: Sheet, host: Host, x: float, y: float) -> None:
    colour = ACTOR_COLOURS.get(host.who, OTHER)
    sheet.draw("rect", x=x, y=y, width=host.width, height=HEIGHT - _BOX - 8, rx=5, fill="#f8fafc",
               stroke=PALE)
    sheet.draw("rect", x=x, y=y, width=4, height=HEIGHT - _BOX - 8, fill=colour)
    for number, line in enumerate([host.name, *host.lines()]):
        sheet.write(line, x + 13, y + 17 + number * _LINE, font_size=12,
                    **{"fill": colour, "font_weight": "bold"} if number == 0 else {})
