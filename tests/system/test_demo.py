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


def start_demo(*options: str, binary: str = str(sandbox.binary())) -> subprocess.Popen[str]:
    """Start the demo as a terminal does, in its own process group, with a built daemon."""
    return subprocess.Popen([sandbox.PYTHON, "-m", "lab.demo", *options], text=True,
                            env=dict(os.environ, PELORUS=binary), cwd=sandbox.PROJECT,
                            stdin=subprocess.PIPE, stdout=subprocess.PIPE,
                            stderr=subprocess.STDOUT, start_new_session=True)


def output_of(*options: str, status: int = 0, **binary: str) -> str:
    demo = start_demo(*options, **binary)
    text, _ = demo.communicate("\n", timeout=90)
    assert demo.returncode == status, text
    return text


def traces() -> list[str]:
    """The machine's mounts, and the daemon's files if they exist."""
    files = filter(os.path.exists, ("/tmp/tavik_cm_pid", "/tmp/dynamicconfig.ini"))
    return [*files, *sorted(Path("/proc/self/mountinfo").read_text().splitlines())]


def processes_in(namespace: str) -> list[str]:
    """Live processes of a pid namespace, seen from outside."""
    return subprocess.run(["lsns", "-no", "PID", namespace], stdout=subprocess.PIPE, text=True,
                          check=False).stdout.split()


def test_demo_prints_each_step_and_succeeds() -> None:
    before = traces()
    text = output_of()
    steps = ["gateway found through UPnP", "external address: 44.128.0.20",
             "forwards TCP 9091 -> 192.168.77.10:80", "the device answers", "port test passed",
             "mapping published: 44.128.0.20 HTTP 9091, HTTPS 9444", "status: portforwarded",
             "status          portforwarded", "external URL    http://44.128.0.20:9091/",
             "gateway rule    TCP 9444 -> 192.168.77.10:443", "central record  44.128.0.20"]
    assert re.search(".*".join(map(re.escape, steps)), text, re.DOTALL), text
    assert traces() == before


def test_demo_lists_plays_and_draws_scenarios_and_stays_in_one(tmp_path: Path) -> None:
    assert [line.split()[0] for line in output_of("--list").splitlines()] == list(SCENARIOS)
    assert not subprocess.getoutput(f"cd '{sandbox.PROJECT}'; python3 -m lab.demo --list | true")
    text = output_of("ports-taken", "--svg", f"{tmp_path}/taken.svg")
    assert "== it holds 9444 as well" in text and "all checks passed" in text
    words = " ".join(ElementTree.parse(tmp_path / "taken.svg").getroot().itertext())
    assert SCENARIOS["ports-taken"].title in words
    assert "forwards TCP 9445 -> 192.168.77.10:443" in words
    text = output_of("credentials-missing", "--stay")
    assert re.search("there are no credentials.*pelorus is running.*been removed", text, re.DOTALL)


def test_demo_ends_with_the_doctors_words() -> None:
    text = output_of("credentials-missing", "--diagnose")
    note = text.partition("$ pelorus-doctor\n")[2].splitlines()
    assert note[0].startswith("NOT REACHED since "), text
    assert note[2].startswith("Why    The device has no credentials for the service"), text
    assert max(map(len, note)) <= 100, text


def test_demo_fails_with_a_daemon_that_does_nothing() -> None:
    assert "FAILED: waited" in output_of(binary="/bin/true", status=1)


@pytest.mark.parametrize("end", [signal.SIGINT, signal.SIGTERM, signal.SIGKILL],
                         ids=["Ctrl-C", "kill", "kill-9"])
def test_lab_that_stays_up_leaves_no_trace_after(end: signal.Signals) -> None:
    before = traces()
    demo = start_demo("--stay")
    entries = (re.search(r"the view from outside.*-t (\d+) ", line) for line in demo.stdout or ())
    entry = next(filter(None, entries))
    namespace = os.readlink(f"/proc/{entry[1]}/ns/pid").strip("pid:[]")
    assert len(processes_in(namespace)) >= 4
    if end == signal.SIGINT:
        os.killpg(demo.pid, end)
    else:
        demo.send_signal(end)
    assert demo.wait(60) == (0 if end == signal.SIGINT else -end)
    wait_until(lambda: not processes_in(namespace), "every process of the lab to end", 60)
    assert traces() == before
