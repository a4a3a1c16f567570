"""The lab's own UPnP gateway, for routers that miniupnpd cannot be made to resemble."""

from __future__ import annotations

import re
import socket
import struct
import threading
import time
from collections.abc import Callable, Iterable, Mapping
from dataclasses import dataclass, field
from email.message import Message
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from urllib.parse import urlsplit
from xml.sax.saxutils import escape, unescape

from lab import network, packet_filter
from lab.packet_filter import Mapping as Forwarding
from lab.web import NO_LINGERING

HTTP_PORT = 5000
SEARCH_PORT = 1900
DEVICE_TYPE = "urn:schemas-upnp-org:device:InternetGatewayDevice:1"
IP_SERVICE = "urn:schemas-upnp-org:service:WANIPConnection:1"
PPP_SERVICE = "urn:schemas-upnp-org:service:WANPPPConnection:1"
COMMON_SERVICE = "urn:schemas-upnp-org:service:WANCommonInterfaceConfig:1"
ANY_DEVICE, EVERYTHING = "upnp:rootdevice", "ssdp:all"

_SSDP_GROUP = "239.255.255.250"
_TARGETS = (DEVICE_TYPE, IP_SERVICE, ANY_DEVICE, EVERYTHING)
_LOOK_SECONDS = 0.05
_LATE_SECONDS = 0.1

_NO_SUCH_ACTION, _NOT_IN_ARRAY, _NOT_MAPPED, _CONFLICT = 401, 713, 714, 718

_ANNOUNCEMENT = """HTTP/1.1 200 OK\r
CACHE-CONTROL: max-age=120\r
EXT:\r
LOCATION: {location}\r
ST: {target}\r
USN: uuid:2c6e5b52-2f0e-4e5c-9f6b-5a0f2d6c1e10::{target}\r
\r
"""

SERVICE = """<service>
<serviceType>{type}</serviceType>
<serviceId>urn:upnp-org:serviceId:{id}</serviceId>
<controlURL>{control_url}</controlURL><eventSubURL>/event</eventSubURL>
<SCPDURL>/service.xml</SCPDURL>
</service>"""

_DESCRIPTION = f"""<?xml version="1.0"?>
<root xmlns="urn:schemas-upnp-org:device-1-0"><device>
<deviceType>{DEVICE_TYPE}</deviceType>
<friendlyName>home router</friendlyName>
<deviceList><device><deviceType>urn:schemas-upnp-org:device:WANDevice:1</deviceType>
<serviceList>{{common}}</serviceList>
<deviceList><device><deviceType>urn:schemas-upnp-org:device:WANConnectionDevice:1</deviceType>
<serviceList>{{connection}}</serviceList>
</device></deviceList></device></deviceList></device></root>
"""

_ENVELOPE = """<?xml version="1.0"?>
<s:Envelope xmlns:s="http://schemas.xmlsoap.org/soap/envelope/"
 s:encodingStyle="http://schemas.xmlsoap.org/soap/encoding/"><s:Body>
{body}
</s:Body></s:Envelope>
"""
_RESPONSE = '<u:{action}Response xmlns:u="{service}">{values}</u:{action}Response>'
_FAULT = ('<s:Fault><faultcode>s:Client</faultcode><faultstring>UPnPError</faultstring><detail>'
          '<UPnPError xmlns="urn:schemas-upnp-org:control-1-0"><errorCode>{error}</errorCode>'
          '<errorDescription>refused</errorDescription></UPnPError></detail></s:Fault>')

# One argument of an action as a client sends it.
_ARGUMENT = re.compile(r"<(New\w+)>(.*?)</")

Arguments = dict[str, str]
Deliver = Callable[[bytes, bytes], Iterable[bytes]]


@dataclass(frozen=True)
class Page:
    """An answer that is no SOAP, or none at all: without a body the connection is reset."""

    status: str = "404 Not Found"
    body: bytes | None = b"<html><body>This page does not exist.</body></html>"


# An error number or 0, and values; or a page instead.
Answer = tuple[int, Arguments] | Page


@dataclass(frozen=True)
class Search:
    """A search as a client sent it, the `number`th since the start, counted from 1.

    `base` is the beginning of the gateway's own URLs.
    """

    target: str
    base: str
    number: int

    def answer(self, location: str = "", target: str = "") -> bytes:
        """The answer of a good gateway, unless it is to name something else."""
        own = DEVICE_TYPE if self.target == EVERYTHING else self.target
        return _ANNOUNCEMENT.format(location=location or f"{self.base}/rootDesc.xml",
                                    target=target or own).encode()


@dataclass(frozen=True)
class Call:
    """An action as a client requested it.

    `path` includes the query; `service` is the service's type and `body` the whole request.
    """

    gateway: ScriptedGateway
    path: str
    headers: Message
    body: str
    action: str
    service: str
    arguments: Arguments
    performed: list[Answer] = field(default_factory=list, init=False)

    def perform(self) -> Answer:
        """Do what a good gateway does, and return its answer."""
        self.performed.append(answer := self.gateway.perform(self))
        return answer


@dataclass(frozen=True)
class Entry:
    """A line of the gateway's list of mappings; `lease` is in seconds, 0 for ever."""

    mapping: Forwarding
    description: str = ""
    lease: int = 0


def at(*locations: str) -> Callable[[Search], Iterable[bytes]]:
    """Answer a search once for each of these URLs; in them {base} is the gateway's own."""
    return lambda search: (search.answer(location.format(base=search.base))
                           for location in locations if search.target in _TARGETS)


def unchanged(text: str) -> str:
    """Leave the description as it is."""
    return text


def whole(head: bytes, body: bytes) -> Iterable[bytes]:
    """Send an answer at once."""
    return [head + body]


def performed(call: Call) -> Answer:
    """Answer as a good gateway does."""
    return call.perform()


@dataclass(frozen=True)
class Personality:
    """How a gateway behaves; a new one names only what differs from a good gateway.

    Datagrams: a search is answered with those that `search` gives, sent from UDP `search_port`.
    Description: `describe` changes its text, `deliver` cuts head and body into what is sent.
    Control: `control_url` is where, and may be relative; `control` gives the answer to a call, and
    `deliver_control` cuts it into what is sent. Each answer comes `delay` seconds late; to the
    actions in `errors` it is that error number, and `control` is not asked.
    State: unless it `forwards`, mappings are listed only.

    Generators may sleep between two pieces. All times are real times.
    """

    search: Callable[[Search], Iterable[bytes]] = at("{base}/rootDesc.xml")
    search_port: int = SEARCH_PORT
    describe: Callable[[str], str] = unchanged
    deliver: Deliver = whole
    control_url: str = "/control"
    control: Callable[[Call], Answer] = performed
    deliver_control: Deliver = whole
    delay: float = 0
    errors: Mapping[str, int] = field(default_factory=dict)
    forwards: bool = True


class ScriptedGateway:
    """The server on the router's LAN side; what it forwards are rules in the packet filter.

    Its list of mappings, `table`, is its own: by protocol and external port. It notes in `diary`
    each call, and what a good gateway would have done in another way.
    """

    def __init__(self, personality: Personality, public_address: Callable[[], str],
                 diary: list[str]) -> None:
        """Forwardings that exist already are on the list of a gateway that forwards."""
        self.personality = personality
        self.table: dict[tuple[str, int], Entry] = {}
        self.diary = diary
        self._public_address = public_address
        self._lock = threading.Lock()
        self._stopping = threading.Event()
        self._actions: dict[str, Callable[[Arguments], Answer]] = {
            "GetStatusInfo": self._status,
            "GetExternalIPAddress": self._external_address,
            "AddPortMapping": self._add,
            "DeletePortMapping": self._delete,
            "GetSpecificPortMappingEntry": self._specific_entry,
            "GetGenericPortMappingEntry": self._generic_entry,
        }
        if personality.forwards:
            for mapping in packet_filter.mappings():
                self.table[_key(mapping)] = Entry(mapping)

    def start(self, address: str) -> None:
        """Answer on this address of the router from now on."""
        self._base = f"http://{address}:{HTTP_PORT}"
        with network.inside(network.GATEWAY):
            self._web = _WebServer((address, HTTP_PORT), self)
            self._searched = _datagram_socket("", SEARCH_PORT)
            self._searched.settimeout(_LOOK_SECONDS)
            membership = struct.pack("4s4s", socket.inet_aton(_SSDP_GROUP),
                                     socket.inet_aton(address))
            self._searched.setsockopt(socket.IPPROTO_IP, socket.IP_ADD_MEMBERSHIP, membership)
            # Threads, and the sockets they open, stay on the host of the thread that starts them.
            self._searching = threading.Thread(target=self._answer_searches, daemon=True,
                                               args=(address,))
            self._searching.start()
            threading.Thread(target=self._web.serve_forever, args=(_LOOK_SECONDS,),
                             daemon=True).start()

    def stop(self) -> None:
        """Stop answering; existing forwardings stay."""
        self._stopping.set()
        self._searching.join()
        self._web.shutdown()
        self._web.server_close()

    def description(self) -> bytes:
        """The description of the gateway and its connection service."""
        text = _DESCRIPTION.format(
            common=SERVICE.format(type=COMMON_SERVICE, id="WANCommonIFC1", control_url="/common"),
            connection=SERVICE.format(type=IP_SERVICE, id="WANIPConn1",
                                      control_url=escape(self.personality.control_url)))
        described = self.personality.describe(text)
        if described != text or self.personality.control_url != Personality.control_url:
            self.diary.append("odd description")
        return described.encode("latin-1")

    def answer(self, call: Call) -> Answer:
        """The answer to a call."""
        self.diary.append(f"{call.action}: external port: {call.arguments.get('NewExternalPort')}")
        time.sleep(self.personality.delay)
        if call.action in self.personality.errors:
            answer: Answer = self.personality.errors[call.action], {}
        else:
            answer = self.personality.control(call)
        if self.personality.delay or call.performed != [answer]:
            self.diary.append(f"odd {call.action}")
        return answer

    def perform(self, call: Call) -> Answer:
        """The answer of a good gateway, after it has done what it says."""
        where = urlsplit(self.personality.control_url).path
        if urlsplit(call.path).path.lstrip("/") != where.lstrip("/"):
            return Page()
        if call.action not in self._actions:
            return _NO_SUCH_ACTION, {}
        with self._lock:
            return self._actions[call.action](call.arguments)

    def keep(self, entry: Entry) -> None:
        """Put a mapping on the list, and forward unless this gateway does not."""
        self.forget(_key(entry.mapping))
        if self.personality.forwards:
            packet_filter.forward(entry.mapping)
        self.table[_key(entry.mapping)] = entry

    def forget(self, key: tuple[str, int]) -> None:
        """Take a mapping off the list, if it is there, and forward it no longer."""
        held = self.table.pop(key, None)
        if held and self.personality.forwards:
            packet_filter.remove(held.mapping)

    def _answer_searches(self, address: str) -> None:
        number = 0
        with self._searched:
            while not self._stopping.is_set():
                try:
                    request, client = self._searched.recvfrom(1500)
                except TimeoutError:
                    continue
                if request.startswith(b"M-SEARCH "):
                    number += 1
                    search = Search(_header(request, "ST"), self._base, number)
                    threading.Thread(target=self._announce, args=(search, address, client),
                                     daemon=True).start()

    def _announce(self, search: Search, address: str, client: tuple[str, int]) -> None:
        """Answer one search, until there is no more to say or nobody listens any more."""
        began, sent = time.monotonic(), []
        with _datagram_socket(address, self.personality.search_port) as sender:
            sender.connect(client)
            for datagram in self.personality.search(search):
                try:
                    sender.send(datagram)
                except OSError:
                    break
                sent.append(datagram)
        if (sent != list(Personality.search(search)) or time.monotonic() - began > _LATE_SECONDS
                or self.personality.search_port != SEARCH_PORT):
            self.diary.append("odd search")

    def _status(self, _arguments: Arguments) -> Answer:
        return 0, {"NewConnectionStatus": "Connected", "NewLastConnectionError": "ERROR_NONE",
                   "NewUptime": "1"}

    def _external_address(self, _arguments: Arguments) -> Answer:
        return 0, {"NewExternalIPAddress": self._public_address()}

    def _add(self, arguments: Arguments) -> Answer:
        wanted = Forwarding(arguments["NewProtocol"], int(arguments["NewExternalPort"]),
                            arguments["NewInternalClient"], int(arguments["NewInternalPort"]))
        held = self.table.get(_key(wanted))
        if held and held.mapping.internal_address != wanted.internal_address:
            return _CONFLICT, {}
        self.keep(Entry(wanted, arguments["NewPortMappingDescription"],
                        int(arguments["NewLeaseDuration"] or 0)))
        return 0, {}

    def _delete(self, arguments: Arguments) -> Answer:
        key = _wanted(arguments)
        if key not in self.table:
            return _NOT_MAPPED, {}
        self.forget(key)
        return 0, {}

    def _specific_entry(self, arguments: Arguments) -> Answer:
        held = self.table.get(_wanted(arguments))
        return (0, listed(held)) if held else (_NOT_MAPPED, {})

    def _generic_entry(self, arguments: Arguments) -> Answer:
        index, entries = int(arguments["NewPortMappingIndex"]), list(self.table.values())
        return numbered(entries[index]) if index < len(entries) else (_NOT_IN_ARRAY, {})


def listed(entry: Entry) -> Arguments:
    """What a lookup says about an entry."""
    return {"NewInternalPort": str(entry.mapping.internal_port),
            "NewInternalClient": entry.mapping.internal_address, "NewEnabled": "1",
            "NewPortMappingDescription": entry.description,
            "NewLeaseDuration": str(entry.lease)}


def numbered(entry: Entry) -> Answer:
    """What the list says about an entry."""
    return 0, {"NewRemoteHost": "", "NewExternalPort": str(entry.mapping.external_port),
               "NewProtocol": entry.mapping.protocol, **listed(entry)}


class _WebServer(ThreadingHTTPServer):
    daemon_threads = True
    request_queue_size = 256

    def __init__(self, address: tuple[str, int], gateway: ScriptedGateway) -> None:
        self.gateway = gateway
        super().__init__(address, _Handler)

    def shutdown_request(self, request: socket.socket | tuple[bytes, socket.socket]) -> None:
        """Close without a shutdown: a connection to be reset must not be ended normally first."""
        self.close_request(request)

    def handle_error(self, request: object, client_address: object) -> None:
        """Ignore clients that disconnect early."""


class _Handler(BaseHTTPRequestHandler):
    server: _WebServer

    def do_GET(self) -> None:
        """Deliver the description, whatever the path."""
        gateway, body = self.server.gateway, self.server.gateway.description()
        self._send(gateway.personality.deliver, _head("200 OK", len(body)), body)

    def do_POST(self) -> None:
        """Perform an action of the control service."""
        gateway = self.server.gateway
        body = self.rfile.read(int(self.headers["Content-Length"])).decode()
        service, _, action = self.headers["SOAPAction"].strip('"').rpartition("#")
        arguments = {name: unescape(value) for name, value in _ARGUMENT.findall(body)}
        answer = gateway.answer(Call(gateway, self.path, self.headers, body, action, service,
                                     arguments))
        if isinstance(answer, Page):
            status, text = answer.status, answer.body
        else:
            status = "500 Internal Server Error" if answer[0] else "200 OK"
            text = _soap(action, service, *answer).encode()
        if text is None:
            self.connection.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, NO_LINGERING)
            return
        self._send(gateway.personality.deliver_control, _head(status, len(text)), text)

    def _send(self, deliver: Deliver, head: bytes, body: bytes) -> None:
        for piece in deliver(head, body):
            if piece != head + body:
                self.server.gateway.diary.append("odd delivery")
            self.wfile.write(piece)

    def log_message(self, *_arguments: object) -> None:
        """Stay silent: the device's log tells what it asked."""


def _datagram_socket(address: str, port: int) -> socket.socket:
    """A UDP socket on a port that others may use too."""
    made = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    made.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    made.bind((address, port))
    return made


def _key(mapping: Forwarding) -> tuple[str, int]:
    return mapping.protocol, mapping.external_port


def _wanted(arguments: Arguments) -> tuple[str, int]:
    """The external port, whoever holds it."""
    return arguments["NewProtocol"], int(arguments["NewExternalPort"])


def _header(message: bytes, name: str) -> str:
    """A header of an HTTP message, empty when absent."""
    for line in message.decode(errors="replace").splitlines()[1:]:
        key, _, value = line.partition(":")
        if key.strip().upper() == name:
            return value.strip()
    return ""


def _head(status: str, size: int) -> bytes:
    return (f"HTTP/1.1 {status}\r\nContent-Type: text/xml\r\nContent-Length: {size}\r\n"
            "Connection: close\r\n\r\n").encode()


def _soap(action: str, service: str, error: int, values: Arguments) -> str:
    told = "".join(f"<{name}>{escape(value)}</{name}>" for name, value in values.items())
    form = _FAULT if error else _RESPONSE
    filled = form.format(action=action, service=service, values=told, error=error)
    return _ENVELOPE.format(body=filled)
