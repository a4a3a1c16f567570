"""The home router's packet filter: what it forwards and for whom, and what the lab adds to it."""

from __future__ import annotations

import socket
from collections.abc import Callable
from dataclasses import dataclass
from typing import Any

from lab import network, nft

_PROTOCOLS = {6: "TCP", 17: "UDP"}
# miniupnpd compares protocol and target as raw bits of the IPv4 header, at these offsets.
_PROTOCOL_BIT, _TARGET_BIT = 72, 128

# Closed towards the internet except for what a mapping or the user opens. The table "lab" is not
# part of the router: it counts the device's requests to the router and makes the router fail.
_RULES = f"""
table inet gate {{
    chain miniupnpd {{ }}
    chain by_hand {{ }}
    chain forward {{
        type filter hook forward priority 0; policy drop;
        ct state established,related accept
        iifname "lan" accept
        jump by_hand
        jump miniupnpd
    }}
    chain input {{
        type filter hook input priority 0; policy accept;
        iifname "wan" ct state new drop
    }}
    chain prerouting_miniupnpd {{ }}
    chain prerouting_by_hand {{ }}
    chain postrouting_miniupnpd {{ }}
    chain prerouting {{
        type nat hook prerouting priority -100;
        jump prerouting_by_hand
        jump prerouting_miniupnpd
    }}
    chain postrouting {{
        type nat hook postrouting priority 100;
        jump postrouting_miniupnpd
        oifname "wan" masquerade
    }}
}}
table inet lab {{
    counter upnp {{ }}
    counter natpmp {{ }}
    set blocked {{ type inet_service; }}
    chain blocking {{
        type filter hook prerouting priority raw;
        iifname "wan" meta l4proto {{ tcp, udp }} th dport @blocked drop
    }}
    chain silence {{ }}
    chain asking {{
        type filter hook input priority -10;
        iifname != "lan" accept
        ip saddr != {network.NEIGHBOUR_ADDRESS} meta l4proto tcp ct state new counter name upnp
        ip saddr != {network.NEIGHBOUR_ADDRESS} udp dport 5351 counter name natpmp
        jump silence
    }}
}}
"""


@dataclass(frozen=True, order=True)
class Mapping:
    """One forwarding as the router's packet filter holds it."""

    protocol: str
    external_port: int
    internal_address: str
    internal_port: int

    def __str__(self) -> str:
        return (f"{self.protocol} {self.external_port} -> "
                f"{self.internal_address}:{self.internal_port}")


@dataclass(frozen=True)
class Chains:
    """The two chains of one source of forwardings: one redirects packets, the other admits them."""

    redirect: str
    admit: str


ASKED_FOR = Chains("prerouting_miniupnpd", "miniupnpd")
BY_HAND = Chains("prerouting_by_hand", "by_hand")


def change(rules: str) -> None:
    """Apply rules to the router's packet filter."""
    nft.change(network.GATEWAY, rules)


def load() -> None:
    """Load the router's rules, with nothing forwarded yet."""
    change(_RULES)


def mappings(chains: Chains = ASKED_FOR) -> list[Mapping]:
    """The forwardings in force."""
    return sorted(_mapping(rule["expr"]) for rule in _rules(chains.redirect))


def forward(mapping: Mapping, chains: Chains = ASKED_FOR) -> None:
    """Add a forwarding, with rules that miniupnpd takes for its own."""
    number = {name: number for number, name in _PROTOCOLS.items()}[mapping.protocol]
    protocol = f'iif "wan" meta l4proto {number} @nh,{_PROTOCOL_BIT},8 {number}'
    change(f"add rule inet gate {chains.redirect} {protocol} th dport {mapping.external_port} "
           f"dnat ip to {mapping.internal_address}:{mapping.internal_port}\n"
           f"add rule inet gate {chains.admit} {protocol} th dport {mapping.internal_port} "
           f"@nh,{_TARGET_BIT},32 {_number(mapping.internal_address)} accept\n")


def remove(mapping: Mapping) -> None:
    """Delete both rules of a forwarding that a client requested."""
    let_in = {_PROTOCOL_BIT: mapping.protocol, "dport": mapping.internal_port,
              _TARGET_BIT: _number(mapping.internal_address)}
    unwanted = [rule for rule in _rules(ASKED_FOR.redirect) if _mapping(rule["expr"]) == mapping]
    unwanted += [rule for rule in _rules(ASKED_FOR.admit) if _compared(rule["expr"]) == let_in]
    change("".join(f"delete rule inet gate {rule['chain']} handle {rule['handle']}\n"
                   for rule in unwanted))


def flush(chains: Chains) -> None:
    """Delete every forwarding of one source."""
    change(f"flush chain inet gate {chains.redirect}\nflush chain inet gate {chains.admit}\n")


def counted(name: str) -> int:
    """The packets that one of the lab's counters saw."""
    found = nft.listed(network.GATEWAY, "counter", "inet", "lab", name)
    return int(found[-1]["counter"]["packets"])


def watch(tell: Callable[[str, Mapping], None]) -> None:
    """Call `tell` with "add" or "delete" for each forwarding that changes; never returns."""
    for verb, subject in nft.monitor(network.GATEWAY, "rules"):
        rule = subject.get("rule", {})
        if verb in ("add", "delete") and rule.get("chain") == ASKED_FOR.redirect:
            tell(verb, _mapping(rule["expr"]))


def _rules(chain: str) -> list[nft.Object]:
    listed = nft.listed(network.GATEWAY, "chain", "inet", "gate", chain)
    return [entry["rule"] for entry in listed if "rule" in entry]


def _compared(expressions: list[nft.Object]) -> dict[str | int, Any]:
    """The values a rule matches, by the name of the header field or its bit offset."""
    found: dict[str | int, Any] = {}
    for expression in expressions:
        match = expression.get("match", {})
        payload = match.get("left", {}).get("payload")
        if payload:
            found[payload.get("field", payload.get("offset"))] = match["right"]
    found[_PROTOCOL_BIT] = _PROTOCOLS[found[_PROTOCOL_BIT]]
    return found


def _mapping(expressions: list[nft.Object]) -> Mapping:
    fields = _compared(expressions)
    target = next(part["dnat"] for part in expressions if "dnat" in part)
    return Mapping(fields[_PROTOCOL_BIT], fields["dport"], target["addr"], target["port"])


def _number(address: str) -> int:
    return int.from_bytes(socket.inet_aton(address), "big")
