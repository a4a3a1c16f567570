// The device's own network interfaces and its default route.
#ifndef PELORUS_DOCTOR_INTERFACES_H
#define PELORUS_DOCTOR_INTERFACES_H

#include <optional>
#include <string>
#include <vector>

#include "doctor/findings.h"

namespace pelorus::doctor {

struct Interface {
    std::string name;
    bool up = false;                     ///< and its cable plugged in
    bool tunnel = false;                 ///< point to point or TAP; else it leads to a LAN
    std::vector<std::string> addresses;  ///< IPv4, dotted
};

/// All but the loopback and the bridges of containers.
[[nodiscard]] std::vector<Interface> interfaces();

struct DefaultRoute {
    std::string interface;
    std::string gateway;  ///< empty when the route leads to no gateway
};

/// The default route of the least metric in @p table, which is in the form of /proc/net/route.
[[nodiscard]] std::optional<DefaultRoute> readDefaultRoute(const std::string& table);
/// That of this device.
[[nodiscard]] std::optional<DefaultRoute> defaultRoute();

/// A host of the LAN, as far as this device has talked with it lately.
struct LanHost {
    std::vector<std::string> addresses;  ///< all at its hardware address, the one asked for first
    bool isSilent = false;               ///< it does not even tell its hardware address
};

/// The gateway of @p route by @p table, which is in the form of /proc/net/arp. What other
/// interfaces know of its address does not count.
[[nodiscard]] LanHost readLanHost(const std::string& table, const DefaultRoute& route);
/// By the table of this device.
[[nodiscard]] LanHost lanHost(const DefaultRoute& route);

/// The device's address in its LAN, preferably on the interface of the default route; empty if it
/// has none.
[[nodiscard]] std::string lanAddress();
/// Every IPv4 address of this device but those of the loopback.
[[nodiscard]] std::vector<std::string> ownAddresses();

/// Concludes from the interfaces and the route.
void judgeNetwork(const std::vector<Interface>& all,
                  const std::optional<DefaultRoute>& route,
                  Findings& findings);

/// Concludes from the interfaces of a device whose tunnel client runs and should have its tunnel up.
void judgeMissingTunnel(const std::vector<Interface>& all, Findings& findings);

}  // namespace pelorus::doctor

#endif
