"""An internet provider that puts its customers behind its own NAT."""

from __future__ import annotations

from lab import network, nft
from lab.gateway import Gateway
from lab.timeline import Timeline

HOST = "provider"
ADDRESS, CUSTOMER_ADDRESS = "44.128.0.21", "44.128.1.20"
_CABLE = network.cable_end(network.GATEWAY, "wan")

# The internet cannot open a connection to a customer.
_RULES = """
table inet carrier {
    chain forward {
        type filter hook forward priority 0; policy drop;
        ct state established,related accept
        iifname != "net" accept
    }
    chain input {
        type filter hook input priority 0; policy accept;
        iifname "net" ct state new drop
    }
    chain postrouting {
        type nat hook postrouting priority 100;
        oifname "net" masquerade
    }
}
"""


class Provider:
    """The provider's NAT between the router and the internet, once inserted."""

    def __init__(self, gateway: Gateway, timeline: Timeline) -> None:
        self._gateway = gateway
        self._timeline = timeline
        self._direct_address = ""

    def insert(self, customer: str = CUSTOMER_ADDRESS) -> None:
        """Plug the router into the provider's NAT instead of the internet, at this address."""
        router = customer.rpartition(".")[0] + ".1"
        network.ip_batch(f"netns add {HOST}")
        network.plug(HOST, "net", network.INTERNET, "net")
        network.ip_batch(f"address add {ADDRESS}/24 dev net",
                         f"route add default via {network.SERVICE_ADDRESS}", host=HOST)
        network.enable_forwarding(HOST)
        nft.change(HOST, _RULES)
        network.ip_batch(f"link set {_CABLE} nomaster netns {HOST}", host=network.INTERNET)
        network.ip_batch(f"address add {router}/24 dev {_CABLE}",
                         f"link set {_CABLE} up", host=HOST)
        self._direct_address = self._gateway.wan_address
        self._gateway.take_wan_address(customer, router)
        self._timeline.add("provider",
                           f"puts the gateway, now {customer}, behind {ADDRESS}")

    def remove(self) -> None:
        """Plug the router into the internet again, with its previous address."""
        network.ip_batch(f"link set {_CABLE} netns {network.INTERNET}", "link delete net",
                         host=HOST)
        network.ip_batch(f"link set {_CABLE} master net up", host=network.INTERNET)
        network.ip_batch(f"netns delete {HOST}")
        self._gateway.take_wan_address(self._direct_address, network.SERVICE_ADDRESS)
        self._timeline.add("provider",
                           f"gives the gateway its own address {self._direct_address} again")
