#include "connection_fixture.h"

namespace pelorus {
namespace {

class ManualAttemptTest : public ConnectionTest {
protected:
    ManualAttemptTest() {
        setConfig("MANUAL_PORT_FORWARD", "TRUE");
        setConfig("MANUAL_EXTERNAL_HTTP_PORT", "18080");
        setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "18443");
        serverSees(kWanIp);
    }
    // Without an address in the request the server tells the one it tested.
    void serverSees(const std::string& ip) {
        web.answer("/test?", kPassed + "<external_ip>" + ip + "</external_ip>");
    }
    void givenManualForwarding() {
        ASSERT_EQ(cycle(), PORTFORWARDED);
        forget();
    }
    // The automatic attempt of a device whose user has not taken over yet.
    ConnectionType automaticCycle() {
        setConfig("MANUAL_PORT_FORWARD", "FALSE");
        const ConnectionType type = cycle();
        setConfig("MANUAL_PORT_FORWARD", "TRUE");
        forget();
        return type;
    }
};

TEST_F(ManualAttemptTest, TestsAndPublishesThePortsOfTheUserAndStopsTheRelay) {
    clientRuns();
    diskIsAsleep();  // what is new is worth waking it
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{18080}));
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&18080&18443"}));
    EXPECT_EQ(web.count("127.0.0.1:8080/setforward?44.128.0.20&18080&18443&192.168.77.10&8080"), 1);
    EXPECT_EQ(statusWords(), (Texts{"portforwarded"}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "connected/portforwarded"}));
    EXPECT_EQ(commands.count("kill -15 "), 1);
    EXPECT_EQ(gateway.count(" -> "), 0);
    EXPECT_EQ(manager().createRelayConnection(), PORTFORWARDED);  // both ports count as mapped
}

TEST_F(ManualAttemptTest, RelayThatCannotBeStoppedFailsOnlyTheReport) {
    clientRuns();
    clientCannotBeStopped();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(records().size(), 1U);
    EXPECT_TRUE(statusWords().empty());
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
    forget();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());  // published all the same
}

TEST_F(ManualAttemptTest, TakingOverRemovesTheAutomaticMappingsAndOnlyThem) {
    gateway.add({5000, kLanIp, 22, "ssh"});
    ASSERT_EQ(automaticCycle(), PORTFORWARDED);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (Ports{5000}));
    EXPECT_EQ(log.countPart("unmapping existing ports"), 1);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(log.countPart("unmapping existing ports"), 1);  // once
    clock.advance(300);
    ASSERT_EQ(automaticCycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (Ports{5000, 9091, 9444}));
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (Ports{5000}));
}

TEST_F(ManualAttemptTest, TakingOverWithoutAGatewayRemovesNothing) {
    gateway.speakUpnp(false);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(log.countPart("unmapping existing ports"), 0);
}

TEST_F(ManualAttemptTest, RelayEndsManualForwarding) {
    givenManualForwarding();
    clock.advance(300);
    relayWorks();
    web.answer("/test?", kNotReached);
    ASSERT_EQ(cycle(), RELAYED);
    forget();
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("manualPortForwardChange 1, lastManualPortForward 0,"), 1);
}

struct BadPort {
    const char* name;
    const char* http;
    const char* https;
    const char* service;  // empty: both are fine
};
class ManualPortTest : public ManualAttemptTest, public testing::WithParamInterface<BadPort> {};

TEST_P(ManualPortTest, MustBeWithinTheRange) {
    setConfig("MANUAL_EXTERNAL_HTTP_PORT", GetParam().http);
    setConfig("MANUAL_EXTERNAL_HTTPS_PORT", GetParam().https);
    const std::string service = GetParam().service;
    EXPECT_EQ(manager().createDirectConnection(), service.empty() ? PORTFORWARDED : FAILED);
    EXPECT_EQ(testedPorts().empty(), !service.empty());
    EXPECT_EQ(log.countPart("bad value for manually configured " + service + " Port.\n"),
              service.empty() ? 0 : 1);
}
INSTANTIATE_TEST_SUITE_P(Values,
                         ManualPortTest,
                         testing::Values(BadPort{"HttpsEmpty", "80", "", "HTTPS"},
                                         BadPort{"HttpZero", "0", "443", "HTTP"},
                                         BadPort{"HttpTooHigh", "65536", "443", "HTTP"},
                                         BadPort{"HttpNoNumber", "web", "443", "HTTP"},
                                         BadPort{"BothAtTheEnds", "1", "65535", ""}),
                         RowName{});

TEST_F(ManualAttemptTest, UnchangedPortsAreTestedAfterTheIntervalAndNotPublishedAgain) {
    givenManualForwarding();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    clock.advance(300);
    diskIsAsleep();
    EXPECT_EQ(cycle(0), PORTFORWARDED);
    EXPECT_TRUE(testedPorts().empty());
    diskIsAwake();
    for (int round = 0; round < 2; ++round) EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{18080}));
    EXPECT_TRUE(records().empty());
    EXPECT_TRUE(events().empty());
}

TEST_F(ManualAttemptTest, ChangedPortAndForcedAttemptAreTestedAtOnceAndPublished) {
    givenManualForwarding();
    setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "28443");
    EXPECT_EQ(cycle(), PORTFORWARDED);
    setConfig("MANUAL_EXTERNAL_HTTP_PORT", "28080");
    EXPECT_EQ(cycle(), PORTFORWARDED);
    manager().setForceConnect(true);
    for (int round = 0; round < 2; ++round) EXPECT_EQ(cycle(0), PORTFORWARDED);
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&18080&28443",
                                "44.128.0.20&192.168.77.10&28080&28443",
                                "44.128.0.20&192.168.77.10&28080&28443"}));
}

// The server may send anything as an address; the fixture looks for secrets in all lines.
TEST_F(ManualAttemptTest, ChangedExternalAddressIsPublishedAndStaysMasked) {
    serverSees(support::kDeviceId);
    givenManualForwarding();
    serverSees(kWanIp);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&18080&18443"}));
    EXPECT_EQ(log.countPart("detected change to external IP [*ID_REMOVED*]"), 1) << log.dump();
}

// The user's router may well sit behind another one: only the test counts.
TEST_F(ManualAttemptTest, ClosedPortFailsAndIsReported) {
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(testedPorts(), (Ports{18080, 18080, 18080}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
}

TEST_F(ManualAttemptTest, SkippedTestKeepsThePreviousConnectionType) {
    ASSERT_EQ(automaticCycle(), PORTFORWARDED);
    askToWait();
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_TRUE(testedPorts().empty());
    EXPECT_TRUE(records().empty());
}

TEST_F(ManualAttemptTest, DoubleNatSeenByTheAutomaticSearchEndsTheAttempt) {
    web.answer("/test?", kOtherNat);
    ASSERT_EQ(automaticCycle(), FAILED);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(testedPorts().empty());
    EXPECT_TRUE(events().empty());
}

TEST_F(ManualAttemptTest, UnpublishedPortsFailOnceAndAreTriedAgain) {
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
    web.answer("/forward?", "Success");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
}

}  // namespace
}  // namespace pelorus
