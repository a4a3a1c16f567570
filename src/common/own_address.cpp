#include "common/own_address.h"

#include <ifaddrs.h>

#include <memory>

#include "common/handles.h"

namespace pelorus {

bool isOwnAddress(in_addr address) {
    const in_addr_t network = ntohl(address.s_addr) >> IN_CLASSA_NSHIFT;
    if (network == 0 || network == IN_LOOPBACKNET) return true;
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return true;
    const std::unique_ptr<ifaddrs, Releaser<freeifaddrs>> interfaces(list);
    for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
        if (entry->ifa_addr == nullptr || entry->ifa_addr->sa_family != AF_INET) continue;
        const void* const own = entry->ifa_addr;
        if (static_cast<const sockaddr_in*>(own)->sin_addr.s_addr == address.s_addr) return true;
    }
    return false;
}

}  // namespace pelorus
