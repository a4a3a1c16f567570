"""The relay: an openvpn server that admits the device by its credentials."""

from __future__ import annotations

import socket
from pathlib import Path

from lab import network
from lab.account import Account
from lab.certificates import Authority
from lab.server import Server

TUNNEL_DEVICE = Path("/dev/net/tun")

_NAME = "relay.kavra.example"
# Both ends notice within seconds when the other is gone.
_SERVER = """
local {address}
port 1194
proto udp
dev tun
topology subnet
server 10.77.0.0 255.255.255.0
ca {authority}
cert {certificate}
key {key}
dh none
verify-client-cert none
script-security 2
auth-user-pass-verify {folder}/check via-file
username-as-common-name
keepalive 1 5
tmp-dir {folder}
management {folder}/management unix
verb 3
"""
# openvpn passes a file of two lines, user name and password.
_CHECK = """#!/bin/sh
exec cmp -s "$1" {folder}/credentials
"""
_READY = "Initialization Sequence Completed"
_LET_IN = "MULTI_sva: pool returned"
CLIENT = f"""client
dev tun
proto udp
nobind
config relay_servers.conf
ca authority.crt
verify-x509-name {_NAME} name
remote-cert-tls server
auth-user-pass auth.txt
auth-nocache
auth-retry none
verb 3
"""
OFFER = f"remote {network.RELAY_ADDRESS} 1194\n"


class Relay:
    """The openvpn server on the internet side."""

    def __init__(self, folder: Path, account: Account, authority: Authority) -> None:
        self._folder = folder
        self._account = account
        self._authority = authority
        self.server = Server("openvpn relay", network.INTERNET,
                             ["openvpn", "--config", str(folder / "server.conf")], folder / "log")

    def start(self) -> None:
        """Start the server and wait until its tunnel is up and its management console answers."""
        if not self._folder.exists():
            self._write_files()
        before = self._logged(_READY)
        self.server.start(lambda: self._logged(_READY) > before and self._status())

    def connections(self) -> int:
        """How many logins the server has accepted since its first start."""
        return self._logged(_LET_IN)

    def _write_files(self) -> None:
        self._folder.mkdir(parents=True)
        identity = self._authority.sign(_NAME)
        (self._folder / "server.conf").write_text(_SERVER.format(
            address=network.RELAY_ADDRESS, folder=self._folder, key=identity.key,
            certificate=identity.certificate, authority=self._authority.certificate))
        (self._folder / "credentials").write_text(
            f"{self._account.device_id}\n{self._account.auth}\n")
        check = self._folder / "check"
        check.write_text(_CHECK.format(folder=self._folder))
        check.chmod(0o755)

    def _logged(self, words: str) -> int:
        """How often the server's log contains these words."""
        log = self.server.log
        return log.read_text(errors="replace").count(words) if log.exists() else 0

    def client_address(self) -> str:
        """The connected device's address inside the tunnel; empty when it is not connected."""
        for line in self._status().splitlines():
            fields = line.split(",")
            if fields[0] == "CLIENT_LIST" and fields[1] == self._account.device_id:
                return fields[3]
        return ""

    def _status(self) -> str:
        """What the management console reports about clients; empty when it does not answer."""
        console = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        with console:
            console.settimeout(2)
            try:
                console.connect(str(self._folder / "management"))
                console.sendall(b"status 2\n")
                with console.makefile() as answer:
                    return "".join(iter(answer.readline, "END\n"))
            except OSError:
                return ""
