#include "connection_fixture.h"

namespace pelorus {
namespace {

class ForwardSearchTest : public ConnectionTest {
protected:
    // Finds the gateway and searches a port on it.
    std::string search(bool defaultPortsOnly = false, bool checkSleep = true) {
        std::string ip;
        EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
        forget();
        return std::to_string(manager().forwardPort(8080, 9091, 9092, kWanIp, HTTP, "Kavra",
                                                    defaultPortsOnly, checkSleep));
    }
};

TEST_F(ForwardSearchTest, GatewayThatRefusesAllIsAskedABoundedNumberOfTimes) {
    gateway.refuseAll = true;
    EXPECT_EQ(search(), "0");
    // 100 candidates in the first cycle; the last one is then known as bad.
    EXPECT_EQ(gateway.count(" -> "), 100 + 99 + 99);
    EXPECT_TRUE(web.urls().empty());
}

TEST_F(ForwardSearchTest, TestsThreeCandidatesAndRemembersThemUntilItMayWakeTheDisk) {
    web.answer("/test?", kNotReached);
    EXPECT_EQ(story(search()),
              "map 9091, disk, test 9091 x3, status failed, unmap 9091, next port, unmap 0 0, "
              "map 9092, disk, test 9092 x3, unmap 9092, exceeded, unmap 0 0, "
              "map 9093, disk, test 9093 x3, unmap 9093, exceeded = 0");
    web.answer("/test?", passed());
    EXPECT_EQ(story(search()), "unmap 0 0, map 9094, disk, test 9094 = 9094 9094");
    EXPECT_EQ(story(search(false, false)), "map 9091, test 9091 = 9094 9091 9091");
}

TEST_F(ForwardSearchTest, DefaultPortOnlyTriesNoOtherAndRemembers99BadPorts) {
    gateway.refused.insert(9091);
    EXPECT_EQ(story(search(true)), "map 9091, map 9091, map 9091 = 0");
    for (int round = 1; round < 34; ++round) search(true);
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 0);  // the last one found 99
    search(true);
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 1);
}

TEST_F(ForwardSearchTest, DoubleNatAtAPredefinedPortReturnsTheRelayValue) {
    setConfig("DEVICETYPE", "5");
    commands.answer("getip.sh wan", kWanIp);
    commands.answer("tavik_helper.sh list", "OTHER,TCP,7000-7001,192.168.77.10,8080,web\n");
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(story(search()), "disk, test 7000 = 4");
}

}  // namespace
}  // namespace pelorus
