#include "connection_fixture.h"

namespace pelorus {
namespace {

class ForwardSearchTest : public ConnectionTest {
protected:
    int search(HttpType type = HTTP, bool defaultPortsOnly = false, bool checkSleep = true) {
        return type == HTTP ? manager().forwardPort(8080, 9091, 9092, kWanIp, HTTP, "Kavra",
                                                    defaultPortsOnly, checkSleep)
                            : manager().forwardPort(8443, 9444, 9445, kWanIp, HTTPS, "KavraSSL",
                                                    defaultPortsOnly, checkSleep);
    }
    // The gateway must be known before a port can be searched on it.
    void givenGateway() {
        std::string ip;
        ASSERT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
        forget();
    }
};

TEST_F(ForwardSearchTest, GatewayThatRefusesAllIsAskedABoundedNumberOfTimes) {
    givenGateway();
    gateway.refuseAllPorts();
    EXPECT_EQ(search(), 0);
    // 100 candidates in the first cycle; the last one is then known as bad.
    EXPECT_EQ(gateway.count(" -> "), 100 + 99 + 99);
    EXPECT_TRUE(testedPorts().empty());
}

TEST_F(ForwardSearchTest, UntestablePortIsRemovedAndRememberedUntilTheDiskMayWake) {
    givenGateway();
    failTest(9091);
    EXPECT_EQ(search(), 9092);
    EXPECT_EQ(mappedPorts(), (Ports{9092}));
    EXPECT_EQ(log.countPart("Port test failed, trying next port in range.\n"), 1);
    forget();
    EXPECT_EQ(search(), 9092);
    EXPECT_EQ(gateway.count("map TCP 9091 ->"), 0);
    EXPECT_EQ(search(HTTP, false, false), 9091);
}

TEST_F(ForwardSearchTest, ThreeCandidatesAreTestedAtMost) {
    givenGateway();
    web.answer("/test?", kNotReached);
    EXPECT_EQ(search(), 0);
    EXPECT_EQ(testedPorts(), (Ports{9091, 9091, 9091, 9092, 9092, 9092, 9093, 9093, 9093}));
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_EQ(log.countPart("Port test failed, retries exceeded.\n"), 2);
}

TEST_F(ForwardSearchTest, SkippedTestRemovesTheMappingAndIsNoMarkAgainstThePort) {
    givenGateway();
    diskIsAsleep();
    EXPECT_EQ(search(), 0);
    EXPECT_TRUE(mappedPorts().empty());
    expectLoggedInOrder(
        {"ConnectionManager::forwardPort - HTTP port mapped 9091 but SKIPPED port test\n",
         "ConnectionManager::forwardPort - Port test failed, trying next port in range.\n",
         "ConnectionManager::forwardPort - Skipped port test, unmapped HTTP port 9091, leaving forwardPort()\n"});
    diskIsAwake();
    EXPECT_EQ(search(), 9091);
}

TEST_F(ForwardSearchTest, DoubleNatEndsTheSearchAndRemovesItsMapping) {
    givenGateway();
    gateway.refusePort(9091);
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(search(), 0);
    EXPECT_EQ(testedPorts(), (Ports{9092}));
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_EQ(log.countPart("Port test failed"), 0);
}

TEST_F(ForwardSearchTest, DefaultPortOnlyTriesNoOther) {
    givenGateway();
    gateway.refusePort(9091);
    EXPECT_EQ(search(HTTP, true), 0);
    EXPECT_EQ(gateway.calls(" -> "), Texts(3, "map TCP 9091 -> 192.168.77.10:8080 Kavra"));
    gateway.acceptPort(9091);
    web.answer("/test?", kNotReached);
    for (int round = 0; round < 2; ++round) EXPECT_EQ(search(HTTP, true), 0);
    EXPECT_EQ(gateway.count(" -> "), 3 + 1);  // once its test has failed, nothing is left to map
}

TEST_F(ForwardSearchTest, BadPortsAreForgottenAboveNinetyNine) {
    givenGateway();
    gateway.refusePort(9091);
    for (int round = 0; round < 34; ++round) search(HTTP, true);  // three entries each
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 0);       // the last one found 99
    search(HTTP, true);
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 1);
}

TEST_F(ForwardSearchTest, GrantedNatpmpPortIsTestedAndTakenBackByItsInternalPort) {
    gateway.speakUpnp(false);
    gateway.speakNatpmp(true);
    givenGateway();
    gateway.grant({40001, {}, 600});
    EXPECT_EQ(search(), 40001);
    EXPECT_EQ(testedPorts(), (Ports{40001}));
    forget();
    failTest(40001);
    EXPECT_EQ(search(), 40001);
    // The second cycle finds the granted start port bad: the range begins, with an empty table.
    EXPECT_EQ(gateway.calls("natpmp map"),
              (Texts{"natpmp map TCP 9091 -> 8080 for 172800 s", "natpmp map TCP 0 -> 8080 for 0 s",
                     "natpmp map TCP 0 -> 8080 for 0 s", "natpmp map TCP 0 -> 8080 for 0 s",
                     "natpmp map TCP 9092 -> 8080 for 172800 s"}));
}

struct Predefined {
    const char* name;
    HttpType type;
    std::string testAnswer;
    int wanted;
    Ports tested;
};
class PredefinedPortsTest : public ForwardSearchTest,
                            public testing::WithParamInterface<Predefined> {};

TEST_P(PredefinedPortsTest, OfTheMakersRouterComeFirst) {
    givenMakersRouter("44.128.0.20\n",
                      "OTHER,TCP,6000-6001,192.168.77.1,8888,other\n"
                      "OTHER,TCP,7000-7001,192.168.77.1,8080,web\n"
                      "OTHER,TCP,7443,192.168.77.1,8443,web\n");
    web.answer("/test?", GetParam().testAnswer);
    if (GetParam().testAnswer == kPassed) failTest(7000);
    EXPECT_EQ(search(GetParam().type), GetParam().wanted);
    EXPECT_EQ(testedPorts(), GetParam().tested);
    EXPECT_EQ(commands.count(" add ") + commands.count(" remove "), 0);
}
INSTANTIATE_TEST_SUITE_P(
    Services,
    PredefinedPortsTest,
    testing::Values(
        Predefined{"SecondHttpPortPasses", HTTP, kPassed, 7001, {7000, 7000, 7000, 7001}},
        Predefined{"HttpsIsNotTested", HTTPS, kPassed, 7443, {}},
        Predefined{"DoubleNatReturnsTheRelayValue", HTTP, kOtherNat, 4, {7000}}),
    RowName{});

}  // namespace
}  // namespace pelorus
