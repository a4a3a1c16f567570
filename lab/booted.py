"""The device as a whole Debian system with files of its own.

systemd is its first process; with another processor's files nothing runs but what is called.
"""

from __future__ import annotations

import os
import subprocess
import tempfile
import threading
from pathlib import Path

from lab import daemon, messages, network
from lab.support import LabError, run_tool, wait_until
from lab.timeline import Timeline

ROOT = Path("/mnt/booted")

_JOIN = 'echo $$ > "$0/cgroup.procs"; exec "$@"'
# As container managers do it: /proc/sys and /sys, which belong to the machine, are read-only.
_BOOT = f"""
    cd {ROOT}
    mount -t proc proc proc
    mount --bind proc/sys proc/sys
    mount -o remount,bind,ro proc/sys
    mount -t sysfs -o ro sysfs sys
    mount -t cgroup2 cgroup2 sys/fs/cgroup
    mount -t tmpfs -o mode=755 dev dev
    mkdir dev/net dev/shm dev/pts
    for node in null zero full random urandom tty net/tun; do
        touch dev/$node
        mount --bind /dev/$node dev/$node
    done
    chmod 1777 dev/shm
    mount -t devpts -o newinstance,ptmxmode=0666 devpts dev/pts
    ln -s pts/ptmx dev/ptmx
    ln -s /proc/self/fd dev/fd
    pivot_root . mnt
    umount -l /mnt
    exec env -i container=lab PATH=/usr/sbin:/usr/bin:/sbin:/bin /lib/systemd/systemd \\
        --log-target=journal --show-status=no
"""


class System:
    """A system's files on the lab's device, and commands that run in them."""

    def __init__(self, archive: Path, host_name: str) -> None:
        """Unpack the system's files; `log` is the service's, where the system keeps it."""
        self.log: list[str] = []
        for folder in (ROOT, ROOT / "run"):
            folder.mkdir(exist_ok=True)
            run_tool("mount", "-t", "tmpfs", "-o", "mode=755", "lab-booted", str(folder))
            if folder == ROOT:
                run_tool("tar", "-x", "-C", str(ROOT), "-f", str(archive), "--exclude=./dev/*")
        (ROOT / "etc/hostname").write_text(f"{host_name}\n")
        (ROOT / "etc/hosts").write_text(f"127.0.0.1 localhost {host_name}\n")
        (ROOT / "etc/resolv.conf").write_text(f"nameserver {network.SERVICE_ADDRESS}\n")

    def start(self) -> None:
        """Get ready for commands."""
        raise NotImplementedError

    def enter(self, *argv: str) -> list[str]:
        """The command line that runs `argv` there, as root."""
        raise NotImplementedError

    def attempt(self, *argv: str) -> subprocess.CompletedProcess[str]:
        """Run a command there as root, without a terminal, and wait for its end.

        What it prints goes through a file: a daemon it starts would hold a pipe open.
        """
        with tempfile.TemporaryFile("w+") as output:
            done = subprocess.run(self.enter("env", "DEBIAN_FRONTEND=noninteractive", *argv),
                                  stdin=subprocess.DEVNULL, stdout=output,
                                  stderr=subprocess.STDOUT, text=True, check=False)
            output.seek(0)
            done.stdout = output.read()
        return done

    def run(self, *argv: str) -> str:
        """What a command prints there that must succeed."""
        done = self.attempt(*argv)
        if done.returncode != 0:
            raise LabError(f"{' '.join(argv)}: status {done.returncode}: {done.stdout}")
        return done.stdout


class Booted(System):
    """A system booted by systemd. It has a network of its own and ends with the sandbox."""

    def __init__(self, archive: Path, cgroup: Path, host_name: str) -> None:
        """Unpack the system's files; `start` boots it, with its processes below `cgroup`."""
        super().__init__(archive, host_name)
        self._cgroup = cgroup
        self._pid = 0

    def start(self) -> None:
        """Boot and wait until every service is up."""
        manager = subprocess.Popen(["sh", "-euc", _JOIN, str(self._cgroup), *network.command(
            network.DEVICE, "unshare", "--cgroup", "--pid", "--ipc", "--mount", "--fork",
            "--kill-child", "sh", "-euc", _BOOT)])
        self._pid = int(wait_until(lambda: _child_of(manager.pid), "the first process", 5))
        wait_until(lambda: (ROOT / "run/systemd/private").exists(), "systemd", 20)
        state = self.attempt("systemctl", "is-system-running", "--wait").stdout.strip()
        if state != "running":
            raise LabError(f"the system is {state}: {self.run('systemctl', '--failed')}")

    def enter(self, *argv: str) -> list[str]:
        return ["nsenter", "--target", str(self._pid), "--all", *argv]

    def follow(self, unit: str, timeline: Timeline) -> None:
        """Collect the unit's log in `log` from now on, and show its events on the timeline."""
        process = subprocess.Popen(self.enter("journalctl", "-f", "-n", "0", "-o", "cat",
                                              "-u", unit), stdout=subprocess.PIPE, text=True)

        def read() -> None:
            for line in process.stdout or ():
                self.log.append(line.rstrip("\n"))
                timeline.read_log(line)

        threading.Thread(target=read, daemon=True).start()

    def main_process(self, unit: str) -> int:
        """Pid of the unit's main process, as the system sees it; 0 without one."""
        return int(self.run("systemctl", "show", "-P", "MainPID", unit))

    def running(self, *programs: str) -> list[int]:
        """Pids, as the lab sees them, of the system's live processes that run these programs."""
        own = os.readlink(f"/proc/{self._pid}/ns/pid")
        return [pid for program in programs for pid in daemon.running(program)
                if os.readlink(f"/proc/{pid}/ns/pid") == own]


class Chrooted(System):
    """A system of which nothing runs but the commands: systemd does not run under qemu."""

    def start(self) -> None:
        for folder in (Path("/dev"), Path("/proc"), messages.FOLDER):
            own = ROOT / folder.relative_to("/")
            own.mkdir(exist_ok=True)
            run_tool("mount", "--rbind", str(folder), str(own))

    def enter(self, *argv: str) -> list[str]:
        return network.command(network.DEVICE, "chroot", str(ROOT), *argv)


def _child_of(pid: int) -> str:
    return subprocess.run(["pgrep", "-P", str(pid)], capture_output=True, text=True,
                          check=False).stdout.strip()
