#include "relay/client_output.h"

#include <cstring>

#include "common/text.h"

namespace pelorus {

namespace {

constexpr const char* kPeerText = "Peer Connection Initiated with [AF_INET]";
constexpr int kAddressParts = 4;

// Reads what scanf("%d.%d.%d.%d") would read, but no negative numbers.
std::optional<std::string> readAddress(const char* text) {
    std::string address;
    for (int part = 0; part < kAddressParts; ++part) {
        if (part > 0 && *text++ != '.') return std::nullopt;
        const auto number = scanInt(text);
        if (number.value_or(-1) < 0) return std::nullopt;
        address += (part > 0 ? "." : "") + std::to_string(*number);
        text += std::strspn(text, " \t\n\v\f\r+-");
        text += std::strspn(text, "0123456789");
    }
    return address;
}

}  // namespace

std::optional<RelayPeer> readRelayPeer(const char* line) {
    const char* peer = std::strstr(line, kPeerText);
    if (peer == nullptr) return std::nullopt;
    return RelayPeer{readAddress(peer + std::strlen(kPeerText))};
}

}  // namespace pelorus
