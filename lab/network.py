"""Hosts as network namespaces, the cables between them, and ways to act inside a host."""

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

DEVICE, GATEWAY, INTERNET = "device", "gateway", "internet"
DEVICE_ADDRESS, GATEWAY_LAN_ADDRESS = "192.168.77.10", "192.168.77.1"
GATEWAY_WAN_ADDRESS, SERVICE_ADDRESS, RELAY_ADDRESS = "44.128.0.20", "44.128.0.1", "44.128.0.2"


def ip(*arguments: str) -> None:
    """Run one `ip` command that must succeed."""
    run_tool("ip", *arguments)


def command(host: str, *argv: str) -> list[str]:
    """The command line that runs `argv` on a host, under the host's own /etc."""
    return ["ip", "netns", "exec", host, *argv]


def output(host: str, *argv: str) -> str:
    """What a command prints on a host; empty when it fails."""
    return subprocess.run(command(host, *argv), capture_output=True, text=True,
                          check=False).stdout


@contextmanager
def inside(host: str) -> Iterator[None]:
    """Let the calling thread live on a host: sockets and threads made here belong to it."""
    here = os.open(f"/proc/self/task/{_libc.gettid()}/ns/net", os.O_RDONLY)
    there = os.open(f"/run/netns/{host}", os.O_RDONLY)
    try:
        _set_namespace(there)
        yield
    finally:
        _set_namespace(here)
        os.close(here)
        os.close(there)


def raise_home_network() -> None:
    """Make the device, its gateway and the internet, with addresses and default routes."""
    for host in (DEVICE, GATEWAY, INTERNET):
        ip("netns", "add", host)
        ip("-n", host, "link", "set", "lo", "up")
    _cable((DEVICE, "eth0", f"{DEVICE_ADDRESS}/24"), (GATEWAY, "lan", f"{GATEWAY_LAN_ADDRESS}/24"))
    _cable((GATEWAY, "wan", f"{GATEWAY_WAN_ADDRESS}/24"),
           (INTERNET, "net", f"{SERVICE_ADDRESS}/24"))
    ip("-n", INTERNET, "address", "add", f"{RELAY_ADDRESS}/24", "dev", "net")
    ip("-n", DEVICE, "route", "add", "default", "via", GATEWAY_LAN_ADDRESS)
    ip("-n", GATEWAY, "route", "add", "default", "via", SERVICE_ADDRESS)


def host_file(host: str, name: str, text: str) -> None:
    """Give a host a file of its own under /etc."""
    path = Path("/etc/netns", host, name)
    path.parent.mkdir(parents=True, exist_ok=True)
    path.write_text(text)


def _cable(*ends: tuple[str, str, str]) -> None:
    (left, left_port, _), (right, right_port, _) = ends
    ip("link", "add", left_port, "netns", left, "type", "veth",
       "peer", "name", right_port, "netns", right)
    for host, port, address in ends:
        ip("-n", host, "address", "add", address, "dev", port)
        ip("-n", host, "link", "set", port, "up")


def _set_namespace(descriptor: int) -> None:
    if _libc.setns(descriptor, _CLONE_NEWNET) != 0:
        raise OSError(ctypes.get_errno(), "setns")
