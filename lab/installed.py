"""The Debian package's life on a device: installed, set up, upgraded, removed and purged.

The device is a whole Debian system that is booted by systemd, so that the package's scripts, the
unit and its restrictions are at work. Its home network and the internet are the lab's. With another
processor's programs, under qemu, systemd does not run: there the package is installed, set up,
started as an init script would, stopped and purged.
"""

from __future__ import annotations

import argparse
import json
import os
import re
import shutil
import signal
import subprocess
import sys
import time
import traceback
from pathlib import Path

from lab import sandbox
from lab.booted import ROOT, Booted, Chrooted, System
from lab.checks import BOTH_MAPPED, RELAYED, SILENT, assert_published, wait_for_log
from lab.clock import fast_pauses
from lab.device import DYNAMIC_COPY, DYNAMIC_FILE, HOME
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.support import LabError, run_tool, wait_until
from lab.timeline import Timeline

UNIT = "pelorus.service"
_PATIENCE = 90
_STATIC = ROOT / "etc/pelorus/globalconfig.ini"
_OPTIONS = ROOT / "etc/default/pelorus"
_SETTINGS = ROOT / "var/lib/pelorus/dynamicconfig.ini"
_COPY = ROOT / "run/pelorus/dynamicconfig.ini"
_PID_FILE = ROOT / "tmp/tavik_cm_pid"
_TUNNEL = ROOT / "etc/openvpn/pelorus"
_OLD_SETTINGS = ROOT / "var/www/rest-api/config"
_RELEASED_OPTIONS = """\
# Options of the pelorus service, see pelorus(8).
PELORUS_OPTIONS="-l 5"

# Static configuration file, if it is not /var/www/rest-api/config/globalconfig.ini.
#TAVIK_STATIC_CONFIG=/etc/pelorus/globalconfig.ini
"""
_MODES = {
    "etc/pelorus": (0o755, "root"), "etc/pelorus/globalconfig.ini": (0o644, "root"),
    "etc/default/pelorus": (0o644, "root"), "run/pelorus-relay": (0o700, "root"),
    "var/lib/pelorus": (0o770, "www-data"), "run/pelorus": (0o770, "www-data"),
    "usr/share/doc/pelorus/doctor.md": (0o644, "root")}
_AS = {name: ("setpriv", "--reuid", number, "--regid", number, "--clear-groups")
       for name, number in (("nobody", "65534"), ("www-data", "33"))}
# What changes by itself, whatever is installed.
_VOLATILE = ("var/log", "var/cache", "var/lib/dpkg", "var/lib/apt", "var/lib/systemd", "proc",
             "sys", "dev", "run/systemd", "run/log", "run/lab", "run/lock", "tmp/systemd-private",
             "etc/ld.so.cache", "run/initctl", "run/utmp")


class Package:
    """A package on a device: what a booted and an emulated one have in common."""

    def __init__(self, lab: Lab, system: System, package: Path) -> None:
        self._lab = lab
        self._system = system
        self._package = package
        self._before: set[str] = set()

    def play(self, stay: bool) -> None:
        """Go through the package's life; with `stay` wait for Ctrl-C after the installation."""
        raise NotImplementedError

    def _prepare(self) -> None:
        """Start a device that trusts the lab's service; the lab's back end writes its settings."""
        authority = ROOT / "usr/local/share/ca-certificates/lab.crt"
        authority.write_text(Path("/etc/netns/device/ssl/certs/ca-certificates.crt").read_text())
        shutil.copy(HOME / "bin/hdparm", ROOT / "usr/local/sbin")
        self._system.start()
        self._system.run("update-ca-certificates")
        (ROOT / "run/device").mkdir()
        shutil.copy(HOME / "drive_state", ROOT / "run/device")
        (ROOT / "tmp/minutes_since_disk_access").write_text("0\n")
        for folder, own in ((DYNAMIC_COPY.parent, _COPY.parent),
                            (DYNAMIC_FILE.parent, _SETTINGS.parent)):
            shutil.rmtree(folder)
            folder.symlink_to(own)
        self._before = _listing()

    def _has_its_files(self) -> None:
        for path, (mode, group) in _MODES.items():
            found = (ROOT / path).stat()
            wanted = (mode, 0, {"root": 0, "www-data": 33}[group])
            assert (found.st_mode & 0o7777, found.st_uid, found.st_gid) == wanted, path

    def _has_asked_nothing(self) -> None:
        assert not self._lab.central.requests, self._lab.central.state()
        assert not self._lab.gateway.mappings()

    def _has_cleaned_up(self) -> None:
        assert not self._lab.gateway.mappings(), self._lab.gateway.mappings()
        assert self._lab.central.record is None
        assert self._lab.device.status == "disabled"

    def _has_left_nothing(self) -> None:
        left = _listing() - self._before
        assert not left, sorted(left)

    def _install(self, package: Path, word: str) -> None:
        shutil.copy(package, ROOT / "root")
        self._run_documented(word)
        (ROOT / "root" / package.name).unlink()

    def _run_documented(self, word: str) -> None:
        """Run the commands in docs/install.md that contain a word, in root's folder."""
        text = (sandbox.PROJECT / "docs/install.md").read_text()
        [commands] = [block for block in re.findall(r"^```sh$(.*?)^```$", text, re.M | re.S)
                      if word in block]
        self._system.run("sh", "-euc", f"cd /root{commands}")

    def _wait_for_status(self, status: str) -> None:
        self._lab.wait_for(lambda: self._lab.device.status == status, f"status {status}", _PATIENCE)

    def _look_around(self) -> None:
        account = self._lab.account
        print(f"""
The package is installed on the device and idles. Its credentials would be
  DEVICEID={account.device_id}
  DEVICEAUTH={account.auth}
The lab stays up until Ctrl-C. From another terminal, as root:
  a shell on the device   nsenter -a -t {sandbox.pid_outside()} {' '.join(
            self._system.enter('bash'))}""", flush=True)
        while True:
            time.sleep(1)


class Installed(Package):
    """The package on a device that systemd boots."""

    _system: Booted

    def play(self, stay: bool) -> None:
        self._prepare()
        self._installs_and_idles()
        self._gives_local_users_nothing()
        if stay:
            return self._look_around()
        self._picks_up_credentials()
        self._ignores_a_planted_command()
        self._says_why_it_does_not_start()
        self._relays()
        self._restarts_after_a_crash()
        self._upgrades()
        self._removes()
        self._purges()
        self._upgrades_an_older_device()
        self._purges()

    def _prepare(self) -> None:
        self._speed_up()
        super()._prepare()
        self._system.follow(UNIT, self._lab.timeline)

    def _speed_up(self) -> None:
        """Let the unit's time run as fast as the situation says; restart it soon after a crash."""
        settings = fast_pauses(self._lab.situation.clock, False)
        libraries = [word for text in settings if text.startswith("LD_PRELOAD=")
                     for word in text.split("=", 1)[1].split()]
        for library in libraries:
            place = ROOT / library.lstrip("/")
            place.parent.mkdir(parents=True, exist_ok=True)
            shutil.copy(library, place)
        folder = ROOT / f"etc/systemd/system/{UNIT}.d"
        folder.mkdir()
        (folder / "lab.conf").write_text("[Service]\nRestartSec=1\n" + "".join(
            f'Environment="{text}"\n' for text in settings))

    def _installs_and_idles(self) -> None:
        self._lab.step("the package is installed and left as it is")
        self._run_as("nobody", "ln -s /etc/passwd /tmp/tavik_cm_pid")
        self._install(self._package, "install -y ./")
        self._has_its_files()
        assert self._system.run("systemctl", "is-enabled", UNIT).strip() == "enabled"
        self._wait_for_log("Deviceid and DeviceAuth is empty. Idle Process.")
        self._has_asked_nothing()
        assert not _PID_FILE.is_symlink()
        restrictions = self._system.run("cat", f"/proc/{self._main()}/status")
        assert "NoNewPrivs:\t1\nSeccomp:\t2\n" in restrictions, restrictions
        self._doctor_names("credentials-missing")

    def _gives_local_users_nothing(self) -> None:
        self._lab.step("a local user looks for something to gain")
        for path in _MODES:
            assert not self._may("nobody", "-w", path), path
        for file in (_SETTINGS, _COPY, ROOT / "run/pelorus-relay"):
            assert not self._may("nobody", "-r", str(file.relative_to(ROOT))), file
        for path in ("etc/pelorus", "etc/pelorus/globalconfig.ini", "run/pelorus-relay"):
            assert not self._may("www-data", "-w", path), path
        assert self._may("www-data", "-w", "run/pelorus/dynamicconfig.ini")

    def _picks_up_credentials(self) -> None:
        self._lab.step("the credentials are filled in")
        self._run_documented("DEVICEID")
        self._wait_for_status("portforwarded")
        assert_published(self._lab)
        self._doctor_names("")
        before = self._main()
        for command in ("systemctl status", "--since", "ReadWritePaths"):
            assert self._main() == before, command
            self._run_documented(command)
        self._wait_for_status("portforwarded")

    def _ignores_a_planted_command(self) -> None:
        self._lab.step("the web back end sets a command")
        self._run_as("www-data", "umask 007; cd /run/pelorus; cp dynamicconfig.ini new;"
                     " echo STARTCMD=touch /tmp/gained >>new; mv new dynamicconfig.ini")
        self._wait_for_log("only the static config file may set STARTCMD")

    def _says_why_it_does_not_start(self) -> None:
        self._lab.step("an unknown option is given")
        good = _OPTIONS.read_text()
        _OPTIONS.write_text(good.replace('"-l 6"', '"-h"'))
        assert self._system.attempt("systemctl", "restart", UNIT).returncode != 0
        assert not self._lab.gateway.mappings()
        self._wait_for_log("Invalid argument: -h")
        self._wait_for_log("NOTES in pelorus(8)")
        _OPTIONS.write_text(good)
        self._system.run("systemctl", "restart", UNIT)
        self._wait_for_status("portforwarded")

    def _relays(self) -> None:
        self._lab.step("the gateway falls silent; the tunnel's client runs as another user")
        _set_up_tunnel()
        # The relay is in real time, and so must be its client.
        _STATIC.write_text(_STATIC.read_text().replace("STARTCMD=", "STARTCMD=env -u LD_PRELOAD "))
        self._lab.gateway.become(SILENT)
        self._system.run("systemctl", "restart", UNIT)
        self._wait_for_status("relayed")
        assert self._lab.relay.client_address()
        [client] = self._system.running("openvpn")
        assert Path(f"/proc/{client}").stat().st_uid == 65534
        assert not self._may("nobody", "-r", "etc/openvpn/pelorus/auth.txt")
        self._system.run("systemctl", "restart", UNIT)
        self._wait_for_status("relayed")
        assert client not in self._system.running("openvpn")
        assert any("attempting to stop process" in line for line in self._system.log)
        assert not any("failed to stop openVPN" in line for line in self._system.log)

    def _restarts_after_a_crash(self) -> None:
        self._lab.step("the daemon is killed: its tunnel goes, and it starts again")
        before, clients = self._main(), self._system.running("openvpn")
        self._lab.gateway.become(GatewaySetup())
        self._system.run("systemctl", "kill", "--kill-whom=main", "--signal=KILL", UNIT)
        wait_until(lambda: self._main() not in (0, before), "the restart", _PATIENCE)
        assert not set(clients) & set(self._system.running("openvpn"))
        self._wait_for_log("pelorus failed (signal")
        self._wait_for_status("portforwarded")
        assert not self._system.running("openvpn")

    def _upgrades(self) -> None:
        self._lab.step("a newer package with changed settings is installed over changed settings")
        before, own = self._main(), _STATIC.read_text()
        self._install(_newer(self._package), "--force-confold")
        assert self._main() not in (0, before)
        assert _STATIC.read_text() == own
        assert "Newer." in _STATIC.with_suffix(".ini.dpkg-dist").read_text()
        wait_until(lambda: self._lab.gateway.mappings() == BOTH_MAPPED, "both mappings", _PATIENCE)

    def _removes(self) -> None:
        self._lab.step("the package is removed")
        self._run_documented("apt-get remove")
        assert not self._system.running("pelorus", "pelorus (deleted)")
        self._has_cleaned_up()
        assert _STATIC.exists() and _SETTINGS.exists()

    def _purges(self) -> None:
        self._lab.step("the package is purged")
        self._run_documented("apt-get purge")
        (ROOT / f"etc/systemd/system/{UNIT}.d/local.conf").unlink(missing_ok=True)
        self._system.run("systemctl", "reset-failed")
        # Made by the test, but for the credentials.
        for folder in (_TUNNEL, ROOT / "var/www"):
            shutil.rmtree(folder, ignore_errors=True)
        self._has_left_nothing()

    def _upgrades_an_older_device(self) -> None:
        self._lab.step("a device set up with the first release is upgraded: it keeps its settings")
        self._install(_released(self._package), "install -y ./")
        self._set_up_older_settings()
        self._system.run("systemd-tmpfiles", "--create", "pelorus.conf")
        self._system.run("systemctl", "daemon-reload")
        self._system.run("systemctl", "enable", "--now", UNIT)
        self._wait_for_status("portforwarded")
        before = self._main()
        self._install(self._package, "install -y ./")
        assert self._main() not in (0, before)
        assert "-l 6" in _OPTIONS.read_text() and not _SETTINGS.samefile(DYNAMIC_FILE)
        self._lab.gateway.become(SILENT)
        self._system.run("systemctl", "restart", UNIT)
        self._wait_for_status("relayed")
        self._lab.gateway.become(GatewaySetup())
        DYNAMIC_FILE.parent.unlink()
        DYNAMIC_FILE.parent.symlink_to(_SETTINGS.parent)
        self._run_documented("DEVICEID")
        self._run_documented("earlier-settings")
        self._wait_for_status("portforwarded")
        for name in ("pid", "out"):
            (ROOT / f"run/pelorus-openvpn.{name}").unlink(missing_ok=True)

    def _set_up_older_settings(self) -> None:
        """Settings where the first release had them; the lab's back end writes there."""
        _OLD_SETTINGS.mkdir(parents=True)
        samples = ROOT / "usr/share/pelorus"
        text = (samples / "globalconfig.ini").read_text()
        for new, old in (("/var/lib/pelorus", "/var/www/rest-api/config"),
                         ("/run/pelorus-relay/openvpn", "/run/pelorus-openvpn"),
                         ("STARTCMD=", "STARTCMD=env -u LD_PRELOAD ")):
            text = text.replace(new, old)
        (_OLD_SETTINGS / "globalconfig.ini").write_text(text)
        account = self._lab.account
        dynamic = (samples / "dynamicconfig.ini").read_text().replace(
            "DEVICEID=", f"DEVICEID={account.device_id}").replace(
            "DEVICEAUTH=", f"DEVICEAUTH={account.auth}")
        (_OLD_SETTINGS / "dynamicconfig.ini").write_text(dynamic)
        DYNAMIC_FILE.parent.unlink()
        DYNAMIC_FILE.parent.symlink_to(_OLD_SETTINGS)
        _set_up_tunnel()

    def _doctor_names(self, cause: str) -> None:
        """The doctor finds the package's files and names this cause first, or none if empty."""
        told = self._system.attempt("pelorus-doctor", "--no-probes", "--json").stdout
        named = [entry["name"] for entry in json.loads(told)["causes"]]
        assert (named or [""])[0] == cause, told

    def _may(self, user: str, access: str, path: str) -> bool:
        return self._system.attempt(*_AS[user], "test", access, f"/{path}").returncode == 0

    def _run_as(self, user: str, commands: str) -> None:
        self._system.run(*_AS[user], "sh", "-euc", commands)

    def _main(self) -> int:
        return self._system.main_process(UNIT)

    def _wait_for_log(self, part: str) -> None:
        wait_until(lambda: any(part in line for line in self._system.log), f"[{part}]", _PATIENCE)


class Emulated(Package):
    """The package for another processor, whose programs run under qemu."""

    def play(self, stay: bool) -> None:
        self._prepare()
        self._lab.step("the package is installed and left as it is")
        self._install(self._package, "install -y ./")
        self._has_its_files()
        assert (ROOT / f"etc/systemd/system/multi-user.target.wants/{UNIT}").is_symlink()
        daemon = self._start()
        wait_for_log(self._lab, "Deviceid and DeviceAuth is empty. Idle Process.")
        self._has_asked_nothing()
        if stay:
            return self._look_around()
        _stop(daemon)
        self._lab.step("the credentials are filled in")
        self._run_documented("DEVICEID")
        daemon = self._start()
        self._wait_for_status("portforwarded")
        assert_published(self._lab)
        self._lab.step("the daemon is stopped, the package removed and purged")
        _stop(daemon)
        self._has_cleaned_up()
        self._run_documented("apt-get remove")
        assert _STATIC.exists() and _SETTINGS.exists()
        self._run_documented("apt-get purge")
        self._has_left_nothing()

    def _start(self) -> int:
        """Start the daemon as the unit does, and return its pid."""
        unit = (ROOT / f"lib/systemd/system/{UNIT}").read_text()
        assert "\nExecStart=/usr/sbin/pelorus $PELORUS_OPTIONS\n" in unit
        self._run_documented("/usr/sbin/pelorus $PELORUS_OPTIONS")
        return int(wait_until(_PID_FILE.read_text, "the pid", _PATIENCE))


def _listing() -> set[str]:
    """Every file of the device but those that change by themselves."""
    found = subprocess.run(["find", str(ROOT), "-mindepth", "1"], stdout=subprocess.PIPE,
                           text=True, check=True).stdout.splitlines()
    names = (name.removeprefix(f"{ROOT}/") for name in found)
    return {name for name in names if not name.startswith(_VOLATILE)}


def _stop(daemon: int) -> None:
    """End the daemon, which has become a child of the sandbox's first process: this one."""
    os.kill(daemon, signal.SIGTERM)
    wait_until(lambda: os.waitpid(daemon, os.WNOHANG)[0], "the daemon's end", _PATIENCE)


def _set_up_tunnel() -> None:
    shutil.copytree(HOME / "openvpn", _TUNNEL)
    with (_TUNNEL / "client.conf").open("a") as file:
        file.write("user nobody\ngroup nogroup\npersist-tun\n")
    fetch = _TUNNEL / "fetch_servers.sh"
    fetch.write_text("#!/bin/sh\ncp relay_servers.offered relay_servers.conf\n")
    fetch.chmod(0o755)


def _newer(package: Path) -> Path:
    """The same package with a higher version and other static settings."""
    folder, new = Path("/tmp/newer"), Path("/tmp/pelorus_newer.deb")
    run_tool("dpkg-deb", "-R", str(package), str(folder))
    control = folder / "DEBIAN/control"
    control.write_text("".join(
        f"{line}+newer\n" if line.startswith("Version:") else f"{line}\n"
        for line in control.read_text().splitlines()))
    with (folder / "etc/pelorus/globalconfig.ini").open("a") as file:
        file.write("\nNewer.\n")
    run_tool("dpkg-deb", "-b", "--root-owner-group", str(folder), str(new))
    return new


def _released(package: Path) -> Path:
    """The same daemon as 1.7.0-54 packed it: no scripts, no settings, another place of the unit."""
    folder, old = Path("/tmp/released"), Path("/tmp/pelorus_released.deb")
    run_tool("dpkg-deb", "-R", str(package), str(folder))
    control = folder / "DEBIAN/control"
    control.write_text(re.sub("^Version: .*", "Version: 1.7.0-54", control.read_text(),
                              flags=re.M))
    (folder / "DEBIAN/conffiles").write_text("/etc/default/pelorus\n")
    for name in ("preinst", "postinst", "prerm", "postrm", "md5sums"):
        (folder / "DEBIAN" / name).unlink()
    shutil.rmtree(folder / "etc/pelorus")
    (folder / "etc/default/pelorus").write_text(_RELEASED_OPTIONS)
    (folder / "usr/lib/tmpfiles.d/pelorus.conf").write_text("d /run/pelorus 0770 root www-data -\n")
    unit = folder / "lib/systemd/system/pelorus.service"
    earlier = unit.read_text().replace("ProtectSystem=strict", "ProtectSystem=full")
    place = folder / "usr" / unit.relative_to(folder)
    place.parent.mkdir(parents=True)
    place.write_text(earlier)
    shutil.rmtree(folder / "lib")
    run_tool("dpkg-deb", "-b", "--root-owner-group", str(folder), str(old))
    return old


def _obstacle(boots: bool) -> str:
    """Why this machine cannot have, or boot, a system inside the lab; empty when it can."""
    if os.geteuid() != 0:
        return "needs root: the device's files belong to several users"
    if boots and not _cgroup_folder():
        return "this machine has no cgroup2 file system that can be written"
    return sandbox.why_forbidden() or ""


def _cgroup_folder() -> Path | None:
    """Where a new control group can be made for the device's processes."""
    for line in Path("/proc/self/mounts").read_text().splitlines():
        _, folder, kind = line.split()[:3]
        if kind == "cgroup2" and os.access(folder, os.W_OK):
            return Path(folder)
    return None


def _outside(boots: bool) -> int:
    """Open a sandbox; for what boots, with a control group that is removed afterwards."""
    if reason := _obstacle(boots):
        print(f"test-deb: {reason}")
        return sandbox.FORBIDDEN
    if not boots:
        return _open_sandbox()
    parent = _cgroup_folder()
    assert parent
    group = parent / f"pelorus-lab-{os.getpid()}"
    for number in (signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, lambda received, _: sys.exit(128 + received))
    group.mkdir()
    try:
        return _open_sandbox("--cgroup", str(group))
    finally:
        wait_until(lambda: "populated 0" in (group / "cgroup.events").read_text(), "its end", 10)
        for folder, _, _ in os.walk(group, topdown=False):
            os.rmdir(folder)


def _open_sandbox(*more: str) -> int:
    status = sandbox.run("lab.installed", [*sys.argv[1:], *more], own_users=False).returncode
    return status if status >= 0 else 128 - status


def _play(package: Path, archive: Path, cgroup: Path | None, stay: bool) -> int:
    signal.signal(signal.SIGINT, signal.default_int_handler)
    timeline = Timeline()
    timeline.listen(lambda event: print(event, flush=True))
    lab = Lab(Situation(relay=True, clock=RELAYED if cgroup and not stay else 1), timeline)
    name = lab.account.host_name
    system = Booted(archive, cgroup, name) if cgroup else Chrooted(archive, name)
    try:
        (Installed if cgroup else Emulated)(lab, system, package).play(stay)
    except KeyboardInterrupt:
        print("\nthe lab has been removed")
    except (LabError, AssertionError):
        print("\n".join(["", "--- log of the unit", *system.log[-60:], "", lab.report()]))
        print(traceback.format_exc(limit=-3))
        return 1
    print("\nall checks passed")
    return 0


def main() -> int:
    """Outside a sandbox: open one. Inside: play."""
    parser = argparse.ArgumentParser(prog="packaging/test-deb", description=__doc__)
    parser.add_argument("package", type=Path)
    parser.add_argument("archive", type=Path, help="files of a Debian system")
    parser.add_argument("--stay", action="store_true",
                        help="install and keep the device up until Ctrl-C, to look around")
    parser.add_argument("--emulated", action="store_true",
                        help="the system is another processor's, as lab.foreign runs it")
    parser.add_argument("--cgroup", type=Path, help=argparse.SUPPRESS)
    arguments = parser.parse_args()
    if not sandbox.is_inside():
        return _outside(not arguments.emulated)
    return _play(arguments.package, arguments.archive, arguments.cgroup, arguments.stay)


if __name__ == "__main__":
    sys.exit(main())
