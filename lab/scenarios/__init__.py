"""The situations the daemon exists for, each played in the lab and checked against real state.

A scenario is a function that changes the lab and checks the outcome. The system tests play all of
them, `scripts/demo NAME` plays and shows one.
"""

# Importing a module registers its scenarios; --list shows them in this order.
from lab.scenarios import direct  # noqa: F401
from lab.scenarios import changes, leases, slow_gateway  # noqa: F401
from lab.scenarios import relay, manual, service, settings  # noqa: F401
from lab.scenarios import own_router, lifecycle, hostile_gateway  # noqa: F401
from lab.scenarios import service_faults, device_faults, beside  # noqa: F401
from lab.scenarios.registry import SCENARIOS, Scenario

__all__ = ["SCENARIOS", "Scenario"]
