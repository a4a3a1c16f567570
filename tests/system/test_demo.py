"""The demo as its user sees it: its output, its end, and that it leaves nothing behind."""

from __future__ import annotations

import os
import re
import signal
import subprocess
from pathlib import Path
from xml.etree import ElementTree

import pytest

from lab import sandbox
from lab.scenarios import SCENARIOS
from lab.support import wait_until

pytestmark = pytest.mark.outside

DAEMON_FILES = (Path("/tmp/tavik_cm_pid"), Path("/tmp/dynamicconfig.ini"))


def start_demo(*options: str, binary: Path = sandbox.binary()) -> subprocess.Popen[str]:
    """Start the demo as a terminal does, in its own process group, with a built daemon."""
    environment = dict(os.environ, PELORUS=str(binary))
    return subprocess.Popen([sandbox.PYTHON, "-m", "lab.demo", *options], env=environment,
                            cwd=sandbox.PROJECT, stdout=subprocess.PIPE, text=True,
                            stderr=subprocess.STDOUT, start_new_session=True)


def output_of(*options: str, binary: Path = sandbox.binary(), status: int = 0) -> str:
    demo = start_demo(*options, binary=binary)
    text, _ = demo.communicate(timeout=90)
    assert demo.returncode == status, text
    return text


def traces() -> tuple[list[str], list[bool]]:
    """The machine's mounts, and whether the daemon's files exist."""
    mounts = sorted(Path("/proc/self/mountinfo").read_text().splitlines())
    return mounts, [file.exists() for file in DAEMON_FILES]


def processes_in(pid_namespace: str) -> list[str]:
    """Live processes of one sandbox, seen from outside."""
    found = []
    for entry in Path("/proc").iterdir():
        try:
            if entry.name.isdigit() and os.readlink(entry / "ns/pid") == pid_namespace:
                found.append(entry.name)
        except OSError:
            continue  # ended meanwhile
    return found


def test_demo_prints_each_step_and_succeeds() -> None:
    before = traces()
    text = output_of()
    steps = ["gateway found through UPnP", "external address: 44.128.0.20",
             "forwards TCP 9091 -> 192.168.77.10:80", "the device answers", "port test passed",
             "mapping published: 44.128.0.20 HTTP 9091, HTTPS 9444", "status: portforwarded",
             "status          portforwarded", "external URL    http://44.128.0.20:9091/",
             "gateway rule    TCP 9444 -> 192.168.77.10:443", "central record  44.128.0.20"]
    places = [text.find(step) for step in steps]
    assert -1 not in places and places == sorted(places), text
    assert traces() == before


def test_demo_plays_a_listed_scenario_and_saves_its_picture(tmp_path: Path) -> None:
    assert [line.split()[0] for line in output_of("--list").splitlines()] == list(SCENARIOS)
    picture = tmp_path / "ports-taken.svg"
    text = output_of("ports-taken", "--svg", str(picture))
    assert "== it holds 9444 as well" in text and "all checks passed" in text
    words = " ".join(ElementTree.parse(picture).getroot().itertext())
    assert SCENARIOS["ports-taken"].title in words
    assert "forwards TCP 9445 -> 192.168.77.10:443" in words


def test_demo_fails_with_a_daemon_that_does_nothing() -> None:
    assert "FAILED: waited" in output_of(binary=Path("/bin/true"), status=1)


@pytest.mark.parametrize("end", [signal.SIGINT, signal.SIGTERM, signal.SIGKILL],
                         ids=["Ctrl-C", "kill", "kill-9"])
def test_lab_that_stays_up_leaves_no_trace_after(end: signal.Signals) -> None:
    before = traces()
    demo = start_demo("--stay")
    entries = (re.search(r"the view from outside.*-t (\d+) ", line) for line in demo.stdout or ())
    entry = next(found for found in entries if found)
    namespace = os.readlink(f"/proc/{entry[1]}/ns/pid")
    assert len(processes_in(namespace)) >= 4
    if end == signal.SIGINT:
        os.killpg(demo.pid, end)
    else:
        demo.send_signal(end)
    assert demo.wait(60) == (0 if end == signal.SIGINT else -end)
    wait_until(lambda: not processes_in(namespace), "every process of the lab to end", 60)
    assert traces() == before
