#include "relay/client_output.h"

#include <gtest/gtest.h>

namespace pelorus {
namespace {

const std::string kPeer = "Nov [relay] Peer Connection Initiated with [AF_INET]";

TEST(RelayPeer, IsFourNumbersBehindTheText) {
    EXPECT_EQ(readRelayPeer((kPeer + "44.128.0.1:1194\n").c_str())->address, "44.128.0.1");
    EXPECT_EQ(readRelayPeer((kPeer + " 44.300.007. 0").c_str())->address, "44.300.7.0");
    for (const char* const bad : {"44.-1.0.2", "4294967297.1.1.1", "44.128.0", "44.128.0:1", ""}) {
        const auto peer = readRelayPeer((kPeer + bad).c_str());
        EXPECT_TRUE(peer && !peer->address) << bad;
    }
    EXPECT_FALSE(readRelayPeer("Peer Connection Initiated with [AF_INET6]::1"));
}

}  // namespace
}  // namespace pelorus
