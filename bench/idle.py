"""Measures the idle daemon in the lab: memory, wake-ups, and files opened to write.

Runs inside a lab's sandbox, in real time, because a sped-up clock is a library in the daemon's own
memory. It waits for three cycles, two minutes apart.
"""

from __future__ import annotations

import json
import os
import re
import signal
import subprocess
import sys
import time
from collections.abc import Iterator
from contextlib import contextmanager
from pathlib import Path

from lab import network
from lab.account import SERVICE_HOST
from lab.device import PATH
from lab.scenario import Lab, Situation
from lab.support import LabError, wait_until
from lab.timeline import Timeline

_END_OF_CYCLE = re.compile(r"DaemonControl::run - (retry connection after|sleep) \d+ secs")
_CYCLE_SECONDS = 180   # longest time from one end of a cycle to the next
_SETTLE_SECONDS = 2    # from the line that ends a cycle to the sleep that follows it
_IDLE_SECONDS = 90     # well inside the pause of 120 s between two cycles
_TRACE = Path("/tmp/opens")
# Attempts count too: with several processes strace may print the result on another line.
_OPEN_TO_WRITE = re.compile(r"(?:open|openat|openat2|creat)\([^\"]*\"([^\"]*)\""
                            r".*\b(?:O_WRONLY|O_RDWR|O_CREAT)\b|creat\(\"([^\"]*)\"")


def main() -> None:
    """Play three cycles, measure, and leave the numbers as JSON in the file named by argv."""
    bare_client, result = sys.argv[1:]
    lab = Lab(Situation(), Timeline())
    try:
        numbers = _measure(lab, bare_client)
        lab.stop_daemon()
    except LabError:
        print(lab.report())
        raise
    Path(result).write_text(json.dumps(numbers))


def _measure(lab: Lab, bare_client: str) -> dict[str, object]:
    pid = lab.start_daemon("-l", "7", "-f", "30").pid
    _wait_for_cycle(lab, 1)
    _wait_for_cycle(lab, 2)
    before = _state(lab)
    wake_ups = _wake_ups(pid)
    with _opens_to_write(pid) as opened:
        _wait_for_cycle(lab, 3)
    if _state(lab) != before:
        raise LabError(f"the third cycle should change nothing, but did:\n{before}\n{_state(lab)}")
    memory = _memory(pid)
    urls = [f"https://{SERVICE_HOST}{request.url}" for request in lab.central.requests
            if request.scheme == "https"]
    return {"status": lab.device.status, "wake_ups": wake_ups, "opened_to_write": opened,
            "memory": memory, "bare_memory": _memory_of_bare_client(bare_client, urls),
            "https_requests": len(urls)}


def _wait_for_cycle(lab: Lab, number: int) -> None:
    lab.wait_for(lambda: sum(bool(_END_OF_CYCLE.search(text))
                             for text in lab.device.messages.texts()) >= number,
                 f"the end of cycle {number}", _CYCLE_SECONDS)
    print(f"  cycle {number} of 3 done, device is {lab.device.status}", flush=True)
    time.sleep(_SETTLE_SECONDS)


def _state(lab: Lab) -> tuple[object, ...]:
    """Everything that a cycle can change."""
    return (lab.device.status, lab.central.record, lab.device.statuses_sent(),
            sorted(map(str, lab.gateway.mappings())))


def _wake_ups(pid: int) -> int:
    """How often the idle process ran."""
    before = _times_run(pid)
    time.sleep(_IDLE_SECONDS)
    return _times_run(pid) - before


def _times_run(pid: int) -> int:
    threads = [file.read_text() for file in Path(f"/proc/{pid}/task").glob("*/status")]
    return sum(map(int, re.findall(r"ctxt_switches:\s+(\d+)", "".join(threads))))


@contextmanager
def _opens_to_write(pid: int) -> Iterator[list[str]]:
    """Files that the process and its children open for writing meanwhile; filled at the end."""
    opened: list[str] = []
    tracer = subprocess.Popen(["strace", "-f", "-qq", "-e", "trace=open,openat,openat2,creat",
                               "-o", str(_TRACE), "-p", str(pid)])
    wait_until(lambda: f"TracerPid:\t{tracer.pid}" in Path(f"/proc/{pid}/status").read_text(),
               "strace to attach", 5)
    yield opened
    tracer.send_signal(signal.SIGINT)
    tracer.wait()
    calls = _TRACE.read_text().splitlines()
    if not calls:
        raise LabError("strace saw no file opened in a whole cycle")
    opened += written_files(calls)


def written_files(calls: list[str]) -> list[str]:
    """The files that strace shows as opened for writing, without devices."""
    found = (match[1] or match[2] for match in map(_OPEN_TO_WRITE.search, calls) if match)
    return [path for path in found if not path.startswith("/dev/")]


def _memory(pid: int) -> dict[str, int]:
    """KiB by kind, as the kernel counts them."""
    rollup = Path(f"/proc/{pid}/smaps_rollup").read_text()
    return {name: int(size) for name, size in re.findall(r"(\w+):\s+(\d+) kB", rollup)}


def _memory_of_bare_client(program: str, urls: list[str]) -> dict[str, int]:
    argv = network.command(network.DEVICE, "env", "-i", f"PATH={PATH}", program, *urls)
    with subprocess.Popen(argv, stdout=subprocess.PIPE, text=True) as started:
        assert started.stdout is not None
        line = started.stdout.readline()
        if not line:
            raise LabError("the bare client failed in its requests")
        time.sleep(_SETTLE_SECONDS)
        memory = _memory(int(line))
        os.kill(int(line), signal.SIGKILL)
    return memory


if __name__ == "__main__":
    main()
