"""Runs each system test in a sandbox of its own, so that several can run in parallel."""

from __future__ import annotations

import sys
from pathlib import Path

import pytest

sys.path.insert(0, str(Path(__file__).resolve().parents[2]))

pytest.register_assert_rewrite("lab.checks", "lab.scenarios", "lab.zoo")

from lab import sandbox  # noqa: E402

_LAST_RESORT_SECONDS = 240


def pytest_configure(config: pytest.Config) -> None:
    """Register the marker."""
    config.addinivalue_line("markers", "outside: runs outside a sandbox and starts its own")


@pytest.hookimpl(tryfirst=True)
def pytest_pyfunc_call(pyfuncitem: pytest.Function) -> bool | None:
    """Outside a sandbox, run the test with its own pytest as the first process of a new one."""
    if sandbox.is_inside():
        return None
    if reason := sandbox.why_forbidden():
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
