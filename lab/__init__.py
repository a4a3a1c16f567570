"""A home network on one machine, to run the daemon in.

The device, its home gateway and the internet with the maker's central service are network
namespaces joined by veth pairs. `sandbox` gives a run its own world and ends it, `scenario` raises
the hosts and servers in that world, the other modules hold one server or one concern each.
"""
