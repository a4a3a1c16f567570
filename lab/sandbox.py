"""The sandbox a lab runs in: its own network, processes, mounts, users and host name.

`run` starts a Python module as the first process of new namespaces. When that process or the caller
of `run` ends, for whatever reason, the kernel kills everything inside and drops the namespaces with
their mounts, so nothing is left to clean up.
"""

from __future__ import annotations

import functools
import os
import signal
import stat
import subprocess
import sys
from collections.abc import Iterator
from contextlib import contextmanager, nullcontext
from pathlib import Path

from lab.support import run_tool

FORBIDDEN = 77
PROJECT = Path(__file__).resolve().parent.parent
PYTHON = "/usr/bin/python3"

# Without setpriv, unshare would outlive a killed parent; unshare's own child dies with it.
_UNSHARE = ["setpriv", "--pdeathsig", "KILL", "unshare", "--net", "--mount", "--pid", "--uts",
            "--fork", "--mount-proc", "--kill-child"]
_OWN_USERS = ["--user", "--map-root-user"]
_PROBE = "mount -t tmpfs probe /run && ip netns add probe && nft add table inet probe"
_INSIDE = "PELORUS_LAB_INSIDE"
_PID_PIPE = "PELORUS_LAB_PID_PIPE"
_PRIVATE = ("/tmp", "/run", "/dev", "/mnt", "/etc")
_DEVICES = ("null", "zero", "full", "random", "urandom", "tty", "net/tun")


def binary() -> Path:
    """The daemon under test: $PELORUS, or the release build of this project."""
    default = PROJECT / "build/release/src/daemon/pelorus"
    return Path(os.environ.get("PELORUS", default)).absolute()


def doctor() -> Path:
    """The program that explains a device's state: $PELORUS_DOCTOR, or that of the release build."""
    default = PROJECT / "build/release/src/doctor/pelorus-doctor"
    return Path(os.environ.get("PELORUS_DOCTOR", default)).absolute()


def is_inside() -> bool:
    """True in a process that `run` started."""
    return _INSIDE in os.environ


@functools.cache
def why_forbidden() -> str | None:
    """None where this machine allows namespaces, else the reason in one line."""
    try:
        probe = subprocess.run([*_UNSHARE, *_OWN_USERS, "sh", "-c", _PROBE], capture_output=True,
                               text=True, check=False)
    except FileNotFoundError as missing:
        return f"{missing.filename} is not installed"
    if probe.returncode == 0:
        return None
    return (probe.stderr.strip().splitlines() or ["unshare failed without a message"])[-1]


def run(module: str, arguments: list[str], timeout: float | None = None, capture: bool = False,
        keep_open: tuple[int, ...] = (),
        own_users: bool = True) -> subprocess.CompletedProcess[str]:
    """Run `python -m module arguments` as process 1 of a new sandbox and wait for its end.

    The descriptors of `keep_open`, files outside the sandbox, keep their numbers inside. Without
    `own_users` root inside is the machine's root: for what needs files of several users. Ctrl-C
    reaches the module through the terminal and is left to it; a SIGTERM or SIGHUP for the caller, a
    second Ctrl-C and the timeout end the sandbox at once.
    """
    read_end, write_end = os.pipe()
    # Compiling the lab and its tests each time would take longer than many of them.
    environment = dict(os.environ, PYTHONPATH=str(PROJECT), PYTHONDONTWRITEBYTECODE="",
                       PYTHONPYCACHEPREFIX=str(PROJECT / "build/pycache"),
                       **{_INSIDE: "1", _PID_PIPE: str(read_end)})
    output = subprocess.PIPE if capture else None
    process = subprocess.Popen(
        [*_UNSHARE, *(_OWN_USERS if own_users else ()), PYTHON, "-m", "lab.sandbox", module,
         *arguments], env=environment, cwd=PROJECT, pass_fds=[read_end, *keep_open],
        stdout=output, text=True, stderr=subprocess.STDOUT if capture else None)
    os.close(read_end)
    _tell_pid(process, write_end)
    try:
        with nullcontext() if capture else _ending_with(process):
            text, _ = process.communicate(timeout=timeout)
    finally:
        process.kill()
        process.wait()
    return subprocess.CompletedProcess(process.args, process.returncode, text, "")


def pid_outside() -> int:
    """Pid of this sandbox's first process as seen from outside; can be read once."""
    with os.fdopen(int(os.environ[_PID_PIPE])) as pipe:
        return int(pipe.read())


def _tell_pid(process: subprocess.Popen[str], write_end: int) -> None:
    """Send the first process its outside pid, which it cannot see itself."""
    with os.fdopen(write_end, "w") as pipe:
        while process.poll() is None:
            found = subprocess.run(["pgrep", "-P", str(process.pid)], capture_output=True,
                                   text=True, check=False).stdout.split()
            if found:
                pipe.write(found[0])
                return


@contextmanager
def _ending_with(process: subprocess.Popen[str]) -> Iterator[None]:
    """Make the signals that end this process end the sandbox first."""
    received: list[int] = []

    def on_signal(number: int, _frame: object) -> None:
        received.append(number)
        if number != signal.SIGINT or received.count(number) > 1:
            process.kill()

    numbers = (signal.SIGINT, signal.SIGTERM, signal.SIGHUP)
    before = {number: signal.signal(number, on_signal) for number in numbers}
    yield
    for number, handler in before.items():
        signal.signal(number, handler)
    if received and received[-1] != signal.SIGINT:
        os.kill(os.getpid(), received[-1])


def _mount(*arguments: str) -> None:
    run_tool("mount", *arguments)


def _open_hidden(paths: list[Path]) -> list[tuple[int, Path]]:
    """Open the paths that the private folders will hide, so that they can be mounted again."""
    covered = tuple(f"{folder}/" for folder in _PRIVATE)
    return [(os.open(path, os.O_PATH), path) for path in paths
            if str(path).startswith(covered) and path.exists()]


def _remount(held: list[tuple[int, Path]]) -> None:
    for number, path in held:
        folder = path if stat.S_ISDIR(os.fstat(number).st_mode) else path.parent
        folder.mkdir(parents=True, exist_ok=True)
        if folder != path:
            path.touch()
        _mount("--no-canonicalize", "--rbind", f"/proc/{os.getpid()}/fd/{number}", str(path))
        os.close(number)


def _private_devices() -> None:
    """Mount a private /dev with only what the servers need, and with a /dev/log of its own."""
    host = Path("/mnt/dev")
    host.mkdir()
    _mount("--rbind", "/dev", str(host))
    _mount("-t", "tmpfs", "-o", "mode=755", "lab-dev", "/dev")
    for name in _DEVICES:
        if (host / name).exists():
            Path("/dev", name).parent.mkdir(exist_ok=True)
            Path("/dev", name).touch()
            _mount("--bind", str(host / name), f"/dev/{name}")
    Path("/dev/fd").symlink_to("/proc/self/fd")
    Path("/dev/shm").mkdir(mode=0o1777)


def _private_etc() -> None:
    """Mount an /etc that shows the host's files and lets the lab add folders."""
    host = Path("/mnt/etc")
    host.mkdir()
    _mount("--rbind", "/etc", str(host))
    _mount("-t", "tmpfs", "-o", "mode=755", "lab-etc", "/etc")
    own = {"hosts": "127.0.0.1 localhost\n", "resolv.conf": "",
           "nsswitch.conf": "passwd: files\ngroup: files\nhosts: files dns\n"}
    for entry in host.iterdir():
        if entry.name not in own and entry.name not in ("ssl", "netns", "scripts"):
            Path("/etc", entry.name).symlink_to(entry)
    for name, text in own.items():
        Path("/etc", name).write_text(text)
    Path("/etc/scripts").mkdir()
    Path("/etc/ssl").mkdir()
    Path("/etc/ssl/openssl.cnf").symlink_to(host / "ssl/openssl.cnf")


def _set_up() -> None:
    """Mount a private folder over each one that a server or the daemon writes to."""
    held = _open_hidden([PROJECT, binary(), doctor()])
    _mount("-t", "tmpfs", "lab", "/mnt")
    _private_devices()
    _private_etc()
    _mount("-t", "tmpfs", "-o", "mode=755", "lab-run", "/run")
    _mount("-t", "tmpfs", "-o", "mode=1777", "lab-tmp", "/tmp")
    _remount(held)


def main() -> None:
    """Set up the sandbox, then become the wanted module (still process 1)."""
    _set_up()
    os.chdir(PROJECT)
    os.execv(PYTHON, [PYTHON, "-m", *sys.argv[1:]])


if __name__ == "__main__":
    main()
