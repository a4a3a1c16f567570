#include "router/gateway_url.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <netinet/in.h>

#include <memory>
#include <optional>
#include <string_view>

#include "common/handles.h"

namespace pelorus {

namespace {

constexpr std::string_view kScheme = "http://";

using Interfaces = std::unique_ptr<ifaddrs, Releaser<freeifaddrs>>;

std::optional<in_addr_t> hostAddress(const std::string& url) {
    if (url.compare(0, kScheme.size(), kScheme) != 0) return std::nullopt;
    const std::size_t end = url.find_first_of(":/", kScheme.size());
    const std::string host = url.substr(kScheme.size(), end - kScheme.size());
    in_addr address{};
    if (inet_pton(AF_INET, host.c_str(), &address) != 1) return std::nullopt;
    return address.s_addr;
}

bool isOwn(in_addr_t address) {
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return false;  // connections to this device are refused as well
    const Interfaces interfaces(list);
    for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
        if (entry->ifa_addr == nullptr || entry->ifa_addr->sa_family != AF_INET) continue;
        const void* const raw = entry->ifa_addr;
        if (static_cast<const sockaddr_in*>(raw)->sin_addr.s_addr == address) return true;
    }
    return false;
}

}  // namespace

bool leadsToAnotherHost(const std::string& url) {
    const auto address = hostAddress(url);
    if (!address) return false;
    const in_addr_t network = ntohl(*address) >> IN_CLASSA_NSHIFT;
    return network != 0 && network != IN_LOOPBACKNET && !isOwn(*address);
}

}  // namespace pelorus
