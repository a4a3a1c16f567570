"""The lab's own UPnP gateway, for routers that miniupnpd cannot be made to resemble."""

from __future__ import annotations

import re
import socket
import struct
import threading
import time
from collections.abc import Callable, Iterable, Mapping
from dataclasses import dataclass, field
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from urllib.parse import urlsplit
from xml.sax.saxutils import escape

from lab import network, packet_filter
from lab.packet_filter import Mapping as Forwarding

HTTP_PORT = 5000

_SSDP_GROUP, _SSDP_PORT = "239.255.255.250", 1900
_DEVICE_TYPE = "urn:schemas-upnp-org:device:InternetGatewayDevice:1"
_SERVICE_TYPE = "urn:schemas-upnp-org:service:WANIPConnection:1"
_LOOK_SECONDS = 0.05

_NO_SUCH_ACTION, _NOT_IN_ARRAY, _NOT_MAPPED, _CONFLICT = 401, 713, 714, 718

_ANNOUNCEMENT = f"""HTTP/1.1 200 OK\r
CACHE-CONTROL: max-age=120\r
EXT:\r
LOCATION: {{location}}\r
ST: {_DEVICE_TYPE}\r
USN: uuid:2c6e5b52-2f0e-4e5c-9f6b-5a0f2d6c1e10::{_DEVICE_TYPE}\r
\r
"""

_DESCRIPTION = f"""<?xml version="1.0"?>
<root xmlns="urn:schemas-upnp-org:device-1-0"><device>
<deviceType>{_DEVICE_TYPE}</deviceType>
<friendlyName>home router</friendlyName>
<deviceList><device><deviceType>urn:schemas-upnp-org:device:WANDevice:1</deviceType>
<serviceList><service>
<serviceType>urn:schemas-upnp-org:service:WANCommonInterfaceConfig:1</serviceType>
<serviceId>urn:upnp-org:serviceId:WANCommonIFC1</serviceId>
<controlURL>/common</controlURL><eventSubURL>/event</eventSubURL><SCPDURL>/common.xml</SCPDURL>
</service></serviceList>
<deviceList><device><deviceType>urn:schemas-upnp-org:device:WANConnectionDevice:1</deviceType>
<serviceList><service>
<serviceType>{_SERVICE_TYPE}</serviceType>
<serviceId>urn:upnp-org:serviceId:WANIPConn1</serviceId>
<controlURL>{{control_url}}</controlURL><eventSubURL>/event</eventSubURL>
<SCPDURL>/connection.xml</SCPDURL>
</service></serviceList>
</device></deviceList></device></deviceList></device></root>
"""

_ENVELOPE = """<?xml version="1.0"?>
<s:Envelope xmlns:s="http://schemas.xmlsoap.org/soap/envelope/"
 s:encodingStyle="http://schemas.xmlsoap.org/soap/encoding/"><s:Body>
{body}
</s:Body></s:Envelope>
"""
_RESPONSE = (f'<u:{{action}}Response xmlns:u="{_SERVICE_TYPE}">{{values}}'
             '</u:{action}Response>')
_FAULT = ('<s:Fault><faultcode>s:Client</faultcode><faultstring>UPnPError</faultstring><detail>'
          '<UPnPError xmlns="urn:schemas-upnp-org:control-1-0"><errorCode>{error}</errorCode>'
          '<errorDescription>refused</errorDescription></UPnPError></detail></s:Fault>')

# One argument of an action as a client sends it.
_ARGUMENT = re.compile(r"<(New\w+)>(.*?)</")

Arguments = dict[str, str]
Answer = tuple[int, Arguments]


def whole(head: bytes, body: bytes) -> Iterable[bytes]:
    """Send an answer at once."""
    return [head + body]


def own_description(base: str) -> Iterable[str]:
    """Announce the gateway's own description."""
    return [f"{base}/rootDesc.xml"]


@dataclass(frozen=True)
class Personality:
    """How a gateway behaves; a new one names only what differs from a good gateway.

    A search is answered once for each URL that `locations` gives for the gateway's own base URL.
    `deliver` cuts the description's head and body into what is sent. The description names
    `control_url`, which may be relative. Each answer of the control service comes `delay` seconds
    late, in real time, and begins with `stuffing`; to the actions in `errors` it is that error
    number. With `endless_list`, the list of its mappings has no end.
    """

    locations: Callable[[str], Iterable[str]] = own_description
    deliver: Callable[[bytes, bytes], Iterable[bytes]] = whole
    control_url: str = "/control"
    delay: float = 0
    stuffing: str = ""
    errors: Mapping[str, int] = field(default_factory=dict)
    endless_list: bool = False


class ScriptedGateway:
    """The server on the router's LAN side; its mappings are rules in the router's packet filter."""

    def __init__(self, personality: Personality, public_address: Callable[[], str]) -> None:
        self.personality = personality
        self._public_address = public_address
        self._descriptions: dict[Forwarding, str] = {}
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

    def start(self, address: str) -> None:
        """Answer on this address of the router from now on."""
        self._base = f"http://{address}:{HTTP_PORT}"
        with network.inside(network.GATEWAY):
            self._web = _WebServer((address, HTTP_PORT), self)
            self._search = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
            self._search.settimeout(_LOOK_SECONDS)
            self._search.bind(("", _SSDP_PORT))
            membership = struct.pack("4s4s", socket.inet_aton(_SSDP_GROUP),
                                     socket.inet_aton(address))
            self._search.setsockopt(socket.IPPROTO_IP, socket.IP_ADD_MEMBERSHIP, membership)
            # Threads, and the sockets they open, stay on the host of the thread that starts them.
            self._searching = threading.Thread(target=self._answer_searches, daemon=True)
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
        return _DESCRIPTION.format(control_url=escape(self.personality.control_url)).encode()

    def answer(self, action: str, arguments: Arguments) -> Answer:
        """The answer of the control service: an error number or 0, and values."""
        time.sleep(self.personality.delay)
        perform = self._actions.get(action)
        if perform is None or action in self.personality.errors:
            return self.personality.errors.get(action, _NO_SUCH_ACTION), {}
        with self._lock:
            return perform(arguments)

    def _answer_searches(self) -> None:
        with self._search:
            while not self._stopping.is_set():
                try:
                    request, client = self._search.recvfrom(1500)
                except TimeoutError:
                    continue
                target = _header(request, "ST")
                if request.startswith(b"M-SEARCH ") and target in (_DEVICE_TYPE, "ssdp:all"):
                    threading.Thread(target=self._announce, args=(client,), daemon=True).start()

    def _announce(self, client: tuple[str, int]) -> None:
        """Answer one search, until there is no more to say or nobody listens any more."""
        with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as sender:
            sender.connect(client)
            for location in self.personality.locations(self._base):
                try:
                    sender.send(_ANNOUNCEMENT.format(location=location).encode())
                except OSError:
                    return

    def _status(self, _arguments: Arguments) -> Answer:
        return 0, {"NewConnectionStatus": "Connected", "NewLastConnectionError": "ERROR_NONE",
                   "NewUptime": "1"}

    def _external_address(self, _arguments: Arguments) -> Answer:
        return 0, {"NewExternalIPAddress": self._public_address()}

    def _add(self, arguments: Arguments) -> Answer:
        wanted = Forwarding(arguments["NewProtocol"], int(arguments["NewExternalPort"]),
                            arguments["NewInternalClient"], int(arguments["NewInternalPort"]))
        held = self._held(arguments)
        if held and held.internal_address != wanted.internal_address:
            return _CONFLICT, {}
        if held:
            packet_filter.remove(held)
        packet_filter.forward(wanted)
        self._descriptions[wanted] = arguments["NewPortMappingDescription"]
        return 0, {}

    def _delete(self, arguments: Arguments) -> Answer:
        held = self._held(arguments)
        if not held:
            return _NOT_MAPPED, {}
        packet_filter.remove(held)
        return 0, {}

    def _specific_entry(self, arguments: Arguments) -> Answer:
        held = self._held(arguments)
        return (0, self._entry(held)) if held else (_NOT_MAPPED, {})

    def _generic_entry(self, arguments: Arguments) -> Answer:
        index, mappings = int(arguments["NewPortMappingIndex"]), packet_filter.mappings()
        if self.personality.endless_list:
            mapping = Forwarding("UDP", index, network.NEIGHBOUR_ADDRESS, index)
        elif index < len(mappings):
            mapping = mappings[index]
        else:
            return _NOT_IN_ARRAY, {}
        return 0, {"NewRemoteHost": "", "NewExternalPort": str(mapping.external_port),
                   "NewProtocol": mapping.protocol, **self._entry(mapping)}

    def _entry(self, mapping: Forwarding) -> Arguments:
        return {"NewInternalPort": str(mapping.internal_port),
                "NewInternalClient": mapping.internal_address, "NewEnabled": "1",
                "NewPortMappingDescription": self._descriptions.get(mapping, ""),
                "NewLeaseDuration": "0"}

    def _held(self, arguments: Arguments) -> Forwarding | None:
        """The forwarding of the external port and protocol, whoever made it."""
        wanted = arguments["NewProtocol"], int(arguments["NewExternalPort"])
        return next((mapping for mapping in packet_filter.mappings()
                     if (mapping.protocol, mapping.external_port) == wanted), None)


class _WebServer(ThreadingHTTPServer):
    daemon_threads = True
    request_queue_size = 256

    def __init__(self, address: tuple[str, int], gateway: ScriptedGateway) -> None:
        self.gateway = gateway
        super().__init__(address, _Handler)

    def handle_error(self, request: object, client_address: object) -> None:
        """Ignore clients that disconnect early."""


class _Handler(BaseHTTPRequestHandler):
    server: _WebServer

    def do_GET(self) -> None:
        """Deliver the description, whatever the path."""
        gateway, body = self.server.gateway, self.server.gateway.description()
        for piece in gateway.personality.deliver(_head("200 OK", len(body)), body):
            self.wfile.write(piece)

    def do_POST(self) -> None:
        """Perform an action of the control service."""
        if urlsplit(self.path).path != urlsplit(self.server.gateway.personality.control_url).path:
            self.wfile.write(_head("404 Not Found", 0))
            return
        body = self.rfile.read(int(self.headers["Content-Length"])).decode()
        action = self.headers["SOAPAction"].strip('"').rpartition("#")[2]
        error, values = self.server.gateway.answer(action, dict(_ARGUMENT.findall(body)))
        stuffing = self.server.gateway.personality.stuffing
        answer = (stuffing + _soap(action, error, values)).encode()
        status = "500 Internal Server Error" if error else "200 OK"
        self.wfile.write(_head(status, len(answer)) + answer)

    def log_message(self, *_arguments: object) -> None:
        """Stay silent: the device's log tells what it asked."""


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


def _soap(action: str, error: int, values: Arguments) -> str:
    told = "".join(f"<{name}>{escape(value)}</{name}>" for name, value in values.items())
    form = _FAULT if error else _RESPONSE
    return _ENVELOPE.format(body=form.format(action=action, values=told, error=error))
