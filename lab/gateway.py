"""The home router: masquerading for everybody, and miniupnpd when it offers a mapping protocol."""

from __future__ import annotations

import re
import socket
import threading
from collections.abc import Mapping as Settings
from dataclasses import dataclass, field, replace
from pathlib import Path

from lab import natpmp, network, packet_filter, web
from lab.natpmp import Grant, NatPmp
from lab.packet_filter import BY_HAND, Mapping
from lab.scripted_gateway import Entry, Personality, ScriptedGateway
from lab.server import Server
from lab.support import LabError, wait_until
from lab.timeline import Timeline

EVERY_PORT = ("allow 1-65535 0.0.0.0/0 1-65535",)
NO_PORT = ("deny 0-65535 0.0.0.0/0 0-65535",)
STOCK_PERMISSIONS = ("allow 1024-65535 192.168.77.0/24 1024-65535", *NO_PORT)

_FIRST_HTTP_PORT = 5001
_SEARCH = ("M-SEARCH * HTTP/1.1\r\nHOST: 239.255.255.250:1900\r\n"
           "MAN: \"ssdp:discover\"\r\nMX: 1\r\n"
           "ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n\r\n").encode()
_PUBLIC_ADDRESS_REQUEST = b"\0\0"
# A line of `upnpc -l`: number, protocol, mapping, description, remote host, lease.
_LISTED = re.compile(r"^ *\d+ (TCP|UDP) +(\d+)->([\d.]+):(\d+) +'(.*)' '.*' (\d+)$",
                     re.MULTILINE)


@dataclass(frozen=True)
class GatewaySetup:
    """What a home router offers; with neither protocol it only masquerades.

    `secure` lets clients map to themselves only. With `grant`, the lab's own NAT-PMP server answers
    and grants that. With `personality`, the lab's own UPnP server answers and behaves like that.
    `settings` are further lines of miniupnpd's configuration. The protocols are served at the
    address `served_at` of the LAN if the default route is not where they are. `others` are further
    UPnP servers on the LAN, each a computer of its own (192.168.77.2 and on).
    """

    upnp: bool = True
    natpmp: bool = False
    permissions: tuple[str, ...] = EVERY_PORT
    secure: bool = True
    grant: Grant | None = None
    personality: Personality | None = None
    settings: Settings[str, str] = field(default_factory=dict)
    served_at: str = ""
    others: tuple[Personality, ...] = ()

    @property
    def needs_miniupnpd(self) -> bool:
        """True when miniupnpd speaks one of the protocols."""
        return (self.upnp and not self.personality) or (self.natpmp and not self.grant)

    def __str__(self) -> str:
        protocols = [name for name, on in (("UPnP", self.upnp), ("NAT-PMP", self.natpmp)) if on]
        own = self.grant or self.personality
        rules = "ports of its own choice" if own else ", ".join(self.permissions)
        return f"{' and '.join(protocols) or 'no protocol'} ({rules})"


@dataclass(frozen=True)
class Listed:
    """A mapping as the router lists it through UPnP; `lease` is what is left, in seconds."""

    mapping: Mapping
    description: str
    lease: int


class Gateway:
    """The router and its actual state. Its leases run in device time, `clock` times ours.

    The lab's own servers note UPnP calls in `diary`, and as "odd" what no good gateway would do.
    """

    def __init__(self, folder: Path, setup: GatewaySetup, timeline: Timeline,
                 clock: int = 1) -> None:
        folder.mkdir(parents=True)
        self.lan_address = network.GATEWAY_LAN_ADDRESS
        self.wan_address = network.GATEWAY_WAN_ADDRESS
        self._folder = folder
        self._leases = folder / "leases"
        self._setup = setup
        self._timeline = timeline
        self._clock = clock
        self._http_port = _FIRST_HTTP_PORT
        self._natpmp: NatPmp | None = None
        self._scripted: ScriptedGateway | None = None
        self._others: list[ScriptedGateway] = []
        self.diary: list[str] = []
        self._online = True
        self.server = Server("miniupnpd", network.GATEWAY,
                             ["miniupnpd", "-d", "-f", str(folder / "miniupnpd.conf"),
                              "-P", str(folder / "pid")], folder / "log", clock)

    @property
    def setup(self) -> GatewaySetup:
        """What the router offers now."""
        return self._setup

    @property
    def description_url(self) -> str:
        """Where the router describes itself to UPnP clients."""
        return f"http://{self.served_at}:{self._http_port}/rootDesc.xml"

    @property
    def served_at(self) -> str:
        """The LAN address at which the protocols are served."""
        return self._setup.served_at or self.lan_address

    def start(self) -> None:
        """Route and masquerade; offer the protocols of the setup and wait until they answer."""
        threading.Thread(target=packet_filter.watch, args=(self._tell_change,),
                         daemon=True).start()
        network.enable_forwarding(network.GATEWAY)
        packet_filter.load()
        if self._setup.served_at:
            self._add_lan_address(self._setup.served_at)
        self._serve()
        for number, personality in enumerate(self._setup.others, start=2):
            network.pretend_computer(network.GATEWAY, "lan", address := f"192.168.77.{number}")
            other = ScriptedGateway(personality, lambda: self.wan_address, self.diary)
            other.start(address)
            self._others.append(other)

    def become(self, setup: GatewaySetup) -> None:
        """Offer something else from now on, as after a change in the router's settings.

        Existing forwardings stay. miniupnpd comes back on another TCP port, and expires older
        leases only when it checks one that it has granted since.
        """
        self._stop()
        self._setup = setup
        self._serve()
        self._timeline.add("gateway", f"now offers {setup}")

    def reboot(self, lan_address: str | None = None) -> None:
        """Forget every mapping and come back, optionally at another LAN address.

        The hosts at home then get a new default route. Forwardings made by hand stay.
        """
        self._stop()
        packet_filter.flush(packet_filter.ASKED_FOR)
        self._leases.unlink(missing_ok=True)
        if lan_address:
            self._take_lan_address(lan_address)
        self._serve()
        self._timeline.add("gateway", f"rebooted at {self.lan_address}, all mappings lost")

    def fall_silent(self) -> None:
        """Stop answering on the LAN until `become` or `reboot`; existing forwardings stay."""
        packet_filter.change("add rule inet lab silence meta l4proto { tcp, udp } drop\n")
        self._stop()
        self._timeline.add("gateway", "no longer answers the mapping protocols")

    def go_deaf(self) -> None:
        """Receive no search any more until `become` or `reboot`; all else still works."""
        packet_filter.change("add rule inet lab silence udp dport 1900 drop\n")
        self._timeline.add("gateway", "no longer hears searches")

    def keep(self, mapping: Mapping) -> None:
        """Have this mapping, as if a client had got it on a better day."""
        if mapping in self.left():
            return
        if self._scripted:
            self._scripted.keep(Entry(mapping))
        else:
            packet_filter.forward(mapping)

    def hang_once(self, seconds: float) -> None:
        """Let the lab's NAT-PMP server hang when the device next asks for a mapping."""
        if not self._natpmp:
            raise LabError("only the lab's own NAT-PMP server can be told to hang")
        self._natpmp.hang_once(seconds)
        self._timeline.add("gateway", f"will hang for {seconds} s at the next request")

    def behave(self, personality: Personality) -> None:
        """Let the lab's own UPnP server behave differently from now on."""
        if not self._scripted:
            raise LabError("only the lab's own UPnP server has a personality")
        self._scripted.personality = personality
        self._setup = replace(self._setup, personality=personality)
        self._timeline.add("gateway", "behaves differently")

    def lose(self, *external_ports: int) -> None:
        """Drop the forwardings of these ports, or all, without notice.

        miniupnpd reads its rules again only after a change of its own or at its start, so it is
        restarted, on the same port.
        """
        lost = [mapping for mapping in self.mappings()
                if not external_ports or mapping.external_port in external_ports]
        if not lost:
            raise LabError(f"the gateway forwards none of {external_ports or 'any port'}")
        self._timeline.add("gateway", f"loses {', '.join(map(str, lost))}")
        running = self.server.running
        if running:
            self.server.stop()
        for mapping in lost:
            if self._scripted:
                self._scripted.forget((mapping.protocol, mapping.external_port))
            else:
                packet_filter.remove(mapping)
        self._forget_leases(lost)
        if running:
            self.server.start(self._answers)

    def go_offline(self) -> None:
        """Have no internet address until `go_online`, as before the provider has assigned one."""
        network.ip_batch(f"address del {self.wan_address}/24 dev wan", host=network.GATEWAY)
        self._online = False
        self._timeline.add("gateway", "has no internet address")

    def go_online(self) -> None:
        """Have the internet address again."""
        network.ip_batch(f"address add {self.wan_address}/24 dev wan",
                         f"route replace default via {network.SERVICE_ADDRESS}",
                         host=network.GATEWAY)
        self._online = True
        self._timeline.add("gateway", f"has the internet address {self.wan_address} again")

    def move_to(self, wan_address: str) -> None:
        """Get another address from the internet provider."""
        self.take_wan_address(wan_address, network.SERVICE_ADDRESS)
        self._timeline.add("gateway", f"now has the internet address {wan_address}")

    def take_wan_address(self, address: str, router: str) -> None:
        """Take another WAN address, with `router` as the next hop.

        miniupnpd reports the interface's current address, and its rules name only the interface,
        so every mapping applies to the new address at once.
        """
        network.ip_batch(f"address del {self.wan_address}/24 dev wan",
                         f"address add {address}/24 dev wan",
                         f"route replace default via {router}", host=network.GATEWAY)
        network.ip_batch(f"neighbour flush to {self.wan_address} dev net", host=network.INTERNET)
        self.wan_address = address

    def block(self, external_port: int) -> None:
        """Drop everything from the internet to this port; the mapping stays listed."""
        packet_filter.change(f"add element inet lab blocked {{ {external_port} }}\n")
        self._timeline.add("gateway", f"external port {external_port} is blocked")

    def unblock(self, external_port: int) -> None:
        """Let the internet through to this port again."""
        packet_filter.change(f"delete element inet lab blocked {{ {external_port} }}\n")
        self._timeline.add("gateway", f"external port {external_port} is open again")

    def forward_by_hand(self, external_port: int, internal_port: int,
                        address: str = network.DEVICE_ADDRESS) -> None:
        """Forward a TCP port as the user would on the router's own pages."""
        mapping = Mapping("TCP", external_port, address, internal_port)
        packet_filter.forward(mapping, BY_HAND)
        self._timeline.add("gateway", f"the user forwards {mapping}")

    def stop_forwarding_by_hand(self) -> None:
        """Remove the forwardings made by hand."""
        packet_filter.flush(BY_HAND)
        self._timeline.add("gateway", "the user removes the forwardings made by hand")

    def by_hand(self) -> list[Mapping]:
        """The forwardings made by hand, read from the packet filter."""
        return packet_filter.mappings(BY_HAND)

    def mappings(self) -> list[Mapping]:
        """The forwardings that clients requested, read from the packet filter."""
        return packet_filter.mappings()

    def left(self) -> list[Mapping]:
        """What is forwarded or, by one of the lab's own UPnP servers, listed for clients."""
        servers = [*self._others, *([self._scripted] if self._scripted else [])]
        entries = [entry.mapping for server in servers for entry in server.table.values()]
        return sorted({*self.mappings(), *entries})

    def listing(self) -> list[Listed]:
        """The mappings as the router lists them to a UPnP client."""
        listing = network.output(network.NEIGHBOUR, "upnpc", "-u", self.description_url, "-l")
        if "Found valid IGD" not in listing:
            raise LabError(f"the gateway does not list its mappings: {listing}")
        return [Listed(Mapping(protocol, int(external), address, int(internal)), words, int(lease))
                for protocol, external, address, internal, words, lease in _LISTED.findall(listing)]

    def was_asked(self, call: str) -> bool:
        """True if a UPnP client asked for this, as in "DeletePortMapping: external port: 9091"."""
        log = self.server.log
        return call in self.diary or log.exists() and call in log.read_text(errors="replace")

    def requests(self) -> int:
        """The device's requests; those of the lab and the neighbour do not count."""
        return self.upnp_requests() + self.natpmp_requests()

    def upnp_requests(self) -> int:
        """The device's connections to the router's UPnP service (one for each HTTP request)."""
        return packet_filter.counted("upnp")

    def natpmp_requests(self) -> int:
        """The device's NAT-PMP datagrams."""
        return packet_filter.counted("natpmp")

    def _serve(self) -> None:
        packet_filter.change("flush chain inet lab silence\n")
        if self._setup.natpmp and self._setup.grant:
            self._natpmp = NatPmp(self._setup.grant, self._clock, lambda: self.wan_address,
                                  self.diary)
            self._natpmp.start(self.served_at)
        if self._setup.upnp and self._setup.personality:
            self._scripted = ScriptedGateway(self._setup.personality, lambda: self.wan_address,
                                             self.diary)
            self._scripted.start(self.served_at)
        if self._setup.needs_miniupnpd:
            (self._folder / "miniupnpd.conf").write_text(self._configuration())
            self.server.start(self._answers)
        elif self._natpmp:
            wait_until(self._answers, "the lab's NAT-PMP server to answer", 5)

    def _stop(self) -> None:
        """Stop the mapping protocols; the rules stay in force."""
        if self.server.running:
            self.server.stop()
            self._http_port += 1
        if self._natpmp:
            self._natpmp.stop()
            self._natpmp = None
        if self._scripted:
            self._scripted.stop()
            self._scripted = None

    def _forget_leases(self, lost: list[Mapping]) -> None:
        """Remove mappings from the file from which miniupnpd restores them at its start."""
        if self._leases.exists():
            gone = tuple(f"{mapping.protocol}:{mapping.external_port}:" for mapping in lost)
            kept = [line for line in self._leases.read_text().splitlines(keepends=True)
                    if not line.startswith(gone)]
            self._leases.write_text("".join(kept))

    def _configuration(self) -> str:
        yes_no = {True: "yes", False: "no"}
        settings = {
            "ext_ifname": "wan", "listening_ip": self._setup.served_at or "lan",
            "port": str(self._http_port),
            "enable_upnp": yes_no[self._setup.upnp and not self._setup.personality],
            "enable_natpmp": yes_no[self._setup.natpmp and not self._setup.grant],
            "force_igd_desc_v1": "yes", "secure_mode": yes_no[self._setup.secure],
            "system_uptime": "no", "lease_file": str(self._leases),
            "uuid": "6c0b7c7a-2f0e-4e5c-9f6b-7d2f8a1c4e77",
            "upnp_table_name": "gate", "upnp_nat_table_name": "gate",
            "upnp_forward_chain": packet_filter.ASKED_FOR.admit,
            "upnp_nat_chain": packet_filter.ASKED_FOR.redirect,
            "upnp_nat_postrouting_chain": "postrouting_miniupnpd", **self._setup.settings}
        return "\n".join([*(f"{key}={value}" for key, value in settings.items()),
                          *self._setup.permissions, ""])

    def _answers(self) -> bool:
        """True when every protocol on offer answers a client on the LAN."""
        return ((not self._setup.upnp or bool(self._scripted) or _description_is_served())
                and (not self._setup.natpmp or self._public_address_is_told()))

    def _public_address_is_told(self) -> bool:
        answer = _udp_exchange(_PUBLIC_ADDRESS_REQUEST, self.served_at, natpmp.PORT) or b""
        if not self._online:
            return answer[1:2] == b"\x80"
        return answer[1:4] == b"\x80\0\0" and answer[8:12] == socket.inet_aton(self.wan_address)

    def _add_lan_address(self, address: str) -> None:
        network.ip_batch(f"address add {address}/24 dev lan", host=network.GATEWAY)

    def _take_lan_address(self, address: str) -> None:
        network.ip_batch(f"address del {self.lan_address}/24 dev lan",
                         f"address add {address}/24 dev lan", host=network.GATEWAY)
        for host in (network.DEVICE, network.NEIGHBOUR):
            network.ip_batch(f"route replace default via {address}", host=host)
        self.lan_address = address

    def _tell_change(self, change: str, mapping: Mapping) -> None:
        words = {"add": "forwards", "delete": "no longer forwards"}
        self._timeline.add("gateway", f"{words[change]} {mapping}")


def _udp_exchange(message: bytes, address: str, port: int) -> bytes | None:
    """Send one datagram from the neighbour; the answer, or None."""
    with network.inside(network.NEIGHBOUR):
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
            return "WANIPConnection:" in (web.fetch(network.NEIGHBOUR, location.strip()) or "")
    return False
