#include "router/gateway_url.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <optional>
#include <string_view>

#include "common/own_address.h"

namespace pelorus {

namespace {

constexpr std::string_view kScheme = "http://";

std::optional<in_addr> hostAddress(const std::string& url) {
    if (url.compare(0, kScheme.size(), kScheme) != 0) return std::nullopt;
    const std::size_t end = url.find_first_of(":/", kScheme.size());
    const std::string host = url.substr(kScheme.size(), end - kScheme.size());
    in_addr address{};
    if (inet_pton(AF_INET, host.c_str(), &address) != 1) return std::nullopt;
    return address;
}

}  // namespace

bool leadsToAnotherHost(const std::string& url) {
    const auto address = hostAddress(url);
    return address && !isOwnAddress(*address);
}

}  // namespace pelorus
