"""Gateways whose description or HTTP is not what it should be."""

from __future__ import annotations

import re
import time
from collections.abc import Callable, Iterable

from lab.gateway import GatewaySetup
from lab.scripted_gateway import (COMMON_SERVICE, IP_SERVICE, PPP_SERVICE, SERVICE, Answer, Call,
                                  Deliver, Page, Personality, whole)
from lab.zoo.events import restart
from lab.zoo.hooks import MAPPING_CALLS, CallHook, replying, wait
from lab.zoo.met import not_provoked
from lab.zoo.row import (BY_HAND, CLOCK, NO_ADDRESS, NO_MAPPING, NOTHING, RELAYED, TEST_FAILED,
                         Row)

_NO_SUCH_ACTION, _INVALID_ARGUMENTS, _ACTION_FAILED = 401, 402, 501
_EMPTY = Page("500 Internal Server Error", b"")
_OLD_SERVICE = "urn:dslforum-org:service:WANIPConnection:1"


def _scripted(personality: Personality) -> GatewaySetup:
    return GatewaySetup(personality=personality)


def _with_dead_service(text: str) -> str:
    dead = SERVICE.format(type=PPP_SERVICE, id="WANPPPConn1", control_url="/control")
    alive = SERVICE.format(type=IP_SERVICE, id="WANIPConn1", control_url="/control")
    assert alive in text
    return text.replace(alive, dead + alive)


def _dead_service(call: Call) -> Answer:
    if call.service != PPP_SERVICE:
        return call.perform()
    if call.action == "GetStatusInfo":
        return 0, {"NewConnectionStatus": "Disconnected"}
    return _ACTION_FAILED, {}


def _accepting(service: str) -> CallHook:
    return lambda call: call.perform() if call.service == service else (_NO_SUCH_ACTION, {})


def _spread(text: str) -> str:
    return re.sub("<serviceType>(.*)</serviceType>", r"<serviceType>\n\1\n</serviceType>", text)


def _without_common_service(text: str) -> str:
    common = SERVICE.format(type=COMMON_SERVICE, id="WANCommonIFC1", control_url="/common")
    assert common in text
    return text.replace(common, "")


def _corrupt(head: bytes, body: bytes) -> Iterable[bytes]:
    return whole(head, body.replace(b"refused", b"ref\xff\0\xfe*d<"))


def _unmeasured(head: bytes, body: bytes) -> Iterable[bytes]:
    yield head.replace(b"Content-Length", b"X-Length") + body
    wait(15)


def _saying(more: int) -> Deliver:
    """Say that there are so many bytes more than there are, and wait if the client does."""

    def delivered(head: bytes, body: bytes) -> Iterable[bytes]:
        yield head.replace(b"Length: %d" % len(body), b"Length: %d" % (len(body) + more)) + body
        wait(15 if more > 0 else 0)

    return delivered


def _chunked(head: bytes, body: bytes) -> Iterable[bytes]:
    lines = [line for line in head.splitlines(keepends=True) if b"Content-Length" not in line]
    yield b"".join(lines[:-1]) + b"Transfer-Encoding: chunked\r\n\r\n"
    for start in range(0, len(body), 7):
        piece = body[start:start + 7]
        yield b"%x\r\n%s\r\n" % (len(piece), piece)
    yield b"0\r\n\r\n"


def _drip(head: bytes, body: bytes) -> Iterable[bytes]:
    for letter in head + body:
        yield bytes([letter])
        wait(4)


def _tired(*actions: str) -> CallHook:
    """Refuse these actions, or all, less than 2 s after the end of the call before.

    Owners report 0.2 s; the lab on a busy machine could not tell that from a call in time.
    """
    last = 0.0

    def answered(call: Call) -> Answer:
        nonlocal last
        too_early = (time.monotonic() - last) * CLOCK < 2
        refused = too_early and (not actions or call.action in actions)
        answer = (_ACTION_FAILED, {}) if refused else call.perform()
        last = time.monotonic()
        return answer

    return answered


def _meets_every_wish(call: Call) -> bool:
    """What picky gateways want to see, but for the character set."""
    action, arguments = call.headers["SOAPAction"], call.arguments
    if call.action == "AddPortMapping" and not (
            "<NewRemoteHost>" in call.body and arguments["NewProtocol"].isupper()
            and arguments["NewPortMappingDescription"]):
        return False
    return (action[0] == action[-1] == '"' and ":" in call.headers["Host"]
            and " xmlns=" not in call.body and "&quot;" not in call.body)


def _picky(wish: Callable[[Call], bool]) -> CallHook:
    return lambda call: call.perform() if wish(call) else (_INVALID_ARGUMENTS, {})


ROWS = (
    Row("H1", "Restarts, and its description and control URL move to another port",
        GatewaySetup(), NOTHING, why="IGD found at: http://192.168.77.1:5004/",
        between={1: restart, 2: restart, 3: restart}),
    Row("H2", "The description names another port as the base of its URLs",
        _scripted(Personality(describe=lambda text: text.replace(
            "<device>", "<URLBase>http://192.168.77.1:5999/</URLBase><device>", 1))),
        BY_HAND, RELAYED, NO_ADDRESS),
    Row("H3", "The control URL is relative, without a leading slash, with a query",
        _scripted(Personality(control_url="UD/?9")), NOTHING),
    Row("H4", "Two connection services, and the first is dead",
        _scripted(Personality(describe=_with_dead_service, control=_dead_service)), NOTHING),
    Row("H5", "Describes `WANIPConnection:1`, but answers only calls to `WANPPPConnection:1`",
        _scripted(Personality(control=_accepting(PPP_SERVICE))), BY_HAND, RELAYED, NO_ADDRESS),
    Row("H6", "White space around the service types in its description",
        _scripted(Personality(describe=_spread)), BY_HAND, RELAYED, NO_ADDRESS),
    Row("H7", "Rubbish after the description, corrupt bytes in refusals",
        _scripted(Personality(describe=lambda text: f"{text}\0\0\0 </root> \xff\xfe",
                              deliver_control=_corrupt)), NOTHING),
    Row("H8", "The description lacks `WANCommonInterfaceConfig`",
        _scripted(Personality(describe=_without_common_service)), NOTHING),
    Row("H8b", "The description has a service type of old: `urn:dslforum-org:...`",
        _scripted(Personality(describe=lambda text: text.replace(IP_SERVICE, _OLD_SERVICE))),
        BY_HAND, RELAYED, NO_ADDRESS),
    Row("H9", "No Content-Length, and the connection stays open for 15 s",
        _scripted(Personality(deliver=_unmeasured, deliver_control=_unmeasured)), NOTHING,
        seconds=150, longest=150),
    Row("H9b", "Content-Length is too small by 20 bytes",
        _scripted(Personality(deliver=_saying(-20), deliver_control=_saying(-20))), NOTHING),
    Row("H9c", "Content-Length is too large by 20 bytes, and the connection stays open for 15 s",
        _scripted(Personality(deliver=_saying(20), deliver_control=_saying(20))), NOTHING,
        seconds=150, longest=150),
    Row("H10", "Chunked answers", _scripted(Personality(deliver=_chunked,
                                                        deliver_control=_chunked)), NOTHING),
    Row("H11", "Empty answers with status 500 to everything about mappings",
        _scripted(Personality(control=replying(_EMPTY, *MAPPING_CALLS))), BY_HAND, RELAYED,
        NO_MAPPING, seconds=60, requests=5000),
    Row("H11b", "Resets every connection to its control service",
        _scripted(Personality(control=replying(Page(body=None)))), BY_HAND, RELAYED, NO_ADDRESS),
    Row("H12", "Web pages (404) instead of answers about mappings",
        _scripted(Personality(control=replying(Page(), *MAPPING_CALLS))), BY_HAND, RELAYED,
        TEST_FAILED, seconds=165, longest=165, requests=120),
    Row("H12c", "A login page (200) instead of answers about mappings",
        _scripted(Personality(control=replying(Page("200 OK"), *MAPPING_CALLS))), BY_HAND, RELAYED,
        TEST_FAILED, seconds=165, longest=165, requests=120),
    Row("H12d", "Empty redirections (302) instead of answers about mappings",
        _scripted(Personality(control=replying(Page("302 Found", b""), *MAPPING_CALLS))), BY_HAND,
        RELAYED, NO_MAPPING, seconds=60, requests=5000),
    Row("H12b", "Web pages (404) instead of any answer of the control service",
        _scripted(Personality(control=replying(Page()))), BY_HAND, RELAYED, NO_ADDRESS),
    Row("H13", "Each answer takes 4 s", _scripted(Personality(delay=4 / CLOCK)), NOTHING,
        seconds=120, longest=120),
    Row("H13b", "Answers of the control service come at a byte every 4 s",
        _scripted(Personality(deliver_control=_drip)), BY_HAND, RELAYED, NO_ADDRESS, seconds=130,
        longest=130),
    Row("H14", "Refuses to add a mapping soon after another call",
        _scripted(Personality(control=_tired("AddPortMapping"))), BY_HAND, RELAYED, NO_MAPPING,
        seconds=65, longest=65, requests=5000),
    Row("H14b", "Refuses every call that comes soon after another",
        _scripted(Personality(control=_tired())), BY_HAND, RELAYED, NO_ADDRESS),
    Row("H15", "Picky about the request: quotes, upper case, a description, Host with port, ...",
        _scripted(Personality(control=_picky(_meets_every_wish))), NOTHING, played=not_provoked),
    Row("H15b", 'Picky about the request: refuses it without `charset="utf-8"`',
        _scripted(Personality(control=_picky(
            lambda call: 'charset="utf-8"' in call.headers["Content-Type"].lower()))),
        BY_HAND, RELAYED, NO_ADDRESS),
)
