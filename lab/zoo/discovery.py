"""Gateways that answer the search in a way of their own."""

from __future__ import annotations

from lab.gateway import GatewaySetup
from lab.scripted_gateway import Personality
from lab.zoo.row import NOTHING, Row

ROWS = (
    Row("D0", "A good gateway", GatewaySetup(personality=Personality()), NOTHING),
)
