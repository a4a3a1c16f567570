"""A device that is itself the home router, by the same maker: its scripts and their effect."""

from __future__ import annotations

import threading
from pathlib import Path
from typing import Any

from lab import network, nft
from lab.packet_filter import Mapping
from lab.timeline import Timeline

_FOLDER = Path("/run/own_router")
_WAN_ADDRESS, _LAN_ADDRESS = _FOLDER / "wan", _FOLDER / "lan"
_PREDEFINED, _ADDED, _CALLS = _FOLDER / "predefined", _FOLDER / "added", _FOLDER / "calls"

# Closed towards the internet except for what a forward opens.
_RULES = """
table inet router {
    map TCP { type inet_service : ipv4_addr . inet_service; }
    map UDP { type inet_service : ipv4_addr . inet_service; }
    chain input {
        type filter hook input priority 0; policy accept;
        iifname "wan" ct status dnat accept
        iifname "wan" ct state new drop
    }
    chain prerouting {
        type nat hook prerouting priority -100;
        iifname "wan" dnat ip to tcp dport map @TCP
        iifname "wan" dnat ip to udp dport map @UDP
    }
}
"""

_GET_IP = f"""#!/bin/sh
# Prints an address of the router: getip.sh wan|lan
echo "getip.sh $1" >>{_CALLS}
cat "{_FOLDER}/$1"
"""

# An external port is forwarded only once, and only an added forward can be removed.
_HELPER = f"""#!/bin/sh
# The router's port forwards: tavik_helper.sh list
#   tavik_helper.sh add PROTOCOL,PORT,LANADDRESS,INTERNALPORT,DESCRIPTION
#   tavik_helper.sh remove PROTOCOL,PORT,LANADDRESS,INTERNALPORT
exec 2>>{_FOLDER}/errors
printf '%s\\n' "tavik_helper.sh${{1:+ $1}}${{2:+ $2}}" >>{_CALLS}
IFS=, read -r protocol port address internal description <<END
$2
END
case $1 in
list)
    cat {_PREDEFINED} {_ADDED} ;;
add)
    nft create element inet router "$protocol" "{{ $port : $address . $internal }}" &&
        printf '%s\\n' "BRENVIK,$2" >>{_ADDED} ;;
remove)
    grep -q "^BRENVIK,$2," {_ADDED} &&
        nft delete element inet router "$protocol" "{{ $port }}" &&
        sed -i "/^BRENVIK,$2,/d" {_ADDED} ;;
esac
"""


class OwnRouter:
    """The router in the device; its forwards are the only way in from the internet."""

    def __init__(self, timeline: Timeline) -> None:
        self._timeline = timeline
        self._wan_address = ""
        self._lan_address = ""

    def start(self, wan_address: str, lan_address: str) -> None:
        """Install the scripts and close the device's internet side."""
        self._wan_address, self._lan_address = wan_address, lan_address
        _FOLDER.mkdir()
        for file, text in ((_WAN_ADDRESS, f"{wan_address}\n"), (_LAN_ADDRESS, f"{lan_address}\n"),
                           (_PREDEFINED, ""), (_ADDED, ""), (_CALLS, "")):
            file.write_text(text)
        _install("getip.sh", _GET_IP)
        _install("tavik_helper.sh", _HELPER)
        nft.change(network.DEVICE, _RULES)
        threading.Thread(target=self._watch, daemon=True).start()

    def predefine(self, first: int, last: int, internal_port: int, owner: str = "BRENVIK",
                  lan_address: str | None = None) -> None:
        """Add pre-defined TCP forwards, which the scripts cannot remove.

        They lead to the device itself unless `lan_address` is given; owner OTHER is another LAN
        device.
        """
        address = lan_address or self._lan_address
        ports = str(first) if first == last else f"{first}-{last}"
        elements = ", ".join(f"{port} : {address} . {internal_port}"
                             for port in range(first, last + 1))
        nft.change(network.DEVICE, f"create element inet router TCP {{ {elements} }}\n")
        with _PREDEFINED.open("a") as file:
            file.write(f"{owner},TCP,{ports},{address},{internal_port},pre-defined\n")

    def go_offline(self) -> None:
        """Report no internet address from now on."""
        _WAN_ADDRESS.write_text("\n")
        self._timeline.add("router", "has no internet address")

    def go_online(self) -> None:
        """Report the internet address again."""
        _WAN_ADDRESS.write_text(f"{self._wan_address}\n")
        self._timeline.add("router", f"has the internet address {self._wan_address}")

    def entries(self) -> list[str]:
        """The lines that the router lists."""
        return (_PREDEFINED.read_text() + _ADDED.read_text()).splitlines()

    def mappings(self) -> list[Mapping]:
        """The forwards in force, read from the packet filter."""
        found: list[Mapping] = []
        for protocol in ("TCP", "UDP"):
            listed = nft.listed(network.DEVICE, "map", "inet", "router", protocol)
            held = next(entry["map"] for entry in listed if "map" in entry)
            found += [_mapping(protocol, element) for element in held.get("elem", [])]
        return sorted(found)

    def calls(self) -> list[str]:
        """The script calls with their arguments, in order."""
        return _CALLS.read_text().splitlines()

    def _watch(self) -> None:
        """Record every change of the forwards in the timeline, whoever made it."""
        words = {"add": "forwards", "create": "forwards", "delete": "no longer forwards"}
        for verb, subject in nft.monitor(network.DEVICE, "elements"):
            changed = subject.get("element", {})
            if verb in words and changed.get("table") == "router":
                for element in changed["elem"]["set"]:
                    mapping = _mapping(changed["name"], element)
                    self._timeline.add("router", f"{words[verb]} {mapping}")


def _mapping(protocol: str, element: list[Any]) -> Mapping:
    """Read one element of a map; the filter gives it as [port, {"concat": [address, port]}]."""
    external_port, target = element
    return Mapping(protocol, external_port, *target["concat"])


def _install(name: str, script: str) -> None:
    """Put a script into the device's /etc/scripts."""
    network.host_file(network.DEVICE, f"scripts/{name}", script)
    Path("/etc/netns", network.DEVICE, "scripts", name).chmod(0o755)
