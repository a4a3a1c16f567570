"""Runs each system test in a sandbox of its own, so that several can run in parallel."""

from __future__ import annotations

import sys
from collections.abc import Callable, Generator
from pathlib import Path
from typing import Any

import pytest

sys.path.insert(0, str(Path(__file__).resolve().parents[2]))

pytest.register_assert_rewrite("lab.checks", "lab.scenarios")

from lab import sandbox  # noqa: E402
from lab.scenario import Lab, Situation  # noqa: E402
from lab.timeline import Timeline  # noqa: E402

_LAST_RESORT_SECONDS = 240
_raised: list[Lab] = []


def pytest_configure(config: pytest.Config) -> None:
    """Register the marker."""
    config.addinivalue_line("markers", "outside: runs outside a sandbox and starts its own")


@pytest.hookimpl(tryfirst=True)
def pytest_pyfunc_call(pyfuncitem: pytest.Function) -> bool | None:
    """Outside a sandbox, run the test with its own pytest as the first process of a new one."""
    if sandbox.is_inside():
        return None
    reason = sandbox.why_forbidden()
    if reason:
        pytest.skip(f"this machine does not allow network namespaces ({reason})")
    if not sandbox.binary().exists():
        pytest.fail(f"{sandbox.binary()} does not exist; build it or set PELORUS", pytrace=False)
    if pyfuncitem.get_closest_marker("outside"):
        return None
    done = sandbox.run("pytest", ["-q", "--no-header", "-p", "no:cacheprovider",
                                  f"{pyfuncitem.path}::{pyfuncitem.name}"],
                       timeout=_LAST_RESORT_SECONDS, capture=True)
    if done.returncode != 0:
        pytest.fail(done.stdout, pytrace=False)
    return True


@pytest.fixture
def play() -> Callable[[Situation], Lab]:
    """Sets up the lab for a situation; its report is shown when the test fails."""

    def raised(situation: Situation) -> Lab:
        lab = Lab(situation, Timeline())
        _raised.append(lab)
        return lab

    return raised


@pytest.hookimpl(hookwrapper=True)
def pytest_runtest_makereport(item: pytest.Item) -> Generator[None, Any, None]:
    """Add the lab's own report to a failure."""
    outcome = yield
    report = outcome.get_result()
    if report.when == "call" and report.failed:
        report.sections += [("lab", lab.report()) for lab in _raised]
