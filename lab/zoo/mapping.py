"""Gateways with rules of their own for adding a mapping."""

from __future__ import annotations

from lab import network, packet_filter, web
from lab.gateway import NO_PORT, STOCK_PERMISSIONS, GatewaySetup
from lab.packet_filter import Mapping
from lab.scenario import Lab
from lab.scripted_gateway import Answer, Call, Personality
from lab.zoo.events import Event, all_of, go_offline, go_online, keep, lose, reload_firewall
from lab.zoo.discovery import version_2
from lab.zoo.hooks import CallHook, adding, controlled, refusing
from lab.zoo.met import leased, not_provoked
from lab.zoo.row import (BY_HAND, LEFT_BEHIND, NO_MAPPING, NOTHING, PERMANENT, RELAYED, TEST_FAILED,
                         Row)

_INVALID_ARGUMENTS, _ACTION_FAILED, _NOT_AUTHORIZED = 402, 501, 606
_CONFLICT, _SAME_PORTS, _ONLY_PERMANENT, _FULL = 718, 724, 725, 728
_OLD = Mapping("TCP", 9095, network.DEVICE_ADDRESS, 80)
_TIDY = "delete mappings on the gateway, or "
_OLDER = Mapping("TCP", 8080, network.DEVICE_ADDRESS, 80)


def _refused(error: int) -> GatewaySetup:
    return GatewaySetup(personality=Personality(errors={"AddPortMapping": error}))


def _has_lease(call: Call) -> bool:
    return call.arguments["NewLeaseDuration"] not in ("", "0")


def _ports_differ(call: Call) -> bool:
    return call.arguments["NewExternalPort"] != call.arguments["NewInternalPort"]


def _internal_port_has_one(call: Call) -> bool:
    wanted = (call.arguments["NewInternalClient"], call.arguments["NewInternalPort"])
    return any((held.mapping.internal_address, str(held.mapping.internal_port)) == wanted
               and str(held.mapping.external_port) != call.arguments["NewExternalPort"]
               for held in call.gateway.table.values())


def _holding(entries: int, error: int) -> GatewaySetup:
    """Refuse a mapping beyond so many."""
    return controlled(adding(refusing(error, lambda call: len(call.gateway.table) >= entries)))


def silently_full(entries: int) -> CallHook:
    """Accept only permanent mappings, and those without an effect beyond so many."""

    def added(call: Call) -> Answer:
        if _has_lease(call):
            return _ONLY_PERMANENT, {}
        return (0, {}) if len(call.gateway.table) >= entries else call.perform()

    return adding(added)


def _accepted(_call: Call) -> Answer:
    return 0, {}


def _unseen(port: int) -> CallHook:
    """Say that nobody has this port, and grant it without an effect."""

    def answered(call: Call) -> Answer:
        if call.arguments.get("NewExternalPort") != str(port):
            return call.perform()
        if call.action == "GetSpecificPortMappingEntry":
            return 714, {}
        return (0, {}) if call.action == "AddPortMapping" else (_NOT_AUTHORIZED, {})

    return answered


def _two_networks(lab: Lab) -> None:
    """The device has an address of another network first, and asks from its second one."""
    network.ip_batch("address flush dev eth0", "address add 10.9.8.7/24 dev eth0",
                     f"address add {network.DEVICE_ADDRESS}/24 dev eth0",
                     f"route add default via {lab.gateway.lan_address}", host=network.DEVICE)


def _use_9091(lab: Lab) -> None:
    web.WebServer(network.GATEWAY, lab.gateway.wan_address, 9091, lambda _: web.Reply(b"router"))


def _never(name: str, title: str, gateway: GatewaySetup, advice: str = "",
           left: tuple[Mapping, ...] = (), between: dict[int, Event] | None = None,
           status: int = 0) -> Row:
    """A gateway that refuses every port, so that all of them are tried in each cycle."""
    why = f"to internal port: 80, status: {status}" if status else NO_MAPPING
    return Row(name, title, gateway, advice + BY_HAND, RELAYED, why, seconds=60, requests=5000,
               left=left, between=between or {})


ROWS = (
    Row("P1", "Accepts only permanent mappings (725)",
        controlled(adding(refusing(_ONLY_PERMANENT, _has_lease))), PERMANENT, played=not_provoked),
    Row("P2", "Accepts only permanent mappings (402)",
        controlled(adding(refusing(_INVALID_ARGUMENTS, _has_lease))), PERMANENT,
        played=not_provoked),
    _never("P3", "Refuses permanent mappings (402)",
           controlled(adding(refusing(_INVALID_ARGUMENTS, lambda call: not _has_lease(call))))),
    Row("P4", "Accepts mappings with a lease without doing anything",
        controlled(adding(lambda call: (0, {}) if _has_lease(call) else call.perform())), PERMANENT,
        played=not_provoked),
    Row("P5", "Gives every mapping a lease of a week", GatewaySetup(), NOTHING,
        played=leased(forever=False)),
    Row("P5b", "Drops mappings after some minutes, whatever it granted", GatewaySetup(), NOTHING,
        why=TEST_FAILED, between={1: lose(9091, 9444)}),
    _never("P6", "Refuses mappings to an address other than the sender's; the device has two (718)",
           GatewaySetup(), between={0: _two_networks}, status=_CONFLICT),
    Row("P7", "Allows one mapping for each internal port (718)",
        controlled(adding(refusing(_CONFLICT, _internal_port_has_one))), NOTHING,
        played=not_provoked),
    Row("P7b", "Allows one mapping for each internal port (718); an old one is at 9095",
        controlled(adding(refusing(_CONFLICT, _internal_port_has_one))), NOTHING, requests=85,
        between={0: keep(_OLD)}),
    _never("P7c", "Allows one mapping for each internal port (718); an old one is at 8080",
           controlled(adding(refusing(_CONFLICT, _internal_port_has_one))), left=(_OLDER,),
           between={0: keep(_OLDER)}, status=_CONFLICT),
    _never("P8", "Is not to be changed by the device (606)", GatewaySetup(permissions=NO_PORT),
           "allow the device to change settings, or ", status=606),
    _never("P9", "Refuses every mapping (501)", _refused(_ACTION_FAILED)),
    _never("P9b", "Refuses every mapping with a number that nobody knows (-911)", _refused(-911)),
    _never("P10", "Refuses internal ports below 1024",
           GatewaySetup(permissions=STOCK_PERMISSIONS),
           "move the web server above port 1023, allow its ports in the gateway, or ", status=606),
    Row("P11", "Uses port 9091 itself (729)", GatewaySetup(), NOTHING, requests=70,
        why="external port: 9091, to internal port: 80, status: 729", between={0: _use_9091}),
    _never("P12", "Wants the same port outside and inside (724)",
           controlled(adding(refusing(_SAME_PORTS, _ports_differ)))),
    _never("P13", "Has no room for another mapping (728)", _holding(1, _FULL), _TIDY),
    _never("P13b", "Has room for only one more mapping (728)", _holding(2, _FULL), _TIDY),
    _never("P13c", "Has no room for another mapping (501)", _holding(1, _ACTION_FAILED), _TIDY),
    _never("P13d", "Has no room for another mapping (402)", _holding(1, _INVALID_ARGUMENTS), _TIDY),
    Row("P14", "Accepts and lists mappings, but does not forward", GatewaySetup(), BY_HAND,
        RELAYED, TEST_FAILED, requests=200, longest=150, seconds=150,
        between={0: lambda _: packet_filter.change("flush chain inet gate prerouting\n")}),
    Row("P14b", "Accepts mappings without doing anything", controlled(adding(_accepted)), BY_HAND,
        RELAYED, TEST_FAILED, requests=200, longest=150, seconds=150),
    Row("P15", "Lists mappings that it no longer forwards",
        GatewaySetup(), NOTHING, why=TEST_FAILED, requests=70,
        between={1: reload_firewall}),
    Row("P16", "Accepts a port that the owner has forwarded to another computer", GatewaySetup(),
        NOTHING, why=TEST_FAILED, requests=75, seconds=35,
        between={0: lambda lab: lab.gateway.forward_by_hand(9091, 80,
                                                            network.NEIGHBOUR_ADDRESS)}),
    Row("P16b", "Accepts a port that another computer has mapped, and does not tell",
        controlled(_unseen(9091)), NOTHING, why=TEST_FAILED, requests=75,
        seconds=35, between={0: keep(Mapping("TCP", 9091, network.NEIGHBOUR_ADDRESS, 7001))},
        left=(Mapping("TCP", 9091, network.NEIGHBOUR_ADDRESS, 7001),)),
    Row("P17", "Protects mappings of the device's former address from the device",
        GatewaySetup(), "delete mappings that are left behind", left=LEFT_BEHIND, requests=80,
        between={1: lambda lab: lab.device.move_to("192.168.77.30")}),
    _never("P18", "Refuses every mapping (501) after its internet line was down",
           GatewaySetup(personality=Personality()),
           between={1: all_of(go_offline, go_online, lose(), lambda lab: lab.gateway.behave(
               Personality(errors={"AddPortMapping": _ACTION_FAILED})))}, status=_ACTION_FAILED),
    Row("P19", "The port in use dies; mappings that nobody deletes would pile up", GatewaySetup(),
        NOTHING, why=TEST_FAILED, requests=80, between={1: lambda lab: lab.gateway.block(9091)}),
    Row("P20", "Version 2, with an action that picks the port itself",
        GatewaySetup(personality=Personality(describe=version_2)),
        "nothing: the device picks the port", played=not_provoked),
)
