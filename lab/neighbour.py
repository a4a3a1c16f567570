"""Another computer at home, which takes ports of the router."""

from __future__ import annotations

from lab import network
from lab.gateway import Gateway
from lab.support import LabError
from lab.timeline import Timeline
from lab.web import Reply, WebServer

_LEASE = 604800


class Neighbour:
    """The second client of the router's mapping protocols."""

    def __init__(self, gateway: Gateway, timeline: Timeline) -> None:
        self._gateway = gateway
        self._timeline = timeline

    def hold(self, external_port: int, internal_port: int) -> None:
        """Map a TCP port of the router; LabError unless it grants exactly this one."""
        if self._gateway.setup.upnp:
            self._ask(f"external {self._gateway.wan_address}:{external_port} TCP is redirected",
                      "upnpc", "-u", self._gateway.description_url, "-e", "neighbour", "-a",
                      network.NEIGHBOUR_ADDRESS, str(internal_port), str(external_port), "tcp")
        else:
            self._ask(f"Mapped public port {external_port} protocol TCP", "natpmpc",
                      "-g", self._gateway.lan_address, "-a", str(external_port),
                      str(internal_port), "tcp", str(_LEASE))
        self._timeline.add("neighbour", f"holds the gateway's TCP port {external_port}")

    def pretend(self, device_id: str) -> None:
        """Answer on port 80 as another device of the same make does."""
        identity = f"<device_id>{device_id}</device_id>".encode()
        WebServer(network.NEIGHBOUR, network.NEIGHBOUR_ADDRESS, 80, lambda _: Reply(identity))
        self._timeline.add("neighbour", "is another device of the same make")

    def delete(self, external_port: int) -> None:
        """Remove a mapping, whoever made it; LabError unless the router obeys."""
        self._ask("UPNP_DeletePortMapping() returned : 0", "upnpc", "-u",
                  self._gateway.description_url, "-d", str(external_port), "tcp")
        self._timeline.add("neighbour", f"deletes the gateway's TCP port {external_port}")

    def _ask(self, success: str, *argv: str) -> None:
        answer = network.output(network.NEIGHBOUR, *argv)
        if success not in answer:
            raise LabError(f"the gateway refused the neighbour ({' '.join(argv)}):\n{answer}")
