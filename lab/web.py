"""Small web servers on the lab's hosts, and a client for them."""

from __future__ import annotations

import http.client
import socket
import ssl
import struct
import threading
import time
from collections.abc import Callable
from dataclasses import dataclass
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from urllib.parse import parse_qs, urlsplit

from lab import network
from lab.certificates import KeyPair
from lab.support import wait_until

_ANSWER_SECONDS = 10
# On, with zero seconds: closing discards unsent data and resets the connection.
NO_LINGERING = struct.pack("ii", 1, 0)


@dataclass(frozen=True)
class Request:
    """One request as it came in; `url` is the exact path and query."""

    when: float
    scheme: str
    peer: str
    url: str

    @property
    def path(self) -> str:
        """The path without the query."""
        return urlsplit(self.url).path

    def argument(self, name: str) -> str:
        """A query argument, empty when absent."""
        values = parse_qs(urlsplit(self.url).query, keep_blank_values=True).get(name, [""])
        return values[0]


@dataclass(frozen=True)
class Reply:
    """The reply to a request; without a body the connection ends without an answer.

    It is then closed normally or, with `reset`, reset. The body is sent at once or, with `pause`,
    at a byte in that many seconds.
    """

    body: bytes | None
    status: int = 200
    reset: bool = False
    pause: float = 0


Answer = Callable[[Request], Reply]


class WebServer(ThreadingHTTPServer):
    """Serves GET, and POST alike, on one address of one host, plain or over TLS."""

    daemon_threads = True
    request_queue_size = 64

    def __init__(self, host: str, address: str, port: int, answer: Answer,
                 identity: KeyPair | None = None) -> None:
        self.scheme = "https" if identity else "http"
        self._answer = answer
        self._tls: ssl.SSLContext | None = None
        if identity:
            self.show_certificate(identity)
        with network.inside(host):
            super().__init__((address, port), _Handler)
            threading.Thread(target=self.serve_forever, args=(0.1,), daemon=True).start()

    def show_certificate(self, identity: KeyPair) -> None:
        """Use this certificate for new connections."""
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(identity.certificate, identity.key)
        self._tls = context

    def get_request(self) -> tuple[socket.socket, object]:
        """Accept; the TLS handshake is left to the connection's own thread."""
        connection, peer = super().get_request()
        connection.settimeout(30)
        if self._tls:
            connection = self._tls.wrap_socket(connection, server_side=True,
                                               do_handshake_on_connect=False)
        return connection, peer

    def shutdown_request(self, request: socket.socket | tuple[bytes, socket.socket]) -> None:
        """Close without a shutdown: a connection to be reset must not be ended normally first."""
        self.close_request(request)

    def handle_error(self, request: object, client_address: object) -> None:
        """Ignore clients that disconnect or reject the certificate."""

    def reply_to(self, peer: str, url: str) -> Reply:
        """The answer to one request."""
        return self._answer(Request(time.monotonic(), self.scheme, peer, url))

    def close(self) -> None:
        """Stop listening; connections are refused afterwards."""
        self.shutdown()
        self.server_close()


class _Handler(BaseHTTPRequestHandler):
    server: WebServer

    def do_GET(self) -> None:
        reply = self.server.reply_to(self.client_address[0], self.path)
        if reply.body is None:
            if reply.reset:
                self.connection.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, NO_LINGERING)
            self.close_connection = True
            return
        self.send_response(reply.status)
        self.send_header("Content-Type", "text/plain")
        self.send_header("Content-Length", str(len(reply.body)))
        self.end_headers()
        if reply.pause:
            for letter in reply.body:
                self.wfile.write(bytes([letter]))
                time.sleep(reply.pause)
        else:
            self.wfile.write(reply.body)

    def do_POST(self) -> None:
        self.do_GET()

    def log_message(self, *_arguments: object) -> None:
        """Stay silent: requests are recorded where they are answered."""


def fetch(host: str, url: str, trust: str | None = None, name: str | None = None,
          seconds: float = 5) -> str | None:
    """GET `url` as a client on `host`; None when no answer came.

    The connection must be accepted within `seconds`; the answer may take longer. With `trust` (a
    file of authorities) the server must present a certificate for `name`.
    """
    with network.inside(host):
        return fetch_from_here(url, trust, name, seconds)


def fetch_from_here(url: str, trust: str | None = None, name: str | None = None,
                    seconds: float = 5) -> str | None:
    """`fetch` for a thread that is already on the right host."""
    parts = urlsplit(url)
    try:
        with socket.create_connection((parts.hostname, parts.port or _port(parts.scheme)),
                                      seconds) as plain:
            plain.settimeout(_ANSWER_SECONDS)
            stream = _secured(plain, trust, name) if parts.scheme == "https" else plain
            target = f"{parts.path or '/'}{'?' + parts.query if parts.query else ''}"
            stream.sendall(f"GET {target} HTTP/1.0\r\nHost: {parts.netloc}\r\n\r\n".encode())
            response = http.client.HTTPResponse(stream)
            response.begin()
            return response.read().decode(errors="replace")
    except (OSError, http.client.HTTPException):
        return None


def expect_answer(server: str, host: str, url: str, trust: str | None = None,
                  name: str | None = None) -> None:
    """Wait until `server` answers a client on `host`; LabError naming it if it never does."""
    wait_until(lambda: fetch(host, url, trust, name, 1), f"{server} to answer {url}", 10)


def _port(scheme: str) -> int:
    return 443 if scheme == "https" else 80


def _secured(plain: socket.socket, trust: str | None, name: str | None) -> ssl.SSLSocket:
    context = ssl.create_default_context(cafile=trust)
    if not trust:
        context.check_hostname = False
        context.verify_mode = ssl.CERT_NONE
    return context.wrap_socket(plain, server_hostname=name)
