"""The lab's own NAT-PMP gateway, for behaviour that miniupnpd cannot be made to show."""

from __future__ import annotations

import socket
import struct
import threading
import time
from collections.abc import Callable, Iterable
from dataclasses import dataclass

from lab import network, packet_filter
from lab.packet_filter import Mapping

PORT = 5351

_UNSUPPORTED_VERSION, _NOT_AUTHORIZED, _UNSUPPORTED_OPCODE = 1, 2, 5
_PROTOCOLS = {1: "UDP", 2: "TCP"}
_REPLY = 128
_LOOK_SECONDS = 0.05


@dataclass(frozen=True)
class Request:
    """A request; one for the public address, with the operation 0, has neither ports nor lease."""

    operation: int
    internal: int = 0
    external: int = 0
    lease: int = 0


def granted(_request: Request) -> int:
    """Do what the request asks for."""
    return 0


def unchanged(_request: Request, answer: bytes) -> Iterable[bytes]:
    """Send the answer as it is."""
    return [answer]


@dataclass(frozen=True)
class Grant:
    """How the router answers a request for a mapping.

    `port` gives the external port granted for a requested one; if that is taken, the next free
    port is granted. `lease` is the longest lease in seconds. The external ports in `refused` are
    never granted. From its first request for a mapping on, the device gets each answer `delay`
    seconds late, in real time.

    For the device only: a request to which `result` gives another number than 0 is refused with
    that; `deliver` turns an answer into the datagrams that are sent, from the port `source`.
    """

    port: Callable[[int], int]
    lease: int
    refused: frozenset[int] = frozenset()
    delay: float = 0
    result: Callable[[Request], int] = granted
    deliver: Callable[[Request, bytes], Iterable[bytes]] = unchanged
    source: int = PORT


class NatPmp:
    """The server on the router's LAN side; its mappings are rules in the router's packet filter."""

    def __init__(self, grant: Grant, clock: int, public_address: Callable[[], str],
                 diary: list[str]) -> None:
        """Leases run in a time that is `clock` times as fast as ours.

        Answers to the device that a good gateway would give in another way are noted in `diary`.
        """
        self._diary = diary
        self._grant = grant
        self._clock = clock
        self._public_address = public_address
        self._born = time.monotonic()
        self._ends: dict[Mapping, float] = {}
        self._delay = 0.0
        self._hang_length = 0.0
        self._hung_until = 0.0
        self._outgoing: list[tuple[float, bytes, tuple[str, int]]] = []
        self._stopping = threading.Event()
        self._thread = threading.Thread(target=self._serve, daemon=True)

    def start(self, address: str) -> None:
        """Answer on this address of the router from now on."""
        with network.inside(network.GATEWAY):
            self._socket = _bound(address, PORT)
            self._to_device = (self._socket if self._grant.source == PORT
                               else _bound(address, self._grant.source))
        self._thread.start()

    def hang_once(self, seconds: float) -> None:
        """Hang for `seconds` at the next request for a mapping, then answer everything."""
        self._hang_length = seconds

    def stop(self) -> None:
        """Stop answering; existing forwardings stay."""
        self._stopping.set()
        self._thread.join()

    def _serve(self) -> None:
        with self._socket, self._to_device:
            while not self._stopping.is_set():
                self._expire()
                self._send_due()
                try:
                    request, client = self._socket.recvfrom(1500)
                except TimeoutError:
                    continue
                due = self._time_to_answer(request, client[0])
                self._outgoing += [(due, answer, client)
                                   for answer in self._answers(request, client[0])]
                self._send_due()

    def _time_to_answer(self, request: bytes, client: str) -> float:
        """When the answer is sent, in real time."""
        now = time.monotonic()
        if not _is_device(client):
            return now
        if request[1:2] in (b"\1", b"\2"):
            self._delay = self._grant.delay
            if self._hang_length:
                self._hung_until, self._hang_length = now + self._hang_length, 0.0
        return max(now + self._delay, self._hung_until)

    def _send_due(self) -> None:
        now = time.monotonic()
        for due, answer, client in self._outgoing:
            if due <= now:
                sender = self._to_device if _is_device(client[0]) else self._socket
                sender.sendto(answer, client)
        self._outgoing = [waiting for waiting in self._outgoing if waiting[0] > now]

    def _expire(self) -> None:
        for mapping in [mapping for mapping, end in self._ends.items() if end <= self._now()]:
            self._close(mapping)

    def _answers(self, datagram: bytes, client: str) -> Iterable[bytes]:
        """What is sent for a datagram; nothing if it is not a request."""
        if len(datagram) < 2 or datagram[1] >= _REPLY:
            return []
        version, operation = datagram[:2]
        if version != 0:
            return [self._head(operation, _UNSUPPORTED_VERSION)]
        if operation not in (0, *_PROTOCOLS) or operation and len(datagram) < 12:
            return [self._head(operation, _UNSUPPORTED_OPCODE) + datagram[4:]]
        asked = struct.unpack_from(">HHI", datagram, 4) if operation else ()
        request = Request(operation, *asked)
        if not _is_device(client):
            return [self._perform(request, client)]
        result = self._grant.result(request)
        answer = self._refuse(request, result) if result else self._perform(request, client)
        sent = list(self._grant.deliver(request, answer))
        if (result or sent != [answer] or self._delay or self._grant.source != PORT
                or operation and answer[8:] != datagram[4:]):
            self._diary.append("odd NAT-PMP")
        return sent

    def _perform(self, request: Request, client: str) -> bytes:
        if not request.operation:
            return self._head(0) + socket.inet_aton(self._public_address())
        if not request.lease:
            return self._unmap(request, client)
        if request.external in self._grant.refused:
            return self._refuse(request, _NOT_AUTHORIZED)
        return self._map(request, client)

    def _refuse(self, request: Request, result: int) -> bytes:
        head = self._head(request.operation, result)
        if not request.operation:
            return head + bytes(4)
        return head + struct.pack(">HHI", request.internal, request.external, 0)

    def _map(self, request: Request, client: str) -> bytes:
        protocol, lease = _PROTOCOLS[request.operation], min(request.lease, self._grant.lease)
        held = self._held(protocol, client, request.internal)
        if held:
            mapping = held[0]
        else:
            port = self._free(protocol, request.external or request.internal)
            mapping = Mapping(protocol, port, client, request.internal)
            packet_filter.forward(mapping)
        self._ends[mapping] = self._now() + lease
        return (self._head(request.operation)
                + struct.pack(">HHI", request.internal, mapping.external_port, lease))

    def _unmap(self, request: Request, client: str) -> bytes:
        """Close one mapping, or all of the client and protocol for internal port 0."""
        for mapping in self._held(_PROTOCOLS[request.operation], client, request.internal):
            self._close(mapping)
        return self._head(request.operation) + struct.pack(">HHI", request.internal, 0, 0)

    def _held(self, protocol: str, client: str, internal: int) -> list[Mapping]:
        """The forwardings of a client's port, whoever made them; of every port for 0."""
        return [mapping for mapping in packet_filter.mappings()
                if (mapping.protocol, mapping.internal_address) == (protocol, client)
                and internal in (0, mapping.internal_port)]

    def _free(self, protocol: str, asked: int) -> int:
        """The external port for a new mapping."""
        taken = {mapping.external_port for mapping in packet_filter.mappings()
                 if mapping.protocol == protocol}
        port = self._grant.port(asked)
        while port in taken:
            port += 1
        return port

    def _close(self, mapping: Mapping) -> None:
        self._ends.pop(mapping, None)
        packet_filter.remove(mapping)

    def _head(self, operation: int, result: int = 0) -> bytes:
        epoch = int(self._now() - self._born * self._clock)
        return struct.pack(">BBHI", 0, operation + _REPLY, result, epoch)

    def _now(self) -> float:
        """The client's time."""
        return time.monotonic() * self._clock


def _bound(address: str, port: int) -> socket.socket:
    """A UDP socket at this address."""
    made = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    made.settimeout(_LOOK_SECONDS)
    made.bind((address, port))
    return made


def _is_device(client: str) -> bool:
    return client == network.DEVICE_ADDRESS
