// The host that a URL names.
#ifndef PELORUS_DOCTOR_URL_HOST_H
#define PELORUS_DOCTOR_URL_HOST_H

#include <optional>
#include <string>

namespace pelorus::doctor {

struct HostAndPort {
    std::string host;  ///< an IPv6 address without its brackets
    int port{};
};

/// The host and port of @p url, with the port of its scheme, http or https, when it names none.
/// Nothing for another scheme, an empty host or a bad port.
[[nodiscard]] std::optional<HostAndPort> hostOfUrl(const std::string& url);

/// What the daemon takes for the service's host in SERVER_BASE_URL: everything behind the first
/// slash and the character after it, a port and a path included. Empty when nothing is left of use.
[[nodiscard]] std::string serviceHost(const std::string& baseUrl);

/// The name of that host, without a user, a port and a path. Empty when nothing is left of use.
[[nodiscard]] std::string serviceName(const std::string& baseUrl);

/// The domain of the device's public names, with its leading dot.
[[nodiscard]] std::string domainOfNames(const std::string& baseUrl);

}  // namespace pelorus::doctor

#endif
