"""Every command in README, CONTRIBUTING and docs/ is known to be run, or to be left out.

A command is a line of a block, or a text in backticks, that begins with a script or a program. It
is run here (HERE, ON_DEVICE); or it is in a block of docs/install.md, which packaging/test-deb
runs; or ELSEWHERE says what else runs that script or build step, perhaps with other words; or it is
in NOT_RUN by name. A script must know the words that it is given.
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
PAGES = (ROOT / "README.md", ROOT / "CONTRIBUTING.md", ROOT / "bench/README.md",
         *ROOT.glob("docs/*.md"))
BLOCK = re.compile(r"^```\w*\n(.*?)^```", re.M | re.S)
COMMAND = re.compile(
    r"((chrt -r 1 |[A-Z]+=\S+ )?(scripts|bench|packaging)/[\w.-]+|build/\w+/tests/unit/\w+"
    r"|/usr/bin/python3|apt|apt-get|cat|cd|chmod|chown|cmake|cp|ctest|curl|dpkg(-\w+)?|git|grep"
    r"|hdparm|ip|journalctl|kill|ls|mkdir|mv|natpmpc|nft|nsenter|openvpn|pelorus|pelorus-doctor"
    r"|pgrep|pkill|printf|python3|rm|sed|sudo|systemctl|systemd-\w+|tail|touch|upnpc)(?= |$).*")
HERE = re.compile(r"scripts/demo --(list|zoo)|cmake --(list-presets|install .*)|grep .*")
ON_DEVICE = re.compile(r"cat .*|ls .*|upnpc (?!-a$).*|natpmpc|hdparm .* .*|pgrep .*|touch .*"
                       r"|pelorus -u.*|pelorus-doctor(?!.* --log).*")
ELSEWHERE = {
    r"scripts/(deps|lint|test|test-32bit)|cmake (--build )?--preset \w+|ctest --preset asan":
        "scripts/test",
    r"cmake --build --preset dev --target \w+|ctest --preset dev -[RN].*|build/dev/tests/unit/.*"
    r"|/usr/bin/python3 .*-m pytest .*":
        "scripts/test, which leaves nothing out; lint knows the names",
    r"scripts/demo\b.*": "test_demo, with and without --stay, and test_scenarios",
    r"([A-Z]+=\S+ )?scripts/(endure( (?!hours).*)?|fuzz\b.*)":
        "scripts/test in short; each takes minutes to hours",
    r"packaging/build-deb": "packaging/test-deb",
    r"upnpc -a": "bench/compare.py, with its arguments",
    r"pelorus-doctor .*--log .*": "scenarios with --log, scripts/history with --svg",
    r"pelorus -l \d|hdparm -C|kill -9": "scenarios, with all that belongs to it"}
NOT_RUN = {
    "chrt -r 1 bench/compare.py start": "takes minutes, and needs root",
    "bench/compare.py KIND...": "as below",
    "bench/pattern.py NAME...": "as below",
    "bench/compare.py": "takes a quarter of an hour; --help is run here",
    "bench/growth.py": "takes minutes; --help is run here",
    "bench/run [--quick] [WHAT...]": "takes minutes; --help is run here",
    "bench/run": "takes minutes; --help is run here",
    "bench/fleet.py": "takes a minute, and rewrites a page",
    "bench/pattern.py": "takes a quarter of an hour",
    "journalctl -t Pelorus -t pelorus -f": "does not end",
    "journalctl -u pelorus -f": "does not end",
    "journalctl -u pelorus": "docs/install.md has it with -n 50",
    "packaging/build-deb -aarm64": "takes minutes: run by hand",
    "packaging/test-deb": "needs root and control groups: run by hand",
    "packaging/test-deb --arch arm64": "takes minutes, and needs root: run by hand",
    "packaging/test-deb --stay": "needs somebody to look around",
    "packaging/test-deb [--arch arm64] [--stay]": "as above",
    "scripts/cross arm64": "needs what scripts/deps --cross makes",
    "scripts/cross arm64 COMMAND": "scripts/test-cross uses it",
    "scripts/diagnoses": "takes a quarter of an hour; --help is run here",
    "scripts/diagnoses [NAME...]": "test_scenarios asks the doctor as well; --help is run here",
    "scripts/endure hours 30 1": "takes 20 minutes at least",
    "scripts/gallery": "takes up to an hour; --help is run here",
    "scripts/gallery [NAME...]": "takes up to an hour; --help is run here",
    "scripts/history": "builds a debug program, and rewrites a picture",
    "scripts/lint --fix": "changes sources",
    "scripts/lint [--fix]": "changes sources",
    "scripts/matrix": "takes ten minutes and more",
    "scripts/test-cross": "takes ten minutes and more",
    "scripts/test-cross arm64": "takes ten minutes and more",
    "scripts/zoo": "takes up to an hour; --help is run here",
    "scripts/zoo NAME": "test_scenarios plays the rows without it",
    "scripts/zoo [ROW...]": "test_scenarios plays the rows without it",
    "systemctl enable --now pelorus": "the package's own scripts do this",
    "systemd-analyze security pelorus": "scripts/lint does, with --offline",
    "systemd-tmpfiles --create pelorus.conf": "the package's own scripts do this",
    "tail -f /var/log/syslog | grep -i pelorus": "needs a log daemon"}


def lines(blocks: list[str]) -> set[str]:
    return {re.sub(r"\s+# .*|(?<=\S)\s{3,}\w.*", "", line)
            for line in "".join(blocks).replace("\\\n", "").splitlines()}


def parts(found: set[str]) -> set[str]:
    return {part.strip() for command in found for part in command.split(" && ")}


def commands() -> list[str]:
    found = set()
    for page in PAGES:
        text = page.read_text()
        found |= lines(BLOCK.findall(text))
        spans = re.findall("`([^`]+)`", BLOCK.sub("", text))
        found |= {re.sub(r"\s+", " ", span) for span in spans if re.search("[ /]", span)}
    return sorted(part for part in parts(found) if COMMAND.fullmatch(part) and not is_data(part))


def is_data(text: str) -> bool:
    """Whether a text is the path of a folder, or of a file that is not run."""
    path = ROOT / text
    return path.exists() and not (path.is_file() and os.access(path, os.X_OK))


def installation() -> list[str]:
    """The blocks that the package's test runs."""
    return re.findall(r"^```sh\n(.*?)^```", (ROOT / "docs/install.md").read_text(), re.M | re.S)


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
        if "--install" in command and not (ROOT / "build/release/src/daemon/pelorus").exists():
            pytest.skip("the preset release is not built")
        subprocess.run(command, shell=True, check=True, cwd=ROOT, timeout=120,
                       env={**os.environ, "DESTDIR": str(tmp_path)})
    elif not ON_DEVICE.fullmatch(command) and command not in NOT_RUN:
        assert (command in parts(lines(installation()))
                or any(re.fullmatch(pattern, command) for pattern in ELSEWHERE)), "nobody runs it"


@pytest.mark.outside
def test_what_is_not_run_is_in_a_document() -> None:
    assert not NOT_RUN.keys() - set(commands())


@pytest.mark.outside
def test_the_package_test_runs_each_block_about_the_installation() -> None:
    source = (ROOT / "lab/installed.py").read_text()
    calls = re.findall(r"(?:_run_documented|_install)\((.*)\)|for command in \((.*)\):", source)
    words = re.findall('"(.+?)"', "\n".join("".join(call) for call in calls))
    assert words
    for block in installation():
        assert any(word in block for word in words), block


def test_commands_on_the_device() -> None:
    lab = Lab(Situation(gateway=GatewaySetup(upnp=True, natpmp=True)), Timeline())
    lab.start_daemon("-l", "6")
    lab.wait_for(lambda: lab.device.status == "portforwarded", "the ports", 55)
    for program in (sandbox.binary(), sandbox.doctor()):
        (HOME / "bin" / program.name).symlink_to(program)
    shutil.copy("/bin/sleep", HOME / "bin/openvpn")
    subprocess.Popen([HOME / "bin/openvpn", "600"])  # ends with the sandbox
    ends = "pelorus -u"
    # What ends the daemon comes last.
    for command in sorted(filter(ON_DEVICE.fullmatch, commands()),
                          key=lambda command: command.startswith(ends)):
        if command.startswith(ends) and not lab.daemon.ended():
            assert lab.stop_daemon(signal.SIGKILL) == "SIGKILL" and lab.gateway.mappings()
        argv = network.command(network.DEVICE, "env", f"PATH={PATH}",
                               f"TAVIK_STATIC_CONFIG={STATIC_FILE}", "sh", "-c", command)
        done = subprocess.run(argv, capture_output=True, text=True, check=False)
        assert done.returncode == 0, f"{command}: {done.stderr}"
        assert done.stdout or re.match("touch|pelorus", command), command
    wait_until(lambda: not lab.gateway.mappings(), "the mappings to be removed", 55)
