#include "doctor/interfaces.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <net/route.h>
#include <netinet/in.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>

#include "common/handles.h"
#include "common/text.h"
#include "doctor/address_class.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kMostTableBytes = 64UL * 1024;

std::string addressText(in_addr address) {
    std::array<char, INET_ADDRSTRLEN> text{};
    const char* const written = inet_ntop(AF_INET, &address, text.data(), text.size());
    return written == nullptr ? std::string{} : written;
}

std::string addressText(const sockaddr* address) {
    if (address == nullptr || address->sa_family != AF_INET) return {};
    const void* const raw = address;
    return addressText(static_cast<const sockaddr_in*>(raw)->sin_addr);
}

Interface& named(std::vector<Interface>& all, const std::string& name) {
    const auto found = std::find_if(all.begin(), all.end(),
                                    [&](const Interface& known) { return known.name == name; });
    if (found != all.end()) return *found;
    all.push_back({name, false, false, {}});
    return all.back();
}

bool isTunOrTap(const std::string& name) {
    return access(("/sys/class/net/" + name + "/tun_flags").c_str(), F_OK) == 0;
}

// A file of /proc. Its size is not known before.
std::string readTable(const char* path) {
    std::ifstream file{path};
    std::string table(kMostTableBytes, '\0');
    file.read(table.data(), static_cast<std::streamsize>(table.size()));
    table.resize(static_cast<std::size_t>(file.gcount()));
    return table;
}

struct RouteLine {
    DefaultRoute route;
    unsigned metric = 0;
};

std::optional<RouteLine> readRouteLine(const std::string& text) {
    std::istringstream line{text};
    RouteLine read;
    unsigned destination = 0;
    unsigned gateway = 0;
    unsigned flags = 0;
    unsigned ignored = 0;
    unsigned mask = 0;
    line >> read.route.interface >> std::hex >> destination >> gateway >> flags >> std::dec >>
        ignored >> ignored >> read.metric >> std::hex >> mask;
    const bool isUsed = (flags & RTF_UP) != 0 && (flags & RTF_REJECT) == 0;
    const bool isDefault = line && destination == 0 && mask == 0 && isUsed;
    if (!isDefault) return std::nullopt;
    if ((flags & RTF_GATEWAY) != 0) read.route.gateway = addressText(in_addr{gateway});
    return read;
}

bool isUsable(const std::string& address) {
    return classOf(address) != AddressClass::RESERVED;
}

bool hasUsableAddress(const Interface& entry) {
    return std::any_of(entry.addresses.begin(), entry.addresses.end(), isUsable);
}

void judgeRoute(const Interface& lan,
                const std::optional<DefaultRoute>& route,
                Findings& findings) {
    const std::string which = "network: " + lan.name + " up with " + lan.addresses.front();
    if (!route) {
        findings.add(Sign::NO_DEFAULT_ROUTE, lan.name + " is up, but there is no default route");
        findings.problem(which + ", but no default route");
    } else {
        findings.ok(which + ", default route " +
                    (route->gateway.empty() ? "on " + route->interface : "by " + route->gateway));
    }
}

void judgeTunnels(const std::vector<Interface>& all, Findings& findings) {
    for (const Interface& entry : all) {
        if (!entry.up || !entry.tunnel || entry.addresses.empty()) continue;
        findings.ok("tunnel interface: " + entry.name + " with " + entry.addresses.front());
    }
}

}  // namespace

std::vector<Interface> interfaces() {
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return {};
    const std::unique_ptr<ifaddrs, Releaser<freeifaddrs>> owned(list);
    std::vector<Interface> all;
    for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
        const std::string name = entry->ifa_name;
        if ((entry->ifa_flags & IFF_LOOPBACK) != 0 || contains(name, "docker")) continue;
        Interface& known = named(all, name);
        constexpr unsigned kInUse = IFF_UP | IFF_RUNNING;
        known.up = (entry->ifa_flags & kInUse) == kInUse;
        known.tunnel = (entry->ifa_flags & (IFF_POINTOPOINT | IFF_NOARP)) != 0 || isTunOrTap(name);
        const std::string address = addressText(entry->ifa_addr);
        if (!address.empty()) known.addresses.push_back(address);
    }
    return all;
}

std::optional<DefaultRoute> readDefaultRoute(const std::string& table) {
    std::istringstream lines{table};
    std::optional<RouteLine> best;
    for (std::string line; std::getline(lines, line);) {
        const auto read = readRouteLine(line);
        if (read && (!best || read->metric < best->metric)) best = read;
    }
    if (!best) return std::nullopt;
    return best->route;
}

std::optional<DefaultRoute> defaultRoute() {
    return readDefaultRoute(readTable("/proc/net/route"));
}

LanHost readLanHost(const std::string& table, const DefaultRoute& route) {
    LanHost host{{route.gateway}, false};
    std::map<std::string, std::string> hardware;  // by address
    std::istringstream lines{table};
    for (std::string line; std::getline(lines, line);) {
        std::istringstream words{line};
        std::string known, type, flags, at, mask, interface;
        words >> known >> type >> flags >> at >> mask >> interface;
        if (interface != route.interface) continue;
        if (flags != "0x0") {
            hardware[known] = at;
        } else if (known == route.gateway) {
            host.isSilent = true;
        }
    }
    const std::string own = hardware[route.gateway];
    for (const auto& [known, at] : hardware) {
        if (known != route.gateway && !own.empty() && at == own) host.addresses.push_back(known);
    }
    return host;
}

LanHost lanHost(const DefaultRoute& route) {
    return readLanHost(readTable("/proc/net/arp"), route);
}

std::string lanAddress() {
    const auto route = defaultRoute();
    std::string found;
    for (const Interface& entry : interfaces()) {
        if (!entry.up || entry.tunnel || entry.addresses.empty()) continue;
        if (route && route->interface == entry.name) return entry.addresses.front();
        if (found.empty()) found = entry.addresses.front();
    }
    return found;
}

std::vector<std::string> ownAddresses() {
    std::vector<std::string> all;
    for (const Interface& entry : interfaces()) {
        all.insert(all.end(), entry.addresses.begin(), entry.addresses.end());
    }
    return all;
}

void judgeNetwork(const std::vector<Interface>& all,
                  const std::optional<DefaultRoute>& route,
                  Findings& findings) {
    const Interface* up = nullptr;
    const Interface* addressed = nullptr;
    for (const Interface& entry : all) {
        if (!entry.up || entry.tunnel) continue;
        if (up == nullptr) up = &entry;
        if (addressed == nullptr && hasUsableAddress(entry)) addressed = &entry;
    }
    if (up == nullptr) {
        findings.add(Sign::NO_INTERFACE_UP, "no network interface is up");
        findings.problem("network: no interface is up, or no cable is plugged in");
    } else if (addressed == nullptr) {
        const std::string text = up->name + " is up, but has no usable IPv4 address";
        findings.add(Sign::NO_ADDRESS, text);
        findings.problem("network: " + text);
    } else {
        findings.add(Sign::HAS_ADDRESS, addressed->name + " is up with an address");
        judgeRoute(*addressed, route, findings);
    }
    judgeTunnels(all, findings);
}

void judgeMissingTunnel(const std::vector<Interface>& all, Findings& findings) {
    const auto isUp = [](const Interface& entry) { return entry.up && entry.tunnel; };
    if (std::any_of(all.begin(), all.end(), isUp)) return;
    findings.add(Sign::NO_TUNNEL_INTERFACE, "no tunnel interface is up");
    findings.problem("tunnel interface: none is up, although the tunnel client runs");
}

}  // namespace pelorus::doctor
