"""Runs a command in a namespace where programs for another processor run too, under qemu.

Since Linux 6.7 each user namespace can have a table of its own for foreign programs (binfmt_misc),
so the machine's stays as it is, and nothing is left afterwards. Files keep their owners: the
namespace has the machine's users.
"""

from __future__ import annotations

import argparse
import ctypes
import os
import sys
from pathlib import Path

from lab import sandbox
from lab.support import LabError, run_tool

_CLONE_NEWNS = 0x00020000
_CLONE_NEWUSER = 0x10000000
_PROCESSORS = {"arm64": "aarch64", "armhf": "arm"}
_BINFMT = Path("/proc/sys/fs/binfmt_misc")


def _enter_namespace() -> None:
    """Move this process to new user and mount namespaces with the same users."""
    number = os.getpid()
    entered, enter = os.pipe()
    child = os.fork()
    if child == 0:
        # Only a process outside may map more than one user.
        os.close(enter)
        os.read(entered, 1)
        try:
            for kind in ("uid_map", "gid_map"):
                Path(f"/proc/{number}/{kind}").write_text("0 0 65536")
        except OSError:
            os._exit(1)
        os._exit(0)
    libc = ctypes.CDLL(None, use_errno=True)
    if libc.unshare(_CLONE_NEWUSER | _CLONE_NEWNS) != 0:
        raise LabError(f"unshare: {os.strerror(ctypes.get_errno())}")
    os.close(enter)
    if os.waitpid(child, 0)[1] != 0:
        raise LabError("no permission to map users; needs root")


def _register(architecture: str) -> None:
    """Have the kernel run the architecture's programs through qemu, in any root."""
    rule = Path(f"/usr/lib/binfmt.d/qemu-{_PROCESSORS[architecture]}.conf").read_text()
    run_tool("mount", "-t", "binfmt_misc", "binfmt_misc", str(_BINFMT))
    (_BINFMT / "register").write_text(rule)


def main() -> int:
    """Become the command; `sandbox.FORBIDDEN` where this machine cannot."""
    parser = argparse.ArgumentParser(prog="lab.foreign", description=__doc__)
    parser.add_argument("architecture", choices=_PROCESSORS)
    parser.add_argument("command", nargs=argparse.REMAINDER)
    arguments = parser.parse_args()
    try:
        _enter_namespace()
        _register(arguments.architecture)
    except (LabError, OSError) as failure:
        print(f"programs for {arguments.architecture} cannot run here: {failure}")
        return sandbox.FORBIDDEN
    os.execvp(arguments.command[0], arguments.command)


if __name__ == "__main__":
    sys.exit(main())
