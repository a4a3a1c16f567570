"""The maker's central service as the device sees it.

It tells the device its address, lets it proceed or makes it wait, tests a port by connecting back
through the home router, records where the device can be reached, and points the device's public
names there. A test can make it slow, silent or wrong.
"""

from __future__ import annotations

import re
import reprlib
import threading
import time
from dataclasses import dataclass, replace

from lab import network, web
from lab.account import SERVICE_HOST, Account
from lab.certificates import Authority
from lab.names import Names
from lab.timeline import Timeline
from lab.web import Reply, Request, WebServer

MY_IP, WAIT, PORT_TEST, PORT_FORWARD, COMM_STATUS = (
    "myip", "remote_access_status", "port_test", "port_forward", "comm_status")
IDENTITY_PATH = "/api/1.0/rest/device"
_READY_PATH = "/ready"
_CONNECT_BACK_SECONDS = 0.75


@dataclass(frozen=True)
class Record:
    """Where the service sends remote clients: an address with two ports."""

    external_ip: str
    local_ip: str
    http_port: int
    https_port: int


@dataclass(frozen=True)
class PortTest:
    """One connection back to a device, and the device id found there."""

    address: str
    port: int
    protocol: str
    found: str

    def passed(self, account: Account) -> bool:
        """True when the right device answered."""
        return self.found == account.device_id


@dataclass(frozen=True)
class Fault:
    """How an operation misbehaves: a different answer, a delay, or no answer at all.

    `drop` closes the connection, `reset` resets it, `endless` repeats the body without end, and
    with `pause` a byte takes that many seconds. With `times` the operation recovers after that many
    requests.
    """

    body: str | None = None
    delay: float = 0
    drop: bool = False
    reset: bool = False
    endless: bool = False
    pause: float = 0
    times: int = 0

    def __str__(self) -> str:
        pause = f" after {self.delay:g} s" if self.delay else ""
        pause += f", a byte in {self.pause:g} s" if self.pause else ""
        pause += " without end" if self.endless else ""
        often = {0: "", 1: ", once"}.get(self.times, f", {self.times} times")
        return f"{self._ending()}{pause}{often}"

    def _ending(self) -> str:
        if self.reset:
            return "resets the connection"
        if self.drop:
            return "hangs up"
        return "answers" if self.body is None else f"answers {reprlib.repr(self.body)}"


class CentralService:
    """The service; `requests`, `port_tests`, `record` and `withdrawals` are open to inspection."""

    def __init__(self, account: Account, authority: Authority, names: Names,
                 timeline: Timeline) -> None:
        self.requests: list[Request] = []
        self.port_tests: list[PortTest] = []
        self.record: Record | None = None
        self.local_ip = ""
        self.withdrawals = 0
        self.wait_seconds = 0
        self._account = account
        self._authority = authority
        self._names = names
        self._timeline = timeline
        self._faults: dict[str, Fault] = {}
        self._lock = threading.Lock()
        self._servers: list[WebServer] = []
        self._operations = {MY_IP: self._my_ip, WAIT: self._permission,
                            PORT_TEST: self._port_test, PORT_FORWARD: self._port_forward,
                            COMM_STATUS: self._comm_status}

    def start(self) -> None:
        """Listen on HTTP and HTTPS, and wait until a client at home gets answers from both."""
        restarted = bool(self._servers)
        self._names.set({SERVICE_HOST: network.SERVICE_ADDRESS})
        self._point_names()
        self._servers = [
            WebServer(network.INTERNET, network.SERVICE_ADDRESS, 80, self._answer),
            WebServer(network.INTERNET, network.SERVICE_ADDRESS, 443, self._answer,
                      self._authority.sign(SERVICE_HOST))]
        for scheme in ("http", "https"):
            web.expect_answer(f"central service ({scheme})", network.DEVICE,
                              f"{scheme}://{network.SERVICE_ADDRESS}{_READY_PATH}",
                              trust=str(self._authority.certificate), name=SERVICE_HOST)
        if restarted:
            self._timeline.add("central", "is back up")

    def stop(self) -> None:
        """Stop listening: connections are refused until `start`."""
        self._timeline.add("central", "goes down")
        for server in self._servers:
            server.close()

    def misbehave(self, operation: str, fault: Fault | None) -> None:
        """Make one operation misbehave from now on, or work again with None."""
        with self._lock:
            self._faults.pop(operation, None)
            if fault:
                self._faults[operation] = fault
        self._timeline.add("central", f"{operation} now {fault or 'works normally'}")

    def show_certificate_of(self, name: str, expired: bool = False, outdated: bool = False) -> None:
        """Present a certificate for `name` from now on; devices reject a wrong one.

        It may be `expired`, or the server so `outdated` that it offers nothing above TLS 1.0.
        """
        self._servers[1].show_certificate(self._authority.sign(name, expired), outdated)
        self._timeline.add("central", f"now presents {'an expired' if expired else 'a'} certificate"
                           f" for {name}{' over TLS 1.0' if outdated else ''}")

    def show_certificate_from(self, authority: Authority) -> None:
        """Present a certificate that somebody else has signed from now on."""
        self._servers[1].show_certificate(authority.sign(SERVICE_HOST))
        self._timeline.add("central", "now presents a certificate of an unknown authority")

    def drop_tls(self) -> None:
        """Speak plain HTTP on the HTTPS port until the next certificate."""
        self._servers[1].drop_tls()
        self._timeline.add("central", "speaks plain HTTP on port 443")

    def keep_silent(self, silent: bool = True) -> None:
        """Accept connections and say nothing on them, not even in a handshake."""
        for server in self._servers:
            server.silent = silent
        self._timeline.add("central", "keeps silent" if silent else "answers again")

    def requests_for(self, operation: str) -> list[Request]:
        """The requests for one operation, in order."""
        return [request for request in self.requests if _operation(request) == operation]

    def state(self) -> str:
        """A summary for a failure report."""
        lines = [f"record: {self.record}, withdrawn {self.withdrawals} times, "
                 f"device last seen at {self.local_ip or 'nowhere'}"]
        lines += [f"port test: {test}" for test in self.port_tests]
        lines += [f"{request.scheme} {request.peer} {request.url}" for request in self.requests]
        return "\n".join(lines)

    def _answer(self, request: Request) -> Reply:
        if request.path == _READY_PATH:
            return Reply(b"ready")
        with self._lock:
            self.requests.append(request)
            fault = self._next_fault(_operation(request))
        if fault:
            time.sleep(fault.delay)
            if fault.drop or fault.reset:
                return Reply(None, reset=fault.reset)
            if fault.body is not None:
                return Reply(fault.body.encode(), pause=fault.pause, endless=fault.endless)
        operation = self._operations.get(_operation(request))
        if operation is None:
            return Reply(b"<status>failure</status>", 404)
        if operation in (self._my_ip, self._permission):
            return Reply(operation(request).encode())
        if not self._may(request):
            self._timeline.add("central", f"refused {_operation(request)}: wrong credentials")
            return Reply(b"<status>failure</status>", 401)
        return Reply(operation(request).encode())

    def _next_fault(self, operation: str) -> Fault | None:
        """The fault for the next request; a counted one ends after its last."""
        fault = self._faults.get(operation)
        if fault and fault.times == 1:
            del self._faults[operation]
        elif fault and fault.times:
            self._faults[operation] = replace(fault, times=fault.times - 1)
        return fault

    def _may(self, request: Request) -> bool:
        known = (self._account.device_id, self._account.auth)
        return (request.path.rsplit("/", 1)[-1], request.argument("auth")) == known

    def _my_ip(self, request: Request) -> str:
        return request.peer

    def _permission(self, _request: Request) -> str:
        if self.wait_seconds > 0:
            self._timeline.add("central", f"asks the device to wait {self.wait_seconds} s")
            return f"<action>wait</action><wait_time>{self.wait_seconds}</wait_time>"
        return "<action>proceed</action>"

    def _port_test(self, request: Request) -> str:
        address = request.argument("external_ip") or request.peer
        port, protocol = int(request.argument("port")), request.argument("protocol")
        test = PortTest(address, port, protocol, _who_answers(address, port, protocol))
        passed = test.passed(self._account)
        self.port_tests.append(test)
        self._timeline.add("central", f"connects back to {address}:{port} ({protocol}): "
                           + ("the device answers" if passed else "another device answers"
                              if test.found else "the device does not answer"))
        return (f"<port_test><status>{'Success' if test.found else 'failure'}</status>"
                f"<remote_external_ip>{request.peer}</remote_external_ip>"
                f"<external_ip>{address}</external_ip>"
                f"<req_device_id>{self._account.device_id}</req_device_id>"
                f"<resp_device_id>{test.found}</resp_device_id></port_test>")

    def _port_forward(self, request: Request) -> str:
        external_ip = request.argument("external_ip")
        if external_ip == "NULL":
            self.record = None
            self.withdrawals += 1
            self._point_names()
            self._timeline.add("central", "mapping withdrawn, names point to the relay")
        else:
            self.record = Record(external_ip, request.argument("local_ip"),
                                 int(request.argument("http_port")),
                                 int(request.argument("https_port")))
            self._point_names()
            self._timeline.add("central", f"mapping published: {external_ip} HTTP "
                               f"{self.record.http_port}, HTTPS {self.record.https_port}")
        return "<status>Success</status>"

    def _point_names(self) -> None:
        """Point the names at the device if it is published, else at the relay."""
        address = self.record.external_ip if self.record else network.RELAY_ADDRESS
        self._names.set(dict.fromkeys(self._account.names, address))

    def _comm_status(self, request: Request) -> str:
        self.local_ip = request.argument("local_ip")
        return "<status>Success</status>"


def _operation(request: Request) -> str:
    parts = request.path.split("/")
    return parts[4] if len(parts) > 4 else ""


def _who_answers(address: str, port: int, protocol: str) -> str:
    """The device id of whoever listens there; empty without a proper answer."""
    page = web.fetch_from_here(f"{protocol.lower()}://{address}:{port}{IDENTITY_PATH}",
                               seconds=_CONNECT_BACK_SECONDS) or ""
    found = re.search(r"<device_id>(.*?)</device_id>", page)
    return found.group(1) if found else ""
