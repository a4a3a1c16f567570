#include "common/stop_budget.h"
#include "common/termination.h"
#include "connection_fixture.h"

namespace pelorus {
namespace {

// The gateway must be known before a port can be searched on it.
class ForwardSearchTest : public StoryTest {
protected:
    void givenGateway() {
        std::string ip;
        ASSERT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
        forget();
    }
    std::string search(bool defaultPortsOnly = false, bool checkSleep = true) {
        const int port = manager().forwardPort(8080, 9091, 9092, kWanIp, HTTP, "Kavra",
                                               defaultPortsOnly, checkSleep);
        return std::to_string(port);
    }
};

TEST_F(ForwardSearchTest, GatewayThatRefusesAllIsAskedABoundedNumberOfTimes) {
    givenGateway();
    gateway.refuseAllPorts();
    EXPECT_EQ(search(), "0");
    // 100 candidates in the first cycle; the last one is then known as bad.
    EXPECT_EQ(gateway.count(" -> "), 100 + 99 + 99);
    EXPECT_TRUE(web.urls().empty());
}

TEST_F(ForwardSearchTest, EndsWithTheStopBudgetNotWithTheSignal) {
    givenGateway();
    gateway.refuseAllPorts();
    gateway.onCall([&](const std::string& call) {
        if (call.find("map TCP 9100 ") == 0) sigConnKilled = SIGTERM;
        if (call.find("map TCP 9102 ") == 0) renewStopBudget(0);
    });
    EXPECT_EQ(search(), "0");
    EXPECT_EQ(gateway.count(" -> "), 12);
}

TEST_F(ForwardSearchTest, DefaultPortOnlyTriesNoOther) {
    givenGateway();
    gateway.refusePort(9091);
    EXPECT_EQ(story(search(true)),
              "map 9091>LAN:8080 Kavra, map 9091>LAN:8080 Kavra, map 9091>LAN:8080 Kavra = 0");
    gateway.acceptPort(9091);
    web.answer("/test?", kNotReached);
    EXPECT_EQ(
        story(search(true)),
        "map 9091>LAN:8080 Kavra, disk, test 9091, test 9091, test 9091, status failed, unmap 9091, failed: trying next port in range = 0");
    EXPECT_EQ(story(search(true)), " = 0");
}

TEST_F(ForwardSearchTest, BadPortsAreForgottenAboveNinetyNine) {
    givenGateway();
    gateway.refusePort(9091);
    for (int round = 0; round < 34; ++round) search(true);   // three entries each
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 0);  // the last one found 99
    search(true);
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 1);
}

class PortSearch : public ForwardSearchTest {};
TEST_P(PortSearch, TellsAsExpected) {
    givenGateway();
    // The last search may wake the disk, so that it starts over.
    expectStories(
        [this, left = GetParam().stories.size()]() mutable { return search(false, --left > 0); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, PortSearch, testing::Values(
    Row{"RemembersAnUntestablePort", [](World& w) { w.failTest(9091); }, {"map 9091>LAN:8080 Kavra, disk, test 9091, test 9091, test 9091, status failed, unmap 9091, failed: trying next port in range, unmap 0, unmap 0, map 9092>LAN:8080 Kavra, disk, test 9092 = 9092 9092", "unmap 0, unmap 0, map 9092>LAN:8080 Kavra, disk, test 9092 = 9092 9092", "map 9091>LAN:8080 Kavra, test 9091 = 9092 9091 9091"}},
    Row{"TestsThreeCandidates", [](World& w) { w.web.answer("/test?", kNotReached); }, {"map 9091>LAN:8080 Kavra, disk, test 9091, test 9091, test 9091, status failed, unmap 9091, failed: trying next port in range, unmap 0, unmap 0, map 9092>LAN:8080 Kavra, disk, test 9092, test 9092, test 9092, unmap 9092, failed: retries exceeded, unmap 0, unmap 0, map 9093>LAN:8080 Kavra, disk, test 9093, test 9093, test 9093, unmap 9093, failed: retries exceeded = 0", "map 9091>LAN:8080 Kavra, test 9091, test 9091, test 9091, unmap 9091, failed: trying next port in range, unmap 0, unmap 0, map 9092>LAN:8080 Kavra, test 9092, test 9092, test 9092, unmap 9092, failed: retries exceeded, unmap 0, unmap 0, map 9093>LAN:8080 Kavra, test 9093, test 9093, test 9093, unmap 9093, failed: retries exceeded = 0"}},
    Row{"SkippedTestIsNoMarkAgainstThePort", [](World& w) { w.diskIsAsleep(); }, {"map 9091>LAN:8080 Kavra, disk, unmap 9091, failed: trying next port in range = 0", "map 9091>LAN:8080 Kavra, test 9091 = 9091 9091"}},
    Row{"DoubleNatEndsItAndRemovesItsMapping", [](World& w) {
            w.gateway.refusePort(9091);
            w.web.answer("/test?", kOtherNat);
        }, {"map 9091>LAN:8080 Kavra, unmap 0, unmap 0, map 9092>LAN:8080 Kavra, test 9092, unmap 9092 = 0"}}),
    RowName{});

// The second cycle finds the granted start port bad: the range begins, with an empty table.
TEST_F(ForwardSearchTest, GrantedNatpmpPortIsTestedAndTakenBackByItsInternalPort) {
    gateway.speakUpnp(false);
    gateway.speakNatpmp(true);
    givenGateway();
    gateway.grant({40001, {}, 600});
    EXPECT_EQ(story(search()), "natpmp 9091>8080, disk, test 40001 = 40001 40001");
    failTest(40001);
    EXPECT_EQ(story(search()), "natpmp 9091>8080, disk, test 40001, test 40001, test 40001, status failed, natpmp 0>8080, failed: trying next port in range, natpmp 0>8080, natpmp 0>8080, natpmp 9092>8080, disk, test 40001 = 40001 40001");
}

TEST_F(ForwardSearchTest, DoubleNatAtAPredefinedPortReturnsTheRelayValue) {
    givenMakersRouter("44.128.0.20\n", "OTHER,TCP,7000-7001,192.168.77.1,8080,web\n");
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(story(search()), "disk, test 7000 = 4");
}
// clang-format on

}  // namespace
}  // namespace pelorus
