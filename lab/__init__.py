"""A home network on one machine to run the daemon in.

The device, its home gateway and the internet with the maker's central service are network
namespaces connected by veth pairs. `sandbox` isolates a run and cleans up after it, `scenario` sets
up the hosts and servers inside it; every other module is one server or one concern.
"""
