"""Hosts as network namespaces, the cables between them, and means to act inside a host."""

from __future__ import annotations

import ctypes
import os
import subprocess
from collections.abc import Iterator
from contextlib import contextmanager
from pathlib import Path

from lab.support import run_tool

_CLONE_NEWNET = 0x40000000
_libc = ctypes.CDLL(None, use_errno=True)

DEVICE, NEIGHBOUR, GATEWAY, INTERNET = "device", "neighbour", "gateway", "internet"
DEVICE_ADDRESS, NEIGHBOUR_ADDRESS = "192.168.77.10", "192.168.77.20"
GATEWAY_LAN_ADDRESS = "192.168.77.1"
GATEWAY_WAN_ADDRESS, SERVICE_ADDRESS, RELAY_ADDRESS = "44.128.0.20", "44.128.0.1", "44.128.0.2"

# Switches that forward from the start. A fixed hardware address keeps the hosts' ARP tables valid
# when a cable is plugged in or pulled out.
_SWITCH = "link add {} address {} type bridge stp_state 0 forward_delay 0 mcast_snooping 0"
_SWITCHES = {
    GATEWAY: (_SWITCH.format("lan", "02:00:00:00:77:01"),
              f"address add {GATEWAY_LAN_ADDRESS}/24 dev lan", "link set lan up"),
    INTERNET: (_SWITCH.format("net", "02:00:00:00:80:01"),
               f"address add {SERVICE_ADDRESS}/24 dev net",
               f"address add {RELAY_ADDRESS}/24 dev net", "link set net up"),
}


def ip(*arguments: str) -> None:
    """Run one `ip` command that must succeed."""
    run_tool("ip", *arguments)


def ip_batch(*commands: str, host: str | None = None) -> None:
    """Run `ip` commands that must succeed, on a host if one is named."""
    run_tool("ip", *(("-n", host) if host else ()), "-batch", "-", text="\n".join(commands) + "\n")


def command(host: str, *argv: str) -> list[str]:
    """The command line that runs `argv` on a host, under the host's own /etc."""
    return ["ip", "netns", "exec", host, *argv]


def output(host: str, *argv: str) -> str:
    """What a command prints on a host; empty when it fails."""
    return subprocess.run(command(host, *argv), capture_output=True, text=True,
                          check=False).stdout


@contextmanager
def inside(host: str) -> Iterator[None]:
    """Move the calling thread to a host: sockets and threads created meanwhile belong to it."""
    here = os.open(f"/proc/self/task/{_libc.gettid()}/ns/net", os.O_RDONLY)
    there = os.open(f"/run/netns/{host}", os.O_RDONLY)
    try:
        _set_namespace(there)
        yield
    finally:
        _set_namespace(here)
        os.close(here)
        os.close(there)


def raise_home_network(own_router: bool = False) -> None:
    """Create the hosts at home, the gateway and the internet, with addresses and default routes.

    With `own_router` the device routes its home: it has the gateway's internet address, and the
    LAN on its other side. The gateway exists, but its internet cable is unplugged.
    """
    hosts = (DEVICE, NEIGHBOUR, GATEWAY, INTERNET)
    ip_batch(*(f"netns add {host}" for host in hosts))
    for host in hosts:
        ip_batch("link set lo up", *_SWITCHES.get(host, ()), host=host)
    lan_port = "lan" if own_router else "eth0"
    plug(DEVICE, lan_port, GATEWAY, "lan")
    plug(NEIGHBOUR, "eth0", GATEWAY, "lan")
    plug(GATEWAY, "wan", INTERNET, "net")
    ip_batch(f"address add {DEVICE_ADDRESS}/24 dev {lan_port}", host=DEVICE)
    if own_router:
        ip_batch(f"link set {cable_end(GATEWAY, 'wan')} down", host=INTERNET)
        plug(DEVICE, "wan", INTERNET, "net")
        ip_batch(f"address add {GATEWAY_WAN_ADDRESS}/24 dev wan",
                 f"route add default via {SERVICE_ADDRESS}", host=DEVICE)
    else:
        ip_batch(f"route add default via {GATEWAY_LAN_ADDRESS}", host=DEVICE)
    ip_batch(f"address add {NEIGHBOUR_ADDRESS}/24 dev eth0",
             f"route add default via {GATEWAY_LAN_ADDRESS}", host=NEIGHBOUR)
    ip_batch(f"address add {GATEWAY_WAN_ADDRESS}/24 dev wan",
             f"route add default via {SERVICE_ADDRESS}", host=GATEWAY)


def plug(host: str, port: str, switch_host: str, switch: str) -> None:
    """Connect a new port of a host to a switch on another host."""
    end = cable_end(host, port)
    ip_batch(f"link add {port} netns {host} type veth peer name {end} netns {switch_host}")
    ip_batch(f"link set {end} master {switch} up", host=switch_host)
    ip_batch(f"link set {port} up", host=host)


def pretend_computer(host: str, switch: str, address: str) -> None:
    """Have a host answer at an address as if another computer, with a port of its own, did."""
    port = f"as-{address.rpartition('.')[2]}"
    plug(host, port, host, switch)
    ip_batch(f"address add {address}/32 dev {port}", host=host)
    with inside(host):
        for name, value in (("arp_ignore", "1"), ("arp_announce", "2")):
            Path("/proc/sys/net/ipv4/conf/all", name).write_text(value)


def enable_forwarding(host: str) -> None:
    """Make a host pass packets on between its networks."""
    with inside(host):
        Path("/proc/sys/net/ipv4/ip_forward").write_text("1")


def cable_end(host: str, port: str) -> str:
    """The name of a cable's end at the switch."""
    return f"{host}-{port}"


def host_file(host: str, name: str, text: str) -> None:
    """Give a host a file of its own under /etc."""
    path = Path("/etc/netns", host, name)
    path.parent.mkdir(parents=True, exist_ok=True)
    path.write_text(text)


def _set_namespace(descriptor: int) -> None:
    if _libc.setns(descriptor, _CLONE_NEWNET) != 0:
        raise OSError(ctypes.get_errno(), "setns")
