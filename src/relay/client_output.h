// Reading the output of the openvpn client.
#ifndef PELORUS_RELAY_CLIENT_OUTPUT_H
#define PELORUS_RELAY_CLIENT_OUTPUT_H

#include <optional>
#include <string>

namespace pelorus {

/// What a line about a relay says.
struct RelayPeer {
    /// Four numbers with dots between them, as the client wrote them: numbers above 255 are not
    /// refused. Nothing when they cannot be read.
    std::optional<std::string> address;
};

/// Reads one line. Nothing when it does not mention a relay.
[[nodiscard]] std::optional<RelayPeer> readRelayPeer(const char* line);

}  // namespace pelorus

#endif
