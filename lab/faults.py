"""Faults of the service, the name server and the device that a running daemon meets.

Each is a context manager: the fault begins with its block and is over with it.
"""

from __future__ import annotations

import itertools
import signal
import socket
import subprocess
from collections.abc import Callable, Iterator
from contextlib import AbstractContextManager, contextmanager, suppress
from pathlib import Path

from lab import network
from lab.account import SERVICE_HOST
from lab.central import COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT, Fault
from lab.certificates import Authority
from lab.scenario import Lab
from lab.support import run_tool, wait_until

Begin = Callable[[Lab], AbstractContextManager[None]]

_EVERYTHING = (COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT)
_NOBODY = "44.128.0.99"
_YEAR = 365 * 24 * 3600
# The clock of a daemon that `adjustable_clock` started; libfaketime reads it at every look.
_CLOCK = Path("/run/lab/clock")
_FILLER = "filler"
_names = (f"box{number}" for number in itertools.count())

# Commands that start the daemon in an unusual way: no descriptor is open, its parent ignores
# SIGCHLD, or a locale is set.
CLOSED = ("sh", "-c", 'exec "$@" <&- >&- 2>&-', "sh")
NO_SIGCHLD = ("env", "--ignore-signal=CHLD")
LOCALE = ("env", "LC_ALL=tr_TR.UTF-8", "LANG=de_DE@euro", "LANGUAGE=de:tr", "LC_NUMERIC=C.UTF-8")

SERVICE_FAULTS: dict[str, Begin] = {}
DEVICE_FAULTS: dict[str, Begin] = {}


def _of(table: dict[str, Begin]) -> Callable[[Callable[[Lab], Iterator[None]]], Begin]:
    """Make a fault of a function that begins it, yields and ends it, and list it by its name."""

    def register(play: Callable[[Lab], Iterator[None]]) -> Begin:
        name = play.__name__.replace("_", "-")
        assert play.__doc__
        words = play.__doc__.splitlines()[0]

        @contextmanager
        def fault(lab: Lab) -> Iterator[None]:
            lab.timeline.add("fault", words)
            yield from play(lab)
            lab.timeline.add("fault", f"is over: {words}")

        table[name] = fault
        return fault

    return register


@_of(SERVICE_FAULTS)
def certificate_expired(lab: Lab) -> Iterator[None]:
    """The service's certificate has run out."""
    lab.central.show_certificate_of(SERVICE_HOST, expired=True)
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def certificate_of_another(lab: Lab) -> Iterator[None]:
    """The service's certificate has another name."""
    lab.central.show_certificate_of("elsewhere.example")
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def authority_unknown(lab: Lab) -> Iterator[None]:
    """The service's certificate is signed by an unknown authority."""
    lab.central.show_certificate_from(Authority(Path("/run/lab/unknown"), "Somebody"))
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def tls_outdated(lab: Lab) -> Iterator[None]:
    """The service speaks nothing newer than TLS 1.0."""
    lab.central.show_certificate_of(SERVICE_HOST, outdated=True)
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def tls_missing(lab: Lab) -> Iterator[None]:
    """The service speaks plain HTTP on port 443."""
    lab.central.drop_tls()
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def service_stalls(lab: Lab) -> Iterator[None]:
    """The service accepts connections and keeps silent."""
    lab.central.keep_silent()
    yield
    lab.central.keep_silent(False)


def _misbehaviour(lab: Lab, fault: Fault) -> Iterator[None]:
    for operation in _EVERYTHING:
        lab.central.misbehave(operation, fault)
    yield
    for operation in _EVERYTHING:
        lab.central.misbehave(operation, None)


@_of(SERVICE_FAULTS)
def service_drips(lab: Lab) -> Iterator[None]:
    """The service sends a byte in half a second."""
    yield from _misbehaviour(lab, Fault(body="Success" * 100, pause=0.5))


@_of(SERVICE_FAULTS)
def service_floods(lab: Lab) -> Iterator[None]:
    """The service's answers have no end."""
    yield from _misbehaviour(lab, Fault(body="Success" * 10000, endless=True))


@_of(SERVICE_FAULTS)
def service_resets(lab: Lab) -> Iterator[None]:
    """The service resets every connection."""
    yield from _misbehaviour(lab, Fault(reset=True))


@_of(SERVICE_FAULTS)
def service_gone(lab: Lab) -> Iterator[None]:
    """The service is down."""
    lab.central.stop()
    yield
    lab.central.start()


@_of(SERVICE_FAULTS)
def names_time_out(lab: Lab) -> Iterator[None]:
    """The name server does not answer."""
    lab.device.limit_lookups(1)
    lab.names.server.send_signal(signal.SIGSTOP)
    yield
    lab.names.server.send_signal(signal.SIGCONT)
    lab.device.limit_lookups()


@_of(SERVICE_FAULTS)
def names_lead_nowhere(lab: Lab) -> Iterator[None]:
    """The name server says that the service is where nobody is."""
    lab.names.pin(SERVICE_HOST, _NOBODY)
    yield
    lab.names.unpin(SERVICE_HOST)


@_of(SERVICE_FAULTS)
def names_lead_home(lab: Lab) -> Iterator[None]:
    """The name server says that the service is the device itself."""
    lab.names.pin(SERVICE_HOST, "127.0.0.1")
    yield
    lab.names.unpin(SERVICE_HOST)


@_of(DEVICE_FAULTS)
def log_gone(lab: Lab) -> Iterator[None]:
    """Nobody receives the log."""
    lab.device.messages.stop()
    yield
    lab.device.messages.start()


@_of(DEVICE_FAULTS)
def tmp_full(_lab: Lab) -> Iterator[None]:
    """There is no space left in /tmp."""
    with full(Path("/tmp")):
        yield


@_of(DEVICE_FAULTS)
def tmp_read_only(_lab: Lab) -> Iterator[None]:
    """/tmp is mounted read-only."""
    run_tool("mount", "-o", "remount,ro", "/tmp")
    yield
    run_tool("mount", "-o", "remount,rw", "/tmp")


@_of(DEVICE_FAULTS)
def descriptors_exhausted(lab: Lab) -> Iterator[None]:
    """The daemon has no descriptor left."""
    with _limited(lab, "nofile", 3):
        yield


@_of(DEVICE_FAULTS)
def memory_exhausted(lab: Lab) -> Iterator[None]:
    """The daemon gets no more memory from the kernel."""
    with _refused(lab, "mmap,brk", "ENOMEM"):
        yield


@_of(DEVICE_FAULTS)
def processes_exhausted(lab: Lab) -> Iterator[None]:
    """The daemon can start no process and no thread."""
    with _refused(lab, "fork,vfork,clone,clone3", "EAGAIN"):
        yield


@_of(DEVICE_FAULTS)
def cable_unplugged(lab: Lab) -> Iterator[None]:
    """The network interface is down."""
    network.ip_batch("link set eth0 down", host=network.DEVICE)
    yield
    network.ip_batch("link set eth0 up", f"route replace default via {lab.gateway.lan_address}",
                     host=network.DEVICE)


@_of(DEVICE_FAULTS)
def clock_ahead(lab: Lab) -> Iterator[None]:
    """The clock is a year ahead."""
    with _clock_off(lab, _YEAR):
        yield


@_of(DEVICE_FAULTS)
def clock_behind(lab: Lab) -> Iterator[None]:
    """The clock is a year behind."""
    with _clock_off(lab, -_YEAR):
        yield


@_of(DEVICE_FAULTS)
def host_renamed(lab: Lab) -> Iterator[None]:
    """The device has another host name."""
    socket.sethostname(next(_names))
    yield
    socket.sethostname(lab.account.host_name)


def adjustable_clock(lab: Lab) -> tuple[str, ...]:
    """A command that starts a daemon whose clock the faults of the clock can move."""
    _set_clock(lab, 0)
    return "env", "-u", "FAKETIME", f"FAKETIME_TIMESTAMP_FILE={_CLOCK}", "FAKETIME_NO_CACHE=1"


@contextmanager
def full(folder: Path) -> Iterator[None]:
    """Leave no space on the small file system that is mounted there."""
    run_tool("mount", "-o", "remount,size=1m", str(folder))
    with suppress(OSError), (folder / _FILLER).open("wb", buffering=0) as filler:
        while True:
            filler.write(bytes(4096))
    yield
    (folder / _FILLER).unlink()


def _set_clock(lab: Lab, ahead: int) -> None:
    new = _CLOCK.with_suffix(".new")
    new.write_text(f"{ahead:+d} x{lab.situation.clock}\n")
    new.replace(_CLOCK)


@contextmanager
def _clock_off(lab: Lab, ahead: int) -> Iterator[None]:
    _set_clock(lab, ahead)
    yield
    _set_clock(lab, 0)


@contextmanager
def _limited(lab: Lab, resource: str, limit: int) -> Iterator[None]:
    """Lower a soft limit of the running daemon."""
    pid = f"--pid={lab.daemon.pid}"
    before = subprocess.run(["prlimit", pid, f"--{resource}", "--output=SOFT", "--noheadings"],
                            capture_output=True, text=True, check=True).stdout.strip()
    run_tool("prlimit", pid, f"--{resource}={limit}:")
    yield
    run_tool("prlimit", pid, f"--{resource}={before}:")


@contextmanager
def _refused(lab: Lab, calls: str, error: str) -> Iterator[None]:
    """Let the kernel refuse these calls to the daemon and the children that it starts."""
    with traced(lab.daemon.pid, "-o", "/dev/null", "-e", f"inject={calls}:error={error}"):
        yield


@contextmanager
def traced(pid: int, *options: str) -> Iterator[None]:
    """Trace a process and the children that it starts, with options of strace."""
    with subprocess.Popen(["strace", "-qq", "-f", "-p", str(pid), *options],
                          stderr=subprocess.DEVNULL) as tracer:
        status = Path(f"/proc/{pid}/status")
        wait_until(lambda: f"TracerPid:\t{tracer.pid}\n" in status.read_text(),
                   "the tracer to be attached", 10)
        try:
            yield
        finally:
            tracer.send_signal(signal.SIGINT)


ALL = {**SERVICE_FAULTS, **DEVICE_FAULTS}
