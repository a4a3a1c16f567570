"""Shows the daemon at work on this machine, in a lab of its own.

Without a name: the main job at real speed, a device behind a home router becomes reachable.
With a name: that scenario, with the device's clock sped up and the results checked.
"""

from __future__ import annotations

import argparse
import os
import select
import signal
import subprocess
import sys
import traceback
from collections.abc import Callable
from contextlib import nullcontext

from lab import doctor, network, picture, sandbox, web
from lab.device import DYNAMIC_FILE, HOME
from lab.gateway import GatewaySetup
from lab.relay import TUNNEL_DEVICE
from lab.scenario import Lab, Situation
from lab.scenarios import SCENARIOS
from lab.support import LabError
from lab.timeline import Timeline
from lab.zoo import ZOO

_PATIENCE = 55
_INTERRUPTED = 130
_PICTURE = "PELORUS_LAB_PICTURE"
_KNOWN = {**SCENARIOS, **ZOO}
_MAIN_JOB = Situation(gateway=GatewaySetup(upnp=True, natpmp=True))


def main() -> int:
    """Outside a sandbox: build the daemon and open one. Inside: play the demo."""
    arguments = _parse()
    if arguments.list or arguments.zoo:
        signal.signal(signal.SIGPIPE, signal.SIG_DFL)  # a reader may want the first lines only
        shown = ZOO if arguments.zoo else SCENARIOS
        width = max(map(len, shown))
        for scenario in shown.values():
            print(f"{scenario.name:<{width}}  {scenario.title}")
        return 0
    if sandbox.is_inside():
        return _show(arguments.scenario, _guest(arguments))
    if reason := obstacle(arguments.scenario):
        print(f"demo: {reason}")
        return sandbox.FORBIDDEN
    if "PELORUS" not in os.environ and not build():
        return 1
    status = run(sys.argv[1:], arguments.svg).returncode
    return status if status >= 0 else 128 - status


def _parse() -> argparse.Namespace:
    parser = argparse.ArgumentParser(prog="scripts/demo", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("scenario", nargs="?", metavar="SCENARIO",
                        help="a name from --list or --zoo")
    parser.add_argument("--list", action="store_true", help="list the scenarios, one per line")
    parser.add_argument("--zoo", action="store_true",
                        help="list the behaviours of home gateways, one per line")
    parser.add_argument("--svg", metavar="FILE", help="save the timeline as an SVG picture")
    guest = parser.add_mutually_exclusive_group()
    guest.add_argument("--stay", action="store_true",
                       help="keep the lab as it is in the story's telling moment, with the daemon "
                       "running, until Enter or Ctrl-C")
    guest.add_argument("--diagnose", action="store_true",
                       help="end in the story's telling moment, with what pelorus-doctor says")
    arguments = parser.parse_args()
    if arguments.scenario and arguments.scenario not in _KNOWN:
        parser.error(f"no scenario {arguments.scenario!r}; see --list and --zoo")
    return arguments


def run(options: list[str], svg: str | None,
        capture: bool = False) -> subprocess.CompletedProcess[str]:
    """Play a demo in a sandbox of its own, and save its picture if a file is named."""
    kept: tuple[int, ...] = ()
    if svg:
        kept = (os.open(svg, os.O_WRONLY | os.O_CREAT | os.O_TRUNC, 0o666),)
        os.environ[_PICTURE] = str(kept[0])
    try:
        return sandbox.run("lab.demo", options, capture=capture, keep_open=kept)
    finally:
        for descriptor in kept:
            os.close(descriptor)
            del os.environ[_PICTURE]


def obstacle(name: str | None) -> str:
    """Why this machine cannot play it; empty when it can."""
    reason = sandbox.why_forbidden()
    if reason:
        return f"this machine does not allow network namespaces ({reason})"
    if name and _KNOWN[name].situation.relay and not TUNNEL_DEVICE.exists():
        return f"{name} needs a tunnel, and there is no {TUNNEL_DEVICE}"
    return ""


def build() -> bool:
    """Build the release preset; its output is shown only when it fails."""
    print("building pelorus (release)", flush=True)
    for argv in (["cmake", "--preset", "release"], ["cmake", "--build", "--preset", "release"]):
        done = subprocess.run(argv, cwd=sandbox.PROJECT, stdout=subprocess.PIPE,
                              stderr=subprocess.STDOUT, text=True, check=False)
        if done.returncode != 0:
            print(f"{done.stdout}\ndemo: {' '.join(argv)} failed", file=sys.stderr)
            return False
    return True


class _Left(Exception):
    """The visitor of a story's telling moment has left the lab."""


_Guest = Callable[[Lab, str, float], None]  # of that moment: what is special, and its clock


def _guest(arguments: argparse.Namespace) -> _Guest | None:
    if arguments.stay:
        return _look_around
    return _diagnose if arguments.diagnose else None


def _show(name: str | None, guest: _Guest | None) -> int:
    """Play in the sandbox, printing events as they happen."""
    signal.signal(signal.SIGINT, signal.default_int_handler)
    timeline = Timeline()
    timeline.listen(lambda event: print(event, flush=True))
    title = _KNOWN[name].title if name else "A device behind a home router becomes reachable"
    print(f"{title}\n")
    try:
        _play(name, timeline, title, guest)
    except _Left:
        if guest is _look_around:
            print("\nthe lab has been removed")
    except (LabError, AssertionError) as failure:
        print(f"\nFAILED: {failure or 'a check did not hold'}")
        return 1
    except KeyboardInterrupt:
        print("\ninterrupted, the lab has been removed")
        return _INTERRUPTED
    finally:
        _save_picture(title, timeline, _KNOWN[name].situation if name else _MAIN_JOB)
    return 0


def _play(name: str | None, timeline: Timeline, title: str, guest: _Guest | None) -> None:
    """Play a story; with a guest only up to its telling moment. _Left after that."""
    story: Callable[[Lab], None] = _KNOWN[name].play if name else _reach_the_device
    lab = Lab(_KNOWN[name].situation if name else _MAIN_JOB, timeline)
    left: list[_Left] = []

    def visit(what: str, ahead: float = 0) -> None:
        assert guest
        guest(lab, what or title, ahead)
        left.append(_Left())
        raise left[0]

    if guest:
        lab.visit_by(visit, first_stop=not (name and _KNOWN[name].tells_moment))
    timeline.add("lab", "device, gateway, central service and name server are up")
    try:
        story(lab)
    except (LabError, AssertionError):
        if left:  # what the story does on its way out does not matter any more
            raise left[0] from None
        print(lab.report())
        print(f"\n{traceback.format_exc(limit=-2)}")
        raise
    if name:
        print("\nall checks passed")
    if guest:
        visit("")


def _save_picture(title: str, timeline: Timeline, situation: Situation) -> None:
    """Write the timeline to the file that was opened outside the sandbox."""
    if _PICTURE in os.environ:
        with os.fdopen(int(os.environ[_PICTURE]), "w") as file:
            file.write(picture.svg(title, timeline.events, situation))


def _reach_the_device(lab: Lab) -> None:
    lab.start_daemon("-l", "7", "-f", "30")
    lab.wait_for(lambda: lab.device.status == "portforwarded",
                 "the device to be port forwarded", _PATIENCE)
    _close(lab)


def _close(lab: Lab) -> None:
    """Print the result from every side; fail unless the service really reached the device."""
    record = lab.central.record
    if record is None or not any(test.passed(lab.account) for test in lab.central.port_tests):
        raise LabError("the status says portforwarded, but the central service did not get through")
    urls = [f"http://{record.external_ip}:{record.http_port}/",
            f"https://{record.external_ip}:{record.https_port}/"]
    print(f"\nstatus          {lab.device.status}")
    for url in urls:
        page = web.fetch(network.INTERNET, url)
        if page is None:
            raise LabError(f"nothing answers at {url}")
        print(f"external URL    {url}  says \"{page}\"")
    for mapping in lab.gateway.mappings():
        print(f"gateway rule    {mapping}")
    print(f"central record  {record.external_ip}, HTTP {record.http_port}, "
          f"HTTPS {record.https_port}, device at {record.local_ip}")
    for name in lab.account.names:
        print(f"public name     {name} -> {lab.names.resolve(name)}")


def _diagnose(lab: Lab, special: str, ahead: float) -> None:
    """Tell what is special now, and print what the doctor says to the device's owner."""
    print(f"\n{special[:1].upper()}{special[1:]}\n\n$ pelorus-doctor", flush=True)
    with lab.daemon.held() if not lab.daemon.ended() else nullcontext():
        doctor.show(lab.device.messages, ahead)


def _look_around(lab: Lab, special: str, _ahead: float) -> None:
    """Tell what is special now and how to enter the lab, and wait for Enter or Ctrl-C."""
    if lab.daemon.ended():
        state = f"ended with {lab.daemon.ended()}"
    else:
        os.kill(lab.daemon.pid, signal.SIGCONT)  # the story may be holding it
        state = f"pelorus is running, status {lab.device.status or '(none)'}"
    enter = (f"nsenter --preserve-credentials -U -m -n -p -u -t {sandbox.pid_outside()} "
             "ip netns exec")
    try:
        print(f"""
The lab stays like this until Enter or Ctrl-C, and events go on to be printed.
  what is special         {special}
  the daemon              {state}
  the clock               {picture.clock(lab.situation)}

From another terminal, as the same user:
  a shell on the device   {enter} {network.DEVICE} sh
  the device's log        {enter} {network.DEVICE} tail -n 50 -f {HOME}/messages
  the device's settings   {enter} {network.DEVICE} cat {DYNAMIC_FILE}
  the gateway's rules     {enter} {network.GATEWAY} nft list ruleset
  the view from outside   {enter} {network.INTERNET} sh
""", flush=True)
        sources = [sys.stdin] if sys.stdin else []
        while True:
            # Short waits: a signal just before one does not end it.
            if select.select(sources, [], [], 1)[0]:
                if sys.stdin.readline():
                    return
                sources = []  # at its end, as without a terminal
    except KeyboardInterrupt:
        pass


if __name__ == "__main__":
    try:
        sys.exit(main())
    except KeyboardInterrupt:
        sys.exit(_INTERRUPTED)
