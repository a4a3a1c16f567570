"""Every command in README, CONTRIBUTING and docs/ is run.

A command is a line of a block, or a text in backticks, that begins with a script or a program. A
new one fails until it is run here or ELSEWHERE says who runs it; its words must be known anyhow.
"""

from __future__ import annotations

import functools
import os
import re
import shutil
import signal
import subprocess
from pathlib import Path

import pytest

from lab import network, sandbox
from lab.device import HOME, PATH, STATIC_FILE
from lab.gateway import GatewaySetup
from lab.scenario import Lab, Situation
from lab.scenarios import SCENARIOS
from lab.support import wait_until
from lab.timeline import Timeline
from lab.zoo import ZOO

ROOT = sandbox.PROJECT
PAGES = (ROOT / "README.md", ROOT / "CONTRIBUTING.md", *ROOT.glob("docs/*.md"))
BLOCK = re.compile(r"^```\w*\n(.*?)^```", re.M | re.S)
COMMAND = re.compile(
    r"((scripts|bench|packaging)/[\w-]+|build/\w+/tests/unit/\w+|apt-get|cat|cd|cmake|cp|ctest|grep"
    r"|hdparm|journalctl|kill|ls|mkdir|natpmpc|pelorus|pgrep|printf|sed|systemctl|systemd-\w+|tail"
    r"|touch|upnpc|/usr/bin/python3)(?= |$).*")
HERE = re.compile(r"scripts/demo --(list|zoo)|cmake --(list-presets|install .*)|grep .*"
                  r"|ctest --preset dev -[RN].*|build/dev/tests/unit/.*")
ON_DEVICE = re.compile(r"cat .*|ls .*|upnpc .*|natpmpc|hdparm .* .*|pgrep .*|touch .*|pelorus -u.*")
ELSEWHERE = {
    r"scripts/(deps|lint|test)\b.*|(cmake|ctest) .*-preset .*|.*python3.* pytest.*": "scripts/test",
    r"scripts/(cross|matrix|test-cross)\b.*": "nobody: ten minutes and more",
    r"scripts/demo\b.*": "test_demo and test_scenarios",
    r"scripts/(endure|fuzz)\b.*": "scripts/test in short; each takes minutes to hours",
    r"scripts/(gallery|zoo)\b.*|bench/.*": "takes up to an hour; --help is run here",
    r"packaging/.*|(systemctl|systemd-\w+|journalctl|apt-get|cd|cp|mkdir|printf|sed) .*":
        "packaging/test-deb, on a device that systemd boots",
    r"pelorus -l \d|hdparm -C|kill -9": "scenarios, with all that belongs to it",
    r"tail -f /var/log/syslog .*": "nobody: needs a log daemon"}


def commands() -> list[str]:
    found = set()
    for page in PAGES:
        text = page.read_text()
        for line in "".join(BLOCK.findall(text)).replace("\\\n", "").splitlines():
            found.add(re.sub(r"\s+# .*|(?<=\S)\s{3,}\w.*", "", line))
        spans = re.findall("`([^`]+)`", BLOCK.sub("", text))
        found |= {re.sub(r"\s+", " ", span) for span in spans if re.search("[ /]", span)}
    parts = {part.strip() for command in found for part in command.split(" && ")}
    return sorted(part for part in parts if COMMAND.fullmatch(part) and not (ROOT / part).is_dir())


@functools.cache
def explains_itself(program: str) -> None:
    subprocess.run([ROOT / program, "--help"], check=True, timeout=60)


def check_words(program: str, words: list[str]) -> None:
    """Options and names that a script of the tree, or the module it starts, knows."""
    script = source = (ROOT / program).read_text()
    for module in re.findall(r"-m (lab[.\w]+)", script):
        source += (ROOT / f"{module.replace('.', '/')}.py").read_text()
    known = {*SCENARIOS, *ZOO, *os.listdir(ROOT / "tests/fuzz/seeds")}
    for word in words:
        assert word in known or word.isupper() or word.isdigit() or word in source, word
    if re.search("argparse|See --help", script):
        explains_itself(program)


@pytest.mark.outside
@pytest.mark.parametrize("command", commands())
def test_command(command: str, tmp_path: Path) -> None:
    program, *words = re.sub(r"[][]|\.\.\.", " ", command).split()
    if re.match("scripts|bench|packaging", program):
        check_words(program, words)
    for name in re.findall(r"--preset (\w+)", command):
        assert f'"{name}"' in (ROOT / "CMakePresets.json").read_text()
    if HERE.fullmatch(command):
        preset = re.search("dev|release", command)
        if preset and not (ROOT / f"build/{preset.group()}/src/daemon/pelorus").exists():
            pytest.skip(f"the preset {preset.group()} is not built")
        subprocess.run(command, shell=True, check=True, cwd=ROOT, timeout=120,
                       env={**os.environ, "DESTDIR": str(tmp_path)})
    elif not ON_DEVICE.fullmatch(command):
        assert any(re.fullmatch(pattern, command) for pattern in ELSEWHERE), "nobody runs it"


def test_commands_on_the_device() -> None:
    lab = Lab(Situation(gateway=GatewaySetup(upnp=True, natpmp=True)), Timeline())
    lab.start_daemon("-l", "6")
    lab.wait_for(lambda: lab.device.status == "portforwarded", "the ports", 55)
    (HOME / "bin/pelorus").symlink_to(sandbox.binary())
    shutil.copy("/bin/sleep", HOME / "bin/openvpn")
    subprocess.Popen([HOME / "bin/openvpn", "600"])  # ends with the sandbox
    for command in filter(ON_DEVICE.fullmatch, commands()):
        if command.startswith("pelorus") and not lab.daemon.ended():
            assert lab.stop_daemon(signal.SIGKILL) == "SIGKILL" and lab.gateway.mappings()
        argv = network.command(network.DEVICE, "env", f"PATH={PATH}",
                               f"TAVIK_STATIC_CONFIG={STATIC_FILE}", "sh", "-c", command)
        done = subprocess.run(argv, capture_output=True, text=True, check=False)
        assert done.returncode == 0, f"{command}: {done.stderr}"
        assert done.stdout or re.match("touch|pelorus", command), command
    wait_until(lambda: not lab.gateway.mappings(), "the mappings to be removed", 55)
