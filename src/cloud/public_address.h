// Recognising a public address in what the server says.
#ifndef PELORUS_CLOUD_PUBLIC_ADDRESS_H
#define PELORUS_CLOUD_PUBLIC_ADDRESS_H

#include <string>

namespace pelorus {

/// True when @p text is an IPv4 address in dotted form and nothing else: not even a line feed or a
/// NUL byte may follow.
[[nodiscard]] bool isIpv4Address(const std::string& text);

}  // namespace pelorus

#endif
