"""The situations the daemon exists for, each played against the lab and checked on real state.

A scenario is a function that changes the lab and looks at what becomes of it. The system tests
play them all, `scripts/demo NAME` plays one of them for a reader.
"""

# Importing a module registers its scenarios, in the order in which a reader finds them listed.
from lab.scenarios import direct  # noqa: F401, I001
from lab.scenarios import changes, leases, slow_gateway, relay, manual, service, settings  # noqa: F401
from lab.scenarios import own_router, lifecycle  # noqa: F401
from lab.scenarios.registry import SCENARIOS, Scenario

__all__ = ["SCENARIOS", "Scenario"]
