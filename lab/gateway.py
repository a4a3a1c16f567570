"""The home router: masquerading for everybody, and miniupnpd when it offers a mapping protocol."""

from __future__ import annotations

import json
import socket
import subprocess
import threading
from dataclasses import dataclass
from pathlib import Path

from lab import network, web
from lab.server import Server
from lab.support import run_tool
from lab.timeline import Timeline

EVERY_PORT = ("allow 1-65535 0.0.0.0/0 1-65535",)
NO_PORT = ("deny 0-65535 0.0.0.0/0 0-65535",)

_SEARCH = ("M-SEARCH * HTTP/1.1\r\nHOST: 239.255.255.250:1900\r\n"
           "MAN: \"ssdp:discover\"\r\nMX: 1\r\n"
           "ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n\r\n").encode()
_PUBLIC_ADDRESS_REQUEST = b"\0\0"
_PROTOCOL_BIT = 72
_MAPPING_CHAIN = "prerouting_miniupnpd"

# Closed towards the internet except for what a mapping opens.
_RULES = """
table inet gate {
    chain miniupnpd { }
    chain forward {
        type filter hook forward priority 0; policy drop;
        ct state established,related accept
        iifname "lan" accept
        jump miniupnpd
    }
    chain input {
        type filter hook input priority 0; policy accept;
        iifname "wan" ct state new drop
    }
    chain prerouting_miniupnpd { }
    chain postrouting_miniupnpd { }
    chain prerouting {
        type nat hook prerouting priority -100;
        jump prerouting_miniupnpd
    }
    chain postrouting {
        type nat hook postrouting priority 100;
        jump postrouting_miniupnpd
        oifname "wan" masquerade
    }
}
"""


@dataclass(frozen=True)
class GatewaySetup:
    """What a home router offers; with neither protocol it only masquerades."""

    upnp: bool = True
    natpmp: bool = False
    permissions: tuple[str, ...] = EVERY_PORT

    @property
    def speaks(self) -> bool:
        """True when there is a protocol to ask the router with."""
        return self.upnp or self.natpmp

    def __str__(self) -> str:
        protocols = [name for name, on in (("UPnP", self.upnp), ("NAT-PMP", self.natpmp)) if on]
        return f"{' and '.join(protocols) or 'no protocol'} ({', '.join(self.permissions)})"


@dataclass(frozen=True, order=True)
class Mapping:
    """One forwarding as the router's packet filter holds it."""

    protocol: str
    external_port: int
    internal_address: str
    internal_port: int

    def __str__(self) -> str:
        return (f"{self.protocol} {self.external_port} -> "
                f"{self.internal_address}:{self.internal_port}")


class Gateway:
    """The router and its real state."""

    def __init__(self, folder: Path, setup: GatewaySetup, timeline: Timeline) -> None:
        folder.mkdir(parents=True)
        self._folder = folder
        self._setup = setup
        self._timeline = timeline
        self.server = Server("miniupnpd", network.GATEWAY,
                             ["miniupnpd", "-d", "-f", str(folder / "miniupnpd.conf"),
                              "-P", str(folder / "pid")], folder / "log")

    def start(self) -> None:
        """Route and masquerade; offer the protocols of the setup and wait for their answers."""
        threading.Thread(target=self._watch, daemon=True).start()
        with network.inside(network.GATEWAY):
            Path("/proc/sys/net/ipv4/ip_forward").write_text("1")
        run_tool(*network.command(network.GATEWAY, "nft", "-f", "-"), text=_RULES)
        self._serve()

    def become(self, setup: GatewaySetup) -> None:
        """Offer something else from now on, as after a change in the router's settings."""
        if self._setup.speaks:
            self.server.stop()
        self._setup = setup
        self._serve()
        self._timeline.add("gateway", f"now offers {setup}")

    def mappings(self) -> list[Mapping]:
        """The forwardings in force, read from the packet filter."""
        rules = network.output(network.GATEWAY, "nft", "-j", "list", "chain", "inet", "gate",
                               _MAPPING_CHAIN)
        entries = json.loads(rules)["nftables"]
        return sorted(_mapping(entry["rule"]["expr"]) for entry in entries if "rule" in entry)

    def _serve(self) -> None:
        if self._setup.speaks:
            (self._folder / "miniupnpd.conf").write_text(self._configuration())
            self.server.start(self._answers)

    def _configuration(self) -> str:
        yes_no = {True: "yes", False: "no"}
        return "\n".join([
            "ext_ifname=wan", f"ext_ip={network.GATEWAY_WAN_ADDRESS}", "listening_ip=lan",
            f"enable_upnp={yes_no[self._setup.upnp]}",
            f"enable_natpmp={yes_no[self._setup.natpmp]}",
            "force_igd_desc_v1=yes", "secure_mode=yes", "system_uptime=yes",
            "uuid=6c0b7c7a-2f0e-4e5c-9f6b-7d2f8a1c4e77", f"lease_file={self._folder}/leases",
            "upnp_table_name=gate", "upnp_nat_table_name=gate", "upnp_forward_chain=miniupnpd",
            f"upnp_nat_chain={_MAPPING_CHAIN}",
            "upnp_nat_postrouting_chain=postrouting_miniupnpd", *self._setup.permissions, ""])

    def _answers(self) -> bool:
        """True when a client on the LAN gets through to every protocol on offer."""
        return ((not self._setup.upnp or _description_is_served())
                and (not self._setup.natpmp or _public_address_is_told()))

    def _watch(self) -> None:
        """Tell the timeline of every change of the mappings, whoever made it."""
        words = {"add": "forwards", "delete": "no longer forwards"}
        monitor = subprocess.Popen(
            network.command(network.GATEWAY, "nft", "-j", "monitor", "rules"),
            stdout=subprocess.PIPE, text=True)
        for line in monitor.stdout:
            for change, subject in json.loads(line).items():
                rule = subject.get("rule", {})
                if change in words and rule.get("chain") == _MAPPING_CHAIN:
                    self._timeline.add("gateway", f"{words[change]} {_mapping(rule['expr'])}")


def _mapping(expressions: list[dict]) -> Mapping:
    """Read one rule that miniupnpd made; it matches the protocol as a byte of the IPv4 header."""
    protocol, external_port, target = "", 0, {}
    for expression in expressions:
        match = expression.get("match", {})
        payload = match.get("left", {}).get("payload", {})
        if payload.get("field") == "dport":
            external_port = match["right"]
        elif (payload.get("base"), payload.get("offset")) == ("nh", _PROTOCOL_BIT):
            protocol = {6: "TCP", 17: "UDP"}[match["right"]]
        target = expression.get("dnat", target)
    return Mapping(protocol, external_port, target["addr"], target["port"])


def _udp_exchange(message: bytes, address: str, port: int) -> bytes | None:
    """One datagram from the device and what came back, if anything did."""
    with network.inside(network.DEVICE):
        asking = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    with asking:
        asking.settimeout(0.2)
        try:
            asking.sendto(message, (address, port))
            return asking.recv(1500)
        except OSError:
            return None


def _description_is_served() -> bool:
    found = _udp_exchange(_SEARCH, "239.255.255.250", 1900)
    for line in (found or b"").decode(errors="replace").splitlines():
        name, _, location = line.partition(":")
        if name.upper() == "LOCATION":
            return "WANIPConnection:1" in (web.fetch(network.DEVICE, location.strip()) or "")
    return False


def _public_address_is_told() -> bool:
    answer = _udp_exchange(_PUBLIC_ADDRESS_REQUEST, network.GATEWAY_LAN_ADDRESS, 5351) or b""
    return answer[1:4] == b"\x80\0\0" and answer[8:12] == socket.inet_aton(
        network.GATEWAY_WAN_ADDRESS)
