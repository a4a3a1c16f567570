"""Hooks for personalities that several rows share. Times are seconds of the device."""

from __future__ import annotations

import itertools
import time
from collections.abc import Callable, Iterable

from lab.gateway import GatewaySetup
from lab.scripted_gateway import Answer, Call, Page, Personality, Search
from lab.zoo.row import CLOCK

SearchHook = Callable[[Search], Iterable[bytes]]
CallHook = Callable[[Call], Answer]

MAPPING_CALLS = ("AddPortMapping", "DeletePortMapping", "GetSpecificPortMappingEntry",
                 "GetGenericPortMappingEntry")


def controlled(hook: CallHook) -> GatewaySetup:
    """A gateway that is good but for its answers to calls."""
    return GatewaySetup(personality=Personality(control=hook))


def wait(seconds: float) -> None:
    """Let so much of the device's time pass."""
    time.sleep(seconds / CLOCK)


def only(*targets: str) -> SearchHook:
    """Answer a search for these targets, and be silent to every other."""
    return lambda search: [search.answer()] if search.target in targets else []


def late(seconds: float, answer: SearchHook) -> SearchHook:
    """Answer a search so much later."""

    def answers(search: Search) -> Iterable[bytes]:
        wait(seconds)
        yield from answer(search)

    return answers


def telling(**values: str) -> CallHook:
    """Have these values in every answer that has values of these names."""

    def told(call: Call) -> Answer:
        answer = call.perform()
        if isinstance(answer, Page):
            return answer
        return answer[0], {name: values.get(name, value) for name, value in answer[1].items()}

    return told


def replying(page: Page, *actions: str) -> CallHook:
    """Answer these actions, or all, with a page, and do nothing."""
    return lambda call: page if not actions or call.action in actions else call.perform()


def refusing(error: int, when: Callable[[Call], bool]) -> CallHook:
    """Answer the calls for which `when` holds with an error, and do nothing."""
    return lambda call: (error, {}) if when(call) else call.perform()


def recoding(action: str, *errors: int) -> CallHook:
    """Refuse this action, where it must be refused, with these errors in turn."""
    turns = itertools.cycle(errors)

    def recoded(call: Call) -> Answer:
        answer = call.perform()
        if call.action != action or isinstance(answer, Page) or not answer[0]:
            return answer
        return next(turns), {}

    return recoded


def adding(hook: CallHook) -> CallHook:
    """Answer the requests for a mapping like this, and all others as a good gateway."""
    return lambda call: hook(call) if call.action == "AddPortMapping" else call.perform()
