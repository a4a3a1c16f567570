// Which URLs that strangers on the LAN announce can lead to a gateway.
#ifndef PELORUS_ROUTER_GATEWAY_URL_H
#define PELORUS_ROUTER_GATEWAY_URL_H

#include <string>

namespace pelorus {

/// True when the host of @p url is a dotted IPv4 address that can be a gateway's: not in 0.0.0.0/8
/// or 127.0.0.0/8, and none of this device's own, whose servers trust local clients. Names are not
/// looked up.
[[nodiscard]] bool leadsToAnotherHost(const std::string& url);

}  // namespace pelorus

#endif
