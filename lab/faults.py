"""Faults of the service, the name server and the device that a running daemon meets.

Each is a context manager: the fault begins with its block and is over with it. Its value tells
whether the daemon has met the fault so far.
"""

from __future__ import annotations

import itertools
import shutil
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
from lab.checks import PAUSE
from lab.relay import TUNNEL_DEVICE
from lab.scenario import Lab
from lab.support import run_tool, wait_until

Met = Callable[[], bool]
Begin = Callable[[Lab], AbstractContextManager[Met]]
_Play = Callable[[Lab], Iterator["Met | None"]]

_EVERYTHING = (COMM_STATUS, PORT_FORWARD, PORT_TEST, WAIT)
_NOBODY = "44.128.0.99"
YEAR = 365 * 24 * 3600
# The clock of a daemon that `adjustable_clock` started; libfaketime reads it at every look.
_CLOCK = Path("/run/lab/clock")
_FILLER = "filler"
_names = (f"box{number}" for number in itertools.count())

# Commands that start the daemon in an unusual way: no descriptor is open, or its parent ignores
# SIGCHLD.
CLOSED = ("sh", "-c", 'exec "$@" <&- >&- 2>&-', "sh")
NO_SIGCHLD = ("env", "--ignore-signal=CHLD")
_LOCALES = Path("/run/lab/locales")
_LOCALE = "de_DE.ISO-8859-1"

# The daemon has met a fault when its log has a line this often since: a request that failed, or the
# end of a cycle, of which the second was wholly within the fault.
_REQUEST_FAILED = ("TavikClient::httpGet  Error: [", 1)
_CYCLE_ENDED = (PAUSE, 2)

SERVICE_FAULTS: dict[str, Begin] = {}
DEVICE_FAULTS: dict[str, Begin] = {}


def _of(table: dict[str, Begin], sign: tuple[str, int]) -> Callable[[_Play], Begin]:
    """Make a fault of a function that begins it, yields and ends it, and list it by its name.

    The `sign` in the log that the daemon has met it gives way to what the function yields.
    """

    def register(play: _Play) -> Begin:
        name = play.__name__.replace("_", "-")
        assert play.__doc__
        words = play.__doc__.splitlines()[0]
        line, often = sign

        @contextmanager
        def fault(lab: Lab) -> Iterator[Met]:
            lab.timeline.add("fault", words)
            with contextmanager(play)(lab) as met:
                before = lab.device.messages.count(line)
                yield met or (lambda: lab.device.messages.count(line) >= before + often)
            lab.timeline.add("fault", f"is over: {words}")

        table[name] = fault
        return fault

    return register


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def certificate_expired(lab: Lab) -> Iterator[None]:
    """The service's certificate has run out."""
    lab.central.show_certificate_of(SERVICE_HOST, expired=True)
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def certificate_of_another(lab: Lab) -> Iterator[None]:
    """The service's certificate has another name."""
    lab.central.show_certificate_of("elsewhere.example")
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def authority_unknown(lab: Lab) -> Iterator[None]:
    """The service's certificate is signed by an unknown authority."""
    lab.central.show_certificate_from(Authority(Path("/run/lab/unknown"), "Somebody"))
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def tls_outdated(lab: Lab) -> Iterator[None]:
    """The service speaks nothing newer than TLS 1.0."""
    lab.central.show_certificate_of(SERVICE_HOST, outdated=True)
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def tls_missing(lab: Lab) -> Iterator[None]:
    """The service speaks plain HTTP on port 443."""
    lab.central.drop_tls()
    yield
    lab.central.show_certificate_of(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
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


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def service_drips(lab: Lab) -> Iterator[None]:
    """The service sends a byte in half a second."""
    yield from _misbehaviour(lab, Fault(body="Success" * 100, pause=0.5))


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def service_floods(lab: Lab) -> Iterator[None]:
    """The service's answers have no end."""
    yield from _misbehaviour(lab, Fault(body="Success" * 10000, endless=True))


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def service_resets(lab: Lab) -> Iterator[None]:
    """The service resets every connection."""
    yield from _misbehaviour(lab, Fault(reset=True))


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def service_gone(lab: Lab) -> Iterator[None]:
    """The service is down."""
    lab.central.stop()
    yield
    lab.central.start()


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def names_time_out(lab: Lab) -> Iterator[None]:
    """The name server does not answer."""
    lab.device.limit_lookups(1)
    lab.names.server.send_signal(signal.SIGSTOP)
    yield
    lab.names.server.send_signal(signal.SIGCONT)
    lab.device.limit_lookups()


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def names_lead_nowhere(lab: Lab) -> Iterator[None]:
    """The name server says that the service is where nobody is."""
    lab.names.pin(SERVICE_HOST, _NOBODY)
    yield
    lab.names.unpin(SERVICE_HOST)


@_of(SERVICE_FAULTS, _REQUEST_FAILED)
def names_lead_home(lab: Lab) -> Iterator[None]:
    """The name server says that the service is the device itself."""
    lab.names.pin(SERVICE_HOST, "127.0.0.1")
    yield
    lab.names.unpin(SERVICE_HOST)


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def log_gone(lab: Lab) -> Iterator[Met]:
    """Nobody receives the log."""
    lab.device.messages.stop()
    before = len(lab.central.requests)
    yield lambda: len(lab.central.requests) > before
    lab.device.messages.start()


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def tmp_full(_lab: Lab) -> Iterator[None]:
    """There is no space left in /tmp."""
    with full(Path("/tmp")):
        yield


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def tmp_read_only(_lab: Lab) -> Iterator[None]:
    """/tmp is mounted read-only."""
    run_tool("mount", "-o", "remount,ro", "/tmp")
    yield
    run_tool("mount", "-o", "remount,rw", "/tmp")


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def descriptors_exhausted(lab: Lab) -> Iterator[None]:
    """The daemon has no descriptor left."""
    with _limited(lab, "nofile", 3):
        yield


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def memory_exhausted(lab: Lab) -> Iterator[Met]:
    """The daemon gets no more memory from the kernel."""
    # The system call brk tells a failure by an old address, not by an error number.
    with _refused(lab, "mmap:error=ENOMEM", "brk:retval=0") as met:
        yield met


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def processes_exhausted(lab: Lab) -> Iterator[Met]:
    """The daemon can start no process and no thread."""
    with _refused(lab, "fork,vfork,clone,clone3:error=EAGAIN") as met:
        yield met


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def cable_unplugged(lab: Lab) -> Iterator[None]:
    """The network interface is down."""
    port, router = (("wan", network.SERVICE_ADDRESS) if lab.situation.own_router else
                    ("eth0", lab.gateway.lan_address))
    network.ip_batch(f"link set {port} down", host=network.DEVICE)
    yield
    network.ip_batch(f"link set {port} up", f"route replace default via {router}",
                     host=network.DEVICE)


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def clock_ahead(lab: Lab) -> Iterator[None]:
    """The clock is a year ahead."""
    with _clock_off(lab, YEAR):
        yield


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def clock_behind(lab: Lab) -> Iterator[None]:
    """The clock is a year behind."""
    with _clock_off(lab, -YEAR):
        yield


@_of(DEVICE_FAULTS, _CYCLE_ENDED)
def host_renamed(lab: Lab) -> Iterator[None]:
    """The device has another host name."""
    socket.sethostname(next(_names))
    yield
    socket.sethostname(lab.account.host_name)


def adjustable_clock(lab: Lab) -> tuple[str, ...]:
    """A command that starts a daemon whose clock the faults of the clock can move."""
    _set_clock(lab, 0)
    return "env", "-u", "FAKETIME", f"FAKETIME_TIMESTAMP_FILE={_CLOCK}", "FAKETIME_NO_CACHE=1"


def foreign_locale() -> tuple[str, ...]:
    """A command that starts the daemon in a locale that writes 1,5 for one and a half."""
    if not _LOCALES.exists():
        _LOCALES.mkdir()
        run_tool("localedef", "-i", "de_DE", "-f", "ISO-8859-1", str(_LOCALES / _LOCALE))
    command = ("env", f"LOCPATH={_LOCALES}", f"LC_ALL={_LOCALE}")
    run_tool(*command, "/usr/bin/printf", "%.1f", "1,5")
    return command


@contextmanager
def openvpn_missing(lab: Lab) -> Iterator[None]:
    """Programs that start from now on find no openvpn."""
    lab.timeline.add("fault", "openvpn is not installed")
    with _covered(shutil.which("openvpn") or "", "--bind", "/dev/null"):
        yield


@contextmanager
def tunnel_device_missing(lab: Lab) -> Iterator[None]:
    """Programs that start from now on find no tunnel device."""
    lab.timeline.add("fault", f"there is no {TUNNEL_DEVICE}")
    with _covered(str(TUNNEL_DEVICE.parent), "-t", "tmpfs", "lab-empty"):
        yield


@contextmanager
def _covered(path: str, *mounted: str) -> Iterator[None]:
    run_tool("mount", *mounted, path)
    yield
    run_tool("umount", path)


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
def _refused(lab: Lab, *refusals: str) -> Iterator[Met]:
    """Let the kernel refuse calls, named as for strace, to the daemon and what it starts."""
    record = Path("/run/lab/refused")
    with traced(lab.daemon.pid, "-o", str(record), *(f"-einject={call}" for call in refusals)):
        yield lambda: "(INJECTED)" in record.read_text(errors="replace")


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
