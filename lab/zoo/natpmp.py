"""Gateways that speak only NAT-PMP, and in a way of their own."""

from __future__ import annotations

import random
import socket
import struct
from collections.abc import Callable, Iterable

from lab import network, packet_filter
from lab.gateway import GatewaySetup
from lab.natpmp import Grant, Request
from lab.packet_filter import Mapping
from lab.scenario import Lab
from lab.zoo.events import fall_silent, go_offline, go_online, lose, reboot
from lab.zoo.row import (ASK_PROVIDER, BY_HAND, LEFT_BEHIND, NO_MAPPING, NO_NATPMP, NOTHING,
                         OTHER_ADDRESS, RELAYED, TEST_FAILED, Row)

_REFUSED, _NO_RESOURCES, _NO_OPCODE = 2, 4, 5
_A_WEEK = 604800
_ENDLESS = 2**32 - 1
_MINIUPNPD = GatewaySetup(upnp=False, natpmp=True)
_SEVENTY = Mapping("TCP", 9091, network.NEIGHBOUR_ADDRESS, 80)

Delivery = Callable[[Request, bytes], Iterable[bytes]]


def _same(asked: int) -> int:
    return asked


def _granting(grant: Grant) -> GatewaySetup:
    return GatewaySetup(upnp=False, natpmp=True, grant=grant)


def _delivering(deliver: Delivery) -> GatewaySetup:
    return _granting(Grant(_same, _A_WEEK, deliver=deliver))


def _refusing(result: int, when: Callable[[Request], bool]) -> GatewaySetup:
    return _granting(Grant(_same, _A_WEEK,
                           result=lambda request: result if when(request) else 0))


def _is_address(request: Request) -> bool:
    return request.operation == 0


def _maps(request: Request) -> bool:
    return request.lease > 0


def _removes_all(request: Request) -> bool:
    return request.operation != 0 and request.internal == 0


def _telling(address: str) -> Delivery:
    """Tell this public address."""
    told = socket.inet_aton(address)
    return lambda request, answer: [answer[:8] + told if _is_address(request) else answer]


def _for_seconds(lease: int) -> Delivery:
    """Tell this lease, whatever was granted."""
    told = struct.pack(">I", lease)
    return lambda request, answer: [answer[:12] + told if _maps(request) else answer]


def _garbled(request: Request, answer: bytes) -> Iterable[bytes]:
    if _is_address(request):
        return [answer]
    head, internal, external, lease = struct.unpack(">8sHHI", answer)
    return [struct.pack(">8sHHI", head, internal & 255, external & 255, lease)]


def _twice(_request: Request, answer: bytes) -> Iterable[bytes]:
    return [answer, answer]


def _newer(request: Request, _answer: bytes) -> Iterable[bytes]:
    return [bytes([2, request.operation | 128, 0, 1]) + bytes(8)]


def _forgetful(_request: Request, answer: bytes) -> Iterable[bytes]:
    return [answer[:4] + random.randbytes(4) + answer[8:]]


def _cut(length: int, when: Callable[[Request], bool]) -> Delivery:
    return lambda request, answer: [answer[:length] if when(request) else answer]


def _prohibit(_lab: Lab) -> None:
    packet_filter.change(
        "add rule inet lab silence udp dport 5351 reject with icmp type admin-prohibited\n")


ROWS = (
    Row("N1", "Tells no public address until its internet line is up", _MINIUPNPD, NOTHING,
        why=NO_NATPMP, seconds=520, longest=500, between={0: go_offline, 1: go_online}),
    Row("N2", "Tells the public address 0.0.0.0, with success", _delivering(_telling("0.0.0.0")),
        "correct its internet settings", RELAYED, OTHER_ADDRESS),
    Row("N2b", "Tells a private address as the public one, with success",
        _delivering(_telling("192.168.1.2")), ASK_PROVIDER, RELAYED, OTHER_ADDRESS),
    Row("N3", "Refuses every mapping (2)", _refusing(_REFUSED, _maps), "switch on NAT-PMP, or "
        + BY_HAND, RELAYED, NO_MAPPING, seconds=150, longest=150, requests=5000),
    Row("N3b", "Has no room for a mapping (4)", _refusing(_NO_RESOURCES, _maps), BY_HAND, RELAYED,
        NO_MAPPING, seconds=150, longest=150, requests=5000),
    Row("N4", "Drops NAT-PMP requests without a word", _MINIUPNPD, BY_HAND, RELAYED, NO_NATPMP,
        seconds=100, longest=100, between={0: fall_silent}),
    Row("N4b", "Prohibits NAT-PMP (ICMP)", _MINIUPNPD, BY_HAND, RELAYED,
        "retrieveExternalIP  failed to fetched external IP address, errno 113",
        between={0: _prohibit}, cause="no-gateway-protocol"),
    Row("N5", "Grants the next free port instead of one that is taken", _MINIUPNPD, NOTHING,
        why="mapped public port 9093 to localport 80 ", left=(_SEVENTY,),
        between={0: lambda lab: lab.neighbour.hold(9091, 80)}),
    Row("N5b", "Grants a port of its own choice", _granting(Grant(lambda _: 45678, _A_WEEK)),
        NOTHING),
    Row("N6", "Grants only a minute, less than a pause", _granting(Grant(_same, 60)), NOTHING,
        between={1: lose(9091, 9444), 2: lose(9091, 9444), 3: lose(9091, 9444)}),
    Row("N6b", "Grants mappings, and says that it is for 0 s", _delivering(_for_seconds(0)),
        NOTHING),
    Row("N6c", "Grants mappings for 136 years", _delivering(_for_seconds(_ENDLESS)), NOTHING),
    Row("N7", "Tells garbled ports: 131 when it has opened 9091", _delivering(_garbled),
        "update its software, or " + BY_HAND, RELAYED, TEST_FAILED,
        seconds=200, longest=200, requests=90),
    Row("N8", "Answers 0.6 s late", _granting(Grant(_same, _A_WEEK, delay=0.6)), NOTHING,
        seconds=100),
    Row("N8b", "Sends every answer twice", _delivering(_twice), NOTHING),
    Row("N9", "Answers in the version of a newer protocol", _delivering(_newer), BY_HAND, RELAYED,
        NO_NATPMP),
    Row("N10", "Maps, but does not tell its public address (5)",
        _refusing(_NO_OPCODE, _is_address), BY_HAND, RELAYED, NO_NATPMP),
    Row("N11", "Does not remove all mappings at once (2)", _refusing(_REFUSED, _removes_all),
        "nothing: mappings that are left behind end with their lease", left=LEFT_BEHIND),
    Row("N12", "Restarts: its epoch begins again, its mappings are gone", _MINIUPNPD, NOTHING,
        why=TEST_FAILED, between={1: reboot}),
    Row("N12b", "Tells another epoch each time, for nothing", _delivering(_forgetful), NOTHING),
    Row("N13", "Answers from an odd port", _granting(Grant(_same, _A_WEEK, source=5350)), BY_HAND,
        RELAYED, NO_NATPMP, seconds=100, longest=100),
    Row("N14", "Answers with two bytes", _delivering(_cut(2, lambda _: True)), BY_HAND, RELAYED,
        NO_NATPMP, cause="no-gateway-protocol"),
    Row("N14b", "Answers requests for a mapping with eight bytes", _delivering(_cut(8, _maps)),
        BY_HAND, RELAYED, NO_MAPPING, seconds=450, longest=450, requests=5000),
)
