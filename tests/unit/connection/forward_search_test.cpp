#include "connection_fixture.h"

namespace pelorus {
namespace {

class ForwardingSearchTest : public ConnectionTest {
protected:
    int search(HttpType type, bool defaultPortsOnly = false, bool checkSleep = true) {
        return type == HTTP ? manager().forwardPort(80, 9091, 9092, kWanIp, HTTP, "Kavra",
                                                    defaultPortsOnly, checkSleep)
                            : manager().forwardPort(443, 9444, 9445, kWanIp, HTTPS, "KavraSSL",
                                                    defaultPortsOnly, checkSleep);
    }
    // The gateway must be known before a port can be searched on it.
    void givenGateway() {
        ASSERT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
        forget();
    }
    std::string ip;
};

TEST_F(ForwardingSearchTest, PortOfAnotherHostIsLeftAloneAndTheNextTaken) {
    givenGateway();
    gateway.add({9091, "192.168.77.66", 80, "theirs"});
    EXPECT_EQ(search(HTTP), 9092);
    EXPECT_EQ(gateway.mappings().front(),
              (FakeGateway::Mapping{9091, "192.168.77.66", 80, "theirs"}));
}

TEST_F(ForwardingSearchTest, GatewayThatRefusesAllIsAskedABoundedNumberOfTimes) {
    givenGateway();
    gateway.refuseAllPorts();
    EXPECT_EQ(search(HTTP), 0);
    // 100 candidates in the first cycle; the last one is then known as bad.
    EXPECT_EQ(gateway.count(" -> "), 100 + 99 + 99);
    EXPECT_TRUE(testedPorts().empty());
}

TEST_F(ForwardingSearchTest, UntestablePortIsRemovedAndTheNextOneTried) {
    givenGateway();
    for (int attempt = 0; attempt < 3; ++attempt) web.answerOnce("&port=9091&", kNotReached);
    EXPECT_EQ(search(HTTP), 9092);
    EXPECT_EQ(mappedPorts(), (std::vector<int>{9092}));
    EXPECT_EQ(log.countPart("Port test failed, trying next port in range.\n"), 1);
    forget();
    // The bad port is remembered by the next search ...
    EXPECT_EQ(search(HTTP), 9092);
    EXPECT_EQ(gateway.count("map TCP 9091 ->"), 0);
    // ... until one that may wake the disk starts over.
    EXPECT_EQ(search(HTTP, false, false), 9091);
    expectLogged(LOG_INFO, "ConnectionManager::forwardPort - ** Cleared bad port vector. **\n");
}

TEST_F(ForwardingSearchTest, ThreeCandidatesAreTestedAtMost) {
    givenGateway();
    web.answer("/test?", kNotReached);
    EXPECT_EQ(search(HTTP), 0);
    EXPECT_EQ(testedPorts(),
              (std::vector<int>{9091, 9091, 9091, 9092, 9092, 9092, 9093, 9093, 9093}));
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_EQ(log.countPart("Port test failed, retries exceeded.\n"), 2);
}

TEST_F(ForwardingSearchTest, SkippedTestRemovesTheMappingAndIsNoMarkAgainstThePort) {
    givenGateway();
    diskIsAsleep();
    EXPECT_EQ(search(HTTP), 0);
    EXPECT_TRUE(mappedPorts().empty());
    expectLoggedInOrder(
        {"ConnectionManager::forwardPort - HTTP port mapped 9091 but SKIPPED port test\n",
         "ConnectionManager::forwardPort - Port test failed, trying next port in range.\n",
         "ConnectionManager::forwardPort - Skipped port test, unmapped HTTP port 9091, leaving forwardPort()\n"});
    diskIsAwake();
    EXPECT_EQ(search(HTTP), 9091);
}

TEST_F(ForwardingSearchTest, DoubleNatEndsTheSearchAndRemovesTheMapping) {
    givenGateway();
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(search(HTTP), 0);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));
    EXPECT_TRUE(mappedPorts().empty());
}

TEST_F(ForwardingSearchTest, DefaultPortOnlyTriesNoOther) {
    givenGateway();
    gateway.refusePort(9091);
    EXPECT_EQ(search(HTTP, true), 0);
    EXPECT_EQ(gateway.calls(" -> "), Texts(3, "map TCP 9091 -> 192.168.77.10:80 Kavra"));
    forget();
    gateway.acceptPort(9091);
    web.answer("/test?", kNotReached);
    EXPECT_EQ(search(HTTP, true), 0);
    // Once its test has failed, the port is bad and nothing is left to map.
    EXPECT_EQ(gateway.count(" -> "), 1);
    forget();
    EXPECT_EQ(search(HTTP, true), 0);
    EXPECT_EQ(gateway.count(" -> "), 0);
}

TEST_F(ForwardingSearchTest, BadPortsAreForgottenAboveNinetyNine) {
    givenGateway();
    gateway.refusePort(9091);
    for (int round = 0; round < 33; ++round) search(HTTP, true);  // three entries each
    search(HTTP, true);                                           // with 99 it keeps them
    expectNotLogged("Cleared bad port vector");
    search(HTTP, true);  // with 102 it does not
    EXPECT_EQ(log.countPart("Cleared bad port vector"), 1);
}

TEST_F(ForwardingSearchTest, GrantedNatpmpPortIsTestedAndReturned) {
    gateway.speakUpnp(false);
    gateway.speakNatpmp(true);
    givenGateway();
    gateway.grant({40001, {}, 600});
    EXPECT_EQ(search(HTTP), 40001);
    EXPECT_EQ(testedPorts(), (std::vector<int>{40001}));
}

struct Predefined {
    const char* name;
    HttpType type;
    std::string testAnswer;
    int wanted;
    std::vector<int> tested;
};
class PredefinedPortsTest : public ForwardingSearchTest,
                            public testing::WithParamInterface<Predefined> {};

TEST_P(PredefinedPortsTest, OfTheMakersRouterComeFirst) {
    setConfig("DEVICETYPE", "5");
    commands.answer("getip.sh lan", "192.168.77.1\n");
    commands.answer("getip.sh wan", "44.128.0.20\n");
    commands.answer("tavik_helper.sh list",
                    "OTHER,TCP,6000-6001,192.168.77.1,8888,other\n"
                    "OTHER,TCP,7000-7001,192.168.77.1,80,web\n"
                    "OTHER,TCP,7443,192.168.77.1,443,web\n");
    web.answer("/test?", GetParam().testAnswer);
    for (int attempt = 0; attempt < 3; ++attempt)
        web.answerOnce("&port=7000&", GetParam().testAnswer == kOtherNat ? kOtherNat : kNotReached);
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
