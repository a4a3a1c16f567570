"""Gateways that look mappings up, list and delete them in a way of their own."""

from __future__ import annotations

from dataclasses import replace

from lab import network
from lab.gateway import GatewaySetup
from lab.packet_filter import Mapping
from lab.scripted_gateway import Answer, Call, Entry, Personality, numbered
from lab.zoo.hooks import CallHook, controlled, recoding
from lab.zoo.row import LEFT_BEHIND, NOTHING, TEST_FAILED, Row

_LIST, _LOOKUP, _DELETE = ("GetGenericPortMappingEntry", "GetSpecificPortMappingEntry",
                           "DeletePortMapping")
_CLEAN_UP = "delete mappings that are left behind when remote access is switched off for good"
_NOT_IN_ARRAY, _NOT_MAPPED = 713, 714
_PLACE_HOLDER = {"NewInternalPort": "0", "NewInternalClient": "", "NewEnabled": "0",
                 "NewPortMappingDescription": "", "NewLeaseDuration": "0"}


def _shifted(call: Call) -> Call:
    """The same call, for the entry before."""
    index = int(call.arguments["NewPortMappingIndex"]) - 1
    return replace(call, arguments={**call.arguments, "NewPortMappingIndex": str(index)})


def _is_first(call: Call) -> bool:
    return call.arguments["NewPortMappingIndex"] == "0"


def _with_place_holders(call: Call) -> Answer:
    if call.action == _LIST:
        if not _is_first(call):
            return _shifted(call).perform()
        return 0, {"NewRemoteHost": "", "NewExternalPort": "0", "NewProtocol": "TCP",
                   **_PLACE_HOLDER}
    answer = call.perform()
    return (0, _PLACE_HOLDER) if answer == (_NOT_MAPPED, {}) else answer


def _from_one(call: Call) -> Answer:
    if call.action != _LIST:
        return call.perform()
    return (_NOT_IN_ARRAY, {}) if _is_first(call) else _shifted(call).perform()


def _same_for_ever(call: Call) -> Answer:
    if call.action != _LIST:
        return call.perform()
    return numbered(Entry(Mapping("TCP", 7002, network.NEIGHBOUR_ADDRESS, 7002), "other"))


def _newest_first(call: Call) -> Answer:
    if call.action == _LIST:
        entries = list(call.gateway.table.values())[::-1]
        index = int(call.arguments["NewPortMappingIndex"])
        return numbered(entries[index]) if index < len(entries) else (_NOT_IN_ARRAY, {})
    return call.perform()


def _describing(length: int) -> CallHook:
    """Keep only so much of a description."""

    def described(call: Call) -> Answer:
        if call.action != "AddPortMapping":
            return call.perform()
        cut = call.arguments["NewPortMappingDescription"][:length]
        return replace(call, arguments={**call.arguments,
                                        "NewPortMappingDescription": cut}).perform()

    return described


def _never_deleting(call: Call) -> Answer:
    return (0, {}) if call.action == _DELETE else call.perform()


ROWS = (
    Row("L1", "Says 402, 501 or 606 when asked for a mapping that nobody has",
        controlled(recoding(_LOOKUP, 402, 501, 606)), NOTHING),
    Row("L2", "Ends its list of mappings with 402, 501, 606, 714 or 401",
        controlled(recoding(_LIST, 402, 501, 606, 714, 401)), NOTHING),
    Row("L2b", "Has no list of mappings (401)",
        GatewaySetup(personality=Personality(errors={_LIST: 401})), _CLEAN_UP, left=LEFT_BEHIND),
    Row("L3", "Place-holders in the list and instead of mappings that nobody has",
        controlled(_with_place_holders), NOTHING, requests=100),
    Row("L4", "Its list of mappings begins at 1", controlled(_from_one), _CLEAN_UP,
        left=LEFT_BEHIND),
    Row("L5", "Its list of mappings is the same one without end", controlled(_same_for_ever),
        _CLEAN_UP, left=LEFT_BEHIND, seconds=300, longest=300, requests=35_000),
    Row("L6", "Lists the newest mapping first", controlled(_newest_first), NOTHING),
    Row("L7", "Keeps no descriptions", controlled(_describing(0)), _CLEAN_UP, left=LEFT_BEHIND),
    Row("L7b", "Keeps three letters of a description", controlled(_describing(3)), _CLEAN_UP,
        left=LEFT_BEHIND),
    Row("L8", "Says that it has deleted a mapping, and keeps it", controlled(_never_deleting),
        _CLEAN_UP, left=LEFT_BEHIND),
    Row("L9", "Lets another computer delete the device's mapping", GatewaySetup(secure=False),
        NOTHING, why=TEST_FAILED, between={1: lambda lab: lab.neighbour.delete(9091)}),
)
