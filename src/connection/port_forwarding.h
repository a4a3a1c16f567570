// What automatic and manual port forwarding share.
#ifndef PELORUS_CONNECTION_PORT_FORWARDING_H
#define PELORUS_CONNECTION_PORT_FORWARDING_H

#include "common/connection_types.h"

namespace pelorus {

inline constexpr const char* kTcp = "TCP";

/// Descriptions of this daemon's mappings on the gateway.
inline constexpr const char* kHttpDescription = "Kavra";
inline constexpr const char* kHttpsDescription = "KavraSSL";

/// The configured port, or @p defaultPort when the value is not a number.
int readPort(const char* key, int defaultPort);

/// Emits an analytics event for an attempt to forward ports; @p subType tells who forwards them.
void reportAnalytics(const char* status, ConnectionSubType subType);

}  // namespace pelorus

#endif
