"""The storage device around the daemon: configuration, web server, local back end, disk."""

from __future__ import annotations

import itertools
import os
import threading
import time
from collections.abc import Mapping
from pathlib import Path

from lab import network, web
from lab.account import SERVICE_HOST, Account
from lab.central import IDENTITY_PATH
from lab.certificates import Authority
from lab.messages import Messages
from lab.relay import CLIENT, OFFER
from lab.timeline import Timeline
from lab.web import Reply, Request, WebServer

HOME = Path("/run/device")
STATIC_FILE = HOME / "globalconfig.ini"
DYNAMIC_FILE = HOME / "config/dynamicconfig.ini"
DYNAMIC_COPY = Path("/run/pelorus/dynamicconfig.ini")
SLEEP_COUNT = Path("/tmp/minutes_since_disk_access")
PATH = f"{HOME}/bin:/usr/sbin:/usr/bin:/sbin:/bin"

_LAN_PORT = "eth0"
_TUNNEL = HOME / "openvpn"
_DRIVE_STATE = HOME / "drive_state"
# Modification times for the files the lab writes: a month ago, unlike those of any other writer.
_SECONDS = itertools.count(int(time.time()) - 30 * 24 * 3600)
_HDPARM = f"#!/bin/sh\necho\necho /dev/sda:\necho \" drive state is:  $(cat {_DRIVE_STATE})\"\n"

# The relay runs in real time, so the tunnel client must too, however fast the device's clock is.
_STATIC = {
    "DYNAMIC_CONFIG": str(DYNAMIC_FILE.parent),
    "DYNAMIC_CONFIG_TMP": str(DYNAMIC_COPY),
    "STATIC_ONLY_KEYS": "DYNAMIC_CONFIG DYNAMIC_CONFIG_TMP SERVER_BASE_URL STARTCMD",
    "DEVICETYPE": "1",
    "ENABLEREMOTEACCESS": "1",
    "SERVER_BASE_URL": f"https://{SERVICE_HOST}",
    "REMOTE_TESTPORTURL":
        "/api/1.0/rest/port_test/%s?external_ip=%s&port=%d&protocol=%s&auth=%s",
    "REMOTE_SETFORWARDURL": "/api/1.0/rest/port_forward/%s?external_ip=%s&local_ip=%s"
                            "&http_port=%d&https_port=%d&auth=%s",
    "REMOTE_SETCOMMSTATUSURL": "/api/1.0/rest/comm_status/%s?auth=%s&local_ip=%s",
    "LOCAL_SETFORWARDURL": "http://127.0.0.1:%d/local/port_forward?external_ip=%s&http_port=%d"
                           "&https_port=%d&local_ip=%s&internal_port=%d",
    "LOCAL_DELFORWARDURL": "http://127.0.0.1:%d/local/port_forward_delete?internal_port=%d",
    "LOCAL_SETCOMMSTATUSURL": "http://127.0.0.1:%d/local/comm_status?status=%s",
    "LOCAL_SETLOCALIPURL": "http://127.0.0.1:%d/local/local_ip?address=%s",
    "OPENVPN_CONFIG_PATH": str(_TUNNEL),
    "OPENVPN_AUTH_FILE": str(_TUNNEL / "auth.txt"),
    "OPENVPN_PID_FILE": str(_TUNNEL / "openvpn.pid"),
    "UPDATE_CONF_WITH_SERVER_CMD": "cp relay_servers.offered relay_servers.conf",
    "STARTCMD": "env -u LD_PRELOAD openvpn --config client.conf --writepid openvpn.pid"
                " > openvpn.out 2>&1 &",
    "STARTCMD_OUTFILE": str(_TUNNEL / "openvpn.out"),
    "LOG_SUCCESS_TEXT": "Initialization Sequence Completed",
}


class Device:
    """The machine the daemon runs on, and the pages that it serves."""

    def __init__(self, account: Account, authority: Authority, timeline: Timeline) -> None:
        self.messages = Messages(HOME / "messages")
        self.local_requests: list[Request] = []
        self._servers: list[WebServer] = []
        self._account = account
        self._authority = authority
        self._timeline = timeline
        self._lock = threading.Lock()
        self._pause = 0.0

    def start(self, static: Mapping[str, str], dynamic: Mapping[str, str]) -> None:
        """Write the configuration (the arguments override the defaults) and serve pages."""
        self._write_system_files()
        self._write_tunnel_files()
        _write_settings(STATIC_FILE, {**_STATIC, **static})
        _write_settings(DYNAMIC_FILE, {
            "DEVICEID": self._account.device_id, "DEVICEAUTH": self._account.auth,
            "SUBDOMAIN": self._account.subdomain, "COMMUNICATION_STATUS": "disabled",
            "INTERNAL_HTTP_PORT": "80", "INTERNAL_HTTPS_PORT": "443", **dynamic})
        self.serve_on(int(self.setting("INTERNAL_HTTP_PORT")),
                      int(self.setting("INTERNAL_HTTPS_PORT")))

    def serve_on(self, http_port: int, https_port: int) -> None:
        """Serve on these two ports only, with a self-signed certificate.

        The configuration is left to the caller.
        """
        for server in self._servers:
            server.close()
        own = Authority(HOME / "ssl", self._account.host_name).sign(self._account.host_name)
        self._servers = [
            WebServer(network.DEVICE, "0.0.0.0", http_port, self._answer),
            WebServer(network.DEVICE, "0.0.0.0", https_port, self._answer, own)]
        for server in self._servers:
            web.expect_answer(f"device ({server.scheme})", network.DEVICE,
                              f"{server.scheme}://127.0.0.1:{server.server_port}/")

    @property
    def status(self) -> str:
        """The communication status in the device's dynamic configuration."""
        return self.setting("COMMUNICATION_STATUS")

    def setting(self, key: str) -> str:
        """A value of the dynamic configuration, empty when absent."""
        return _read_settings(DYNAMIC_FILE).get(key, "")

    def change(self, **settings: str) -> None:
        """Write settings as other programs on the device do: to both files, each in one step."""
        self._change(**settings)
        changes = ", ".join(f"{key}={value}" for key, value in settings.items())
        self._timeline.add("device", f"settings changed: {changes}")

    def move_to(self, address: str) -> None:
        """Get a new LAN address, as from a DHCP server that forgot the old one."""
        network.ip("-n", network.DEVICE, "-4", "address", "flush", "dev", _LAN_PORT)
        network.ip("-n", network.DEVICE, "address", "add", f"{address}/24", "dev", _LAN_PORT)
        network.ip("-n", network.DEVICE, "route", "add", "default", "via",
                   network.GATEWAY_LAN_ADDRESS)
        self._timeline.add("device", f"now has the LAN address {address}")

    def disk_sleeps(self) -> None:
        """Put the disk into standby."""
        _DRIVE_STATE.write_text("standby")
        self._timeline.add("device", "the disk goes to sleep")

    def disk_wakes(self) -> None:
        """Spin the disk up again."""
        _DRIVE_STATE.write_text("active/idle")
        self._timeline.add("device", "the disk wakes up")

    def minutes_since_disk_access(self, count: int) -> None:
        """Set how long the disk has been unused, as the device's own watcher counts it."""
        SLEEP_COUNT.write_text(f"{count}\n")
        unit = "minute" if count == 1 else "minutes"
        self._timeline.add("device", f"the disk has been unused for {count} {unit}")

    def answer_slowly(self, pause: float) -> None:
        """Let each byte of the local back end's answers take `pause` seconds from now on."""
        self._pause = pause
        self._timeline.add("device", f"the back end sends a byte in {pause:g} s")

    def keep_silent(self, silent: bool = True) -> None:
        """Accept connections to the web server, and with it the back end, and say nothing."""
        for server in self._servers:
            server.silent = silent
        self._timeline.add("device", f"the web server {'hangs' if silent else 'answers again'}")

    def limit_lookups(self, seconds: int = 0) -> None:
        """Give up a name lookup after this real time; by default the C library decides."""
        options = f"options timeout:{seconds} attempts:1\n" if seconds else ""
        network.host_file(network.DEVICE, "resolv.conf",
                          f"nameserver {network.SERVICE_ADDRESS}\n{options}")

    def statuses_sent(self) -> list[str]:
        """The status words sent to the local back end, in order."""
        return [request.argument("status") for request in self.local_requests
                if request.path == "/local/comm_status"]

    def tunnel_output(self) -> Path:
        """The tunnel client's own output."""
        return _TUNNEL / "openvpn.out"

    def _change(self, **settings: str) -> None:
        with self._lock:
            # The file that `setting` reads comes last: what it shows is then in both.
            for path in (DYNAMIC_COPY, DYNAMIC_FILE):
                if path.exists():
                    _write_settings(path, {**_read_settings(path), **settings})

    def _write_system_files(self) -> None:
        (HOME / "bin").mkdir(parents=True)
        DYNAMIC_FILE.parent.mkdir()
        DYNAMIC_COPY.parent.mkdir(0o770)
        hdparm = HOME / "bin/hdparm"
        hdparm.write_text(_HDPARM)
        hdparm.chmod(0o755)
        _DRIVE_STATE.write_text("active/idle")
        SLEEP_COUNT.write_text("0\n")
        self.limit_lookups()
        network.host_file(network.DEVICE, "ssl/certs/ca-certificates.crt",
                          self._authority.certificate.read_text())

    def _write_tunnel_files(self) -> None:
        _TUNNEL.mkdir()
        (_TUNNEL / "client.conf").write_text(CLIENT)
        (_TUNNEL / "authority.crt").write_text(self._authority.certificate.read_text())
        (_TUNNEL / "relay_servers.offered").write_text(OFFER)

    def _answer(self, request: Request) -> Reply:
        if request.path == IDENTITY_PATH:
            return Reply(f"<device_id>{self._account.device_id}</device_id>".encode())
        if not request.path.startswith("/local/"):
            return Reply(f"welcome to {self._account.host_name}, over {request.scheme}".encode())
        if request.peer != "127.0.0.1":
            return Reply(b"forbidden", 403)
        return self._local_back_end(request)

    def _local_back_end(self, request: Request) -> Reply:
        """Store what the daemon reports in the device's configuration."""
        with self._lock:
            self.local_requests.append(request)
        operation = request.path.removeprefix("/local/")
        if operation == "comm_status":
            self._change(COMMUNICATION_STATUS=request.argument("status"))
            self._timeline.add("device", f"status: {request.argument('status')}")
        elif operation == "port_forward":
            self._change(EXTERNAL_IP=request.argument("external_ip"),
                         EXTERNAL_HTTP_PORT=request.argument("http_port"),
                         EXTERNAL_HTTPS_PORT=request.argument("https_port"),
                         LOCAL_IP=request.argument("local_ip"))
        elif operation == "port_forward_delete":
            self._change(EXTERNAL_IP="", EXTERNAL_HTTP_PORT="0", EXTERNAL_HTTPS_PORT="0")
        elif operation == "local_ip":
            self._change(LOCAL_IP=request.argument("address"))
        else:
            return Reply(b"<result>failure</result>", 404)
        return Reply(b"<result>success</result>", pause=self._pause)


def _read_settings(path: Path) -> dict[str, str]:
    lines = path.read_text(errors="surrogateescape").splitlines()
    return dict(line.split("=", 1) for line in lines if "=" in line)


def _write_settings(path: Path, settings: Mapping[str, str]) -> None:
    """Replace the file in one step, so that the daemon never reads half of it.

    The daemon detects a change by the modification time in whole seconds, so each change gets its
    own second.
    """
    new = path.with_suffix(".new")
    new.write_text("".join(f"{key}={value}\n" for key, value in settings.items()),
                   errors="surrogateescape")
    new.chmod(0o666)
    second = next(_SECONDS)
    os.utime(new, (second, second))
    new.replace(path)
