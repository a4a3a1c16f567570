"""A zoo of home gateways: their behaviours as rows of data, by subject, and one player for all."""

from __future__ import annotations

from collections.abc import Callable

from lab.scenario import Lab, Situation
from lab.scenarios.registry import Scenario
from lab.zoo import bundles, description, discovery, lookup, mapping, natpmp, state, time
from lab.zoo.player import play
from lab.zoo.row import CLOCK, SHORT_PAUSES, Row

SUBJECTS: dict[str, tuple[Row, ...]] = {
    "Discovery": discovery.ROWS,
    "Description and HTTP": description.ROWS,
    "State and external address": state.ROWS,
    "Adding a mapping": mapping.ROWS,
    "Looking up, listing and deleting": lookup.ROWS,
    "Restarts and cleaning": time.ROWS,
    "NAT-PMP": natpmp.ROWS,
    "Several at once": bundles.ROWS,
}


def _player(row: Row) -> Callable[[Lab], None]:
    return lambda lab: lab.step(str(play(lab, row)))


def _scenario(row: Row) -> Scenario:
    return Scenario(f"zoo-{row.name}", row.title,
                    Situation(gateway=row.gateway, relay=True, clock=CLOCK, hasty=True,
                              pauses=SHORT_PAUSES), _player(row))


ROWS = {row.name: row for rows in SUBJECTS.values() for row in rows}
ZOO = {scenario.name: scenario for scenario in map(_scenario, ROWS.values())}
assert len(ROWS) == sum(map(len, SUBJECTS.values())), "two rows of one name"
