"""The internet's name server: dnsmasq over a hosts file that the central service rewrites."""

from __future__ import annotations

import select
import signal
import socket
import struct
import threading
from collections.abc import Callable, Iterable
from pathlib import Path

from lab import network
from lab.account import DOMAIN
from lab.server import Server
from lab.support import wait_until
from lab.timeline import Timeline

_TYPE_A, _CLASS_INTERNET = 1, 1


class Names:
    """Names and their addresses as every host of the lab resolves them."""

    def __init__(self, folder: Path, timeline: Timeline) -> None:
        folder.mkdir(parents=True)
        self._hosts = folder / "hosts"
        self._hosts.write_text("")
        self._timeline = timeline
        self._table: dict[str, str] = {}
        self._pins: dict[str, str | None] = {}
        self._lock = threading.Lock()
        self.server = Server("dnsmasq", network.INTERNET, [
            "dnsmasq", "--no-daemon", "--conf-file=/dev/null", "--no-resolv", "--no-hosts",
            "--bind-interfaces", f"--listen-address={network.SERVICE_ADDRESS}", "--local-ttl=0",
            f"--local={DOMAIN.replace('.', '/', 1)}/", "--log-queries", "--log-facility=-",
            f"--addn-hosts={self._hosts}", f"--pid-file={folder}/pid"], folder / "log")

    def start(self) -> None:
        """Start the server and wait until it answers, if only with 'no such name'."""
        self.server.start(lambda: self._ask("nobody.example") is not None)

    def demand_tcp(self) -> Callable[[], object]:
        """From now on cut every answer off, and be silent to the TCP that is then tried.

        What is returned tells whether somebody has tried it.
        """
        self.server.stop()
        with network.inside(network.INTERNET):
            asked = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
            silent = socket.create_server((network.SERVICE_ADDRESS, 53))
        asked.bind((network.SERVICE_ADDRESS, 53))

        def cut_off() -> None:
            while True:
                query, client = asked.recvfrom(512)
                end = query.index(b"\0", 12) + 5
                asked.sendto(query[:2] + b"\x83\x80\0\1\0\0\0\0\0\0" + query[12:end], client)

        threading.Thread(target=cut_off, daemon=True).start()
        return lambda: select.select([silent], [], [], 0)[0]

    def set(self, table: dict[str, str]) -> None:
        """Add or change names and wait until the server serves them; a pinned name stays."""
        with self._lock:
            self._table.update(table)
            self._publish(table)

    def pin(self, name: str, address: str | None) -> None:
        """Resolve a name to this address, or not at all with None, whatever else is set."""
        with self._lock:
            self._pins[name] = address
            self._publish([name])
        self._timeline.add("names", f"{name} is pinned to {address or 'no address'}")

    def unpin(self, name: str) -> None:
        """Resolve a name again as it was last set."""
        with self._lock:
            del self._pins[name]
            self._publish([name])
        self._timeline.add("names", f"{name} is no longer pinned")

    def resolve(self, name: str) -> str:
        """The address a program on the device gets for a name; empty when there is none."""
        answer = network.output(network.DEVICE, "getent", "ahostsv4", name).split()
        return answer[0] if answer else ""

    def _publish(self, names: Iterable[str]) -> None:
        """Write the server's table and wait until it answers accordingly for these names."""
        table: dict[str, str | None] = {**self._table, **self._pins}
        self._hosts.write_text("".join(f"{address} {name}\n"
                                       for name, address in table.items() if address))
        self.server.send_signal(signal.SIGHUP)
        for name in names:
            wanted = [table[name]] if table.get(name) else []
            wait_until(lambda: self._ask(name) == wanted,
                       f"dnsmasq to answer {wanted} for {name}", 5, pause=0.01)

    def _ask(self, name: str) -> list[str] | None:
        """One DNS query from the internet side; None when nothing answers."""
        question = b"".join(bytes([len(label)]) + label.encode() for label in name.split("."))
        query = (struct.pack(">6H", 77, 0x0100, 1, 0, 0, 0) + question + b"\0"
                 + struct.pack(">2H", _TYPE_A, _CLASS_INTERNET))
        with network.inside(network.INTERNET):
            asking = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        with asking:
            asking.settimeout(0.5)
            try:
                asking.connect((network.SERVICE_ADDRESS, 53))
                asking.send(query)
                reply = asking.recv(512)
            except OSError:
                return None
        # Each record is 16 bytes: the name as a pointer, the fixed fields, and the address.
        count = struct.unpack(">H", reply[6:8])[0]
        body = reply[len(query):]
        return [socket.inet_ntoa(body[16 * i + 12:16 * i + 16]) for i in range(count)]
