"""Gateways that answer the search in a way of their own."""

from __future__ import annotations

import itertools
import random
import re
from collections.abc import Iterable

from lab.gateway import GatewaySetup
from lab.scripted_gateway import (ANY_DEVICE, DEVICE_TYPE, PPP_SERVICE, Personality,
                                  Search, at)
from lab.zoo.events import go_deaf
from lab.zoo.hooks import late, only, telling, wait
from lab.zoo.met import described_as_version_2
from lab.zoo.row import (BY_HAND, LEFT_BEHIND, NO_ADDRESS, NO_ANSWER, NO_GATEWAY, NOT_USED,
                         NOTHING, OTHER_ADDRESS, RELAYED, Row)

_GOOD = at("{base}/rootDesc.xml")
_NOWHERE = at("http://[::1]:1900/rootDesc.xml", "http://127.0.0.1:5000/rootDesc.xml",
              "http://192.168.1.1:5000/rootDesc.xml", "http://192.168.77.1:5000")
# What a device for Wi-Fi Protected Setup says of itself.
_SETUP_DESCRIPTION = """<?xml version="1.0"?>
<root xmlns="urn:schemas-upnp-org:device-1-0"><device>
<deviceType>urn:schemas-wifialliance-org:device:WFADevice:1</deviceType>
<friendlyName>setup</friendlyName>
<serviceList><service>
<serviceType>urn:schemas-wifialliance-org:service:WFAWLANConfig:1</serviceType>
<serviceId>urn:wifialliance-org:serviceId:WFAWLANConfig1</serviceId>
<controlURL>/wps</controlURL><eventSubURL>/event</eventSubURL><SCPDURL>/wps.xml</SCPDURL>
</service></serviceList>
</device></root>
"""
SETUP_DEVICE = Personality(
    search=lambda search: [search.answer()], describe=lambda _: _SETUP_DESCRIPTION, forwards=False)


def version_2(text: str) -> str:
    """The description, with version 2 of every device and service that has one."""
    for name in ("InternetGatewayDevice", "WANDevice", "WANConnectionDevice", "WANIPConnection"):
        text = text.replace(f"{name}:1", f"{name}:2")
    return text


def _copies(search: Search) -> Iterable[bytes]:
    for answer in itertools.chain.from_iterable(map(_GOOD, itertools.repeat(search))):
        yield answer
        wait(1)


def _many_names(search: Search) -> Iterable[bytes]:
    return (search.answer().replace(b"uuid:2c6e", b"uuid:%04x" % number)
            for number in range(400) if search.target == DEVICE_TYPE)


def _without_location(search: Search) -> Iterable[bytes]:
    return (re.sub(rb"LOCATION: .*\r\n", line, answer)
            for answer in _GOOD(search) for line in (b"LOCATION: \r\n", b""))


def _garbage(search: Search) -> Iterable[bytes]:
    if search.target != DEVICE_TYPE:
        return
    good = search.answer()
    yield random.Random(search.number).randbytes(512)
    yield good.replace(b"LOCATION: http", b"LOCATION\r\nLOCATION: \r\n: http")
    yield b"HTTP/1.1 200 OK\r\nST:" + bytes(300)
    yield good.replace(b"\r\n\r\n", b"\r\n")


COPIES = Personality(search=_copies)


def access_point(address: str) -> Personality:
    """Answers as a gateway, later, tells this address and forwards nothing."""
    return Personality(search=late(0.3, _GOOD), forwards=False,
                       control=telling(NewExternalIPAddress=address))


def _scripted(gateway: Personality, *others: Personality) -> GatewaySetup:
    return GatewaySetup(personality=gateway, others=others)


ROWS = (
    Row("D1", "Answers only one search target, the third that is tried: `WANPPPConnection:1`",
        _scripted(Personality(search=only(PPP_SERVICE))), NOTHING, seconds=30),
    Row("D1b", "Answers only the search target `upnp:rootdevice`",
        _scripted(Personality(search=only(ANY_DEVICE))), BY_HAND, RELAYED, NOT_USED),
    Row("D2", "Version 2, deaf to searches for version 1",
        _scripted(Personality(search=only(ANY_DEVICE), describe=version_2)),
        "switch on the compatibility with version 1, or " + BY_HAND, RELAYED, NOT_USED),
    Row("D3", "Answers the search as version 1, describes itself as version 2",
        GatewaySetup(settings={"force_igd_desc_v1": "no"}), NOTHING, played=described_as_version_2),
    Row("D4", "Answers the search 5 s late",
        _scripted(Personality(search=late(5, _GOOD))), NOTHING, seconds=30),
    Row("D4b", "Answers no search, only announces itself unasked",
        _scripted(Personality(search=lambda _: [])), BY_HAND, RELAYED, NO_ANSWER),
    Row("D5", "Repeats its answer to a search every second, without end",
        _scripted(COPIES), NOTHING, seconds=60),
    Row("D5b", "Answers a search 400 times, each time under another name",
        _scripted(Personality(search=_many_names)), NOTHING, requests=100),
    Row("D6", "Answers the search from an odd port",
        _scripted(Personality(search_port=43702)), NOTHING),
    Row("D7", "Answers at another address than the default route's",
        GatewaySetup(natpmp=True, served_at="192.168.77.2"), NOTHING,
        why="IGD found at: http://192.168.77.2:"),
    Row("D8", "Its description is said to be on the device, on another subnet, or nowhere",
        _scripted(Personality(search=_NOWHERE)), BY_HAND, RELAYED, NO_GATEWAY, seconds=100,
        longest=100),
    Row("D8b", "Does not say where its description is: empty or missing LOCATION",
        _scripted(Personality(search=_without_location)), BY_HAND, RELAYED,
        "upnp_discover - gateway ignored, its description is not at another host's"),
    Row("D9", "A Wi-Fi setup device on the LAN claims every search target, before the gateway",
        _scripted(Personality(search=late(0.5, _GOOD)), SETUP_DEVICE), NOTHING),
    Row("D9b", "Silent, while a Wi-Fi setup device on the LAN claims every search target",
        _scripted(Personality(search=lambda _: []), SETUP_DEVICE),
        "switch on UPnP on the gateway, or " + BY_HAND, RELAYED, NO_ADDRESS,
        cause="no-gateway-protocol"),
    Row("D10", "An access point answers as a gateway as well, later, with a public address",
        GatewaySetup(others=(access_point("44.128.0.99"),)),
        "switch off UPnP on the access point", RELAYED, OTHER_ADDRESS, requests=65),
    Row("D10b", "An access point answers as a gateway as well, later, with the address 0.0.0.0",
        GatewaySetup(others=(access_point("0.0.0.0"),)), NOTHING, requests=100),
    Row("D11", "Goes deaf to searches after a while",
        GatewaySetup(), "restart the gateway; delete mappings that are left behind",
        why="UPnP discovery failed, running port test to see if ports are still open",
        left=LEFT_BEHIND, between={1: go_deaf}),
    Row("D12", "Sends garbage and broken headers before its answer to a search",
        _scripted(Personality(search=_garbage)), NOTHING),
)
