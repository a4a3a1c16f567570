#include <csignal>

#include "common/termination.h"
#include "connection_fixture.h"

namespace pelorus {
namespace {

class ManualForwardingTest : public ConnectionTest {
protected:
    ManualForwardingTest() {
        setConfig("MANUAL_PORT_FORWARD", "TRUE");
        setConfig("MANUAL_EXTERNAL_HTTP_PORT", "18080");
        setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "18443");
        // Without an address in the request the server tells the one it tested.
        web.answer("/test?", kPassed + "<external_ip>44.128.0.20</external_ip>");
    }
    void givenManualForwarding() {
        ASSERT_EQ(cycle(), PORTFORWARDED);
        setConfig("COMMUNICATION_STATUS", "portforwarded");
        forget();
    }
};

TEST_F(ManualForwardingTest, TestsAndPublishesThePortsOfTheUser) {
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{18080}));
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&18080&18443"}));
    EXPECT_EQ(statusWords(), (Texts{"portforwarded"}));
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_EQ(gateway.count(" -> "), 0);
}

TEST_F(ManualForwardingTest, TakingOverRemovesTheAutomaticMappingsAndOnlyThem) {
    gateway.add({5000, kLanIp, 22, "ssh"});
    setConfig("MANUAL_PORT_FORWARD", "FALSE");
    givenForwardedPorts();
    setConfig("MANUAL_PORT_FORWARD", "TRUE");
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (std::vector<int>{5000}));
    forget();
    setConfig("MANUAL_PORT_FORWARD", "FALSE");
    clock.advance(300);
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
}

struct BadPort {
    const char* name;
    const char* http;
    const char* https;
    const char* service;  // empty: both are fine
};
class ManualPortTest : public ManualForwardingTest, public testing::WithParamInterface<BadPort> {};

TEST_P(ManualPortTest, MustBeWithinTheRange) {
    setConfig("MANUAL_EXTERNAL_HTTP_PORT", GetParam().http);
    setConfig("MANUAL_EXTERNAL_HTTPS_PORT", GetParam().https);
    const std::string service = GetParam().service;
    EXPECT_EQ(manager().createDirectConnection(), service.empty() ? PORTFORWARDED : FAILED);
    EXPECT_EQ(testedPorts().empty(), !service.empty());
    if (service.empty()) return;
    expectLogged(LOG_ERR,
                 "ConnectionManager::manualPortForward - bad value for manually configured " +
                     service + " Port.\n");
}
INSTANTIATE_TEST_SUITE_P(Values,
                         ManualPortTest,
                         testing::Values(BadPort{"HttpsEmpty", "80", "", "HTTPS"},
                                         BadPort{"HttpZero", "0", "443", "HTTP"},
                                         BadPort{"HttpTooHigh", "65536", "443", "HTTP"},
                                         BadPort{"HttpsNoNumber", "80", "web", "HTTPS"},
                                         BadPort{"HttpBeyondAnyInteger", "99999999999999999999",
                                                 "443", "HTTP"},
                                         BadPort{"BothAtTheEnds", "1", "65535", ""}),
                         RowName{});

TEST_F(ManualForwardingTest, UnchangedPortsAreTestedAfterTheIntervalAndNotPublishedAgain) {
    givenManualForwarding();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    clock.advance(300);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{18080}));
    EXPECT_TRUE(records().empty());
}

TEST_F(ManualForwardingTest, ChangedPortIsTestedAtOnceAndPublished) {
    givenManualForwarding();
    diskIsAsleep();  // a change is worth waking it
    setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "28443");
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&18080&28443"}));
}

TEST_F(ManualForwardingTest, ChangedExternalAddressIsPublished) {
    givenManualForwarding();
    gateway.setExternalIp("44.128.0.55");
    web.answer("/test?", kPassed + "<external_ip>44.128.0.55</external_ip>");
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(records(), (Texts{"44.128.0.55&192.168.77.10&18080&18443"}));
    expectLogged(
        LOG_INFO,
        "ConnectionManager::manualPortForward - detected change to external IP [44.128.0.20] or local IP [192.168.77.10]\n");
}

// The server may send anything as an address; the fixture looks for secrets in all lines.
TEST_F(ManualForwardingTest, AddressThatHoldsTheDeviceIdStaysOutOfTheLog) {
    web.answer("/test?", kPassed + "<external_ip>" + support::kDeviceId + "</external_ip>");
    givenManualForwarding();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(log.countPart("detected change to external IP [*ID_REMOVED*]"), 1) << log.dump();
}

// The user's router may well sit behind another one: only the test counts.
TEST_F(ManualForwardingTest, ClosedPortFailsAndIsReported) {
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{18080, 18080, 18080}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
}

TEST_F(ManualForwardingTest, SkippedTestKeepsTheConnectionTypeOfBefore) {
    setConfig("COMMUNICATION_STATUS", "relayed");
    web.answer("/remote_access_status/", "<action>wait</action><wait_time>300</wait_time>");
    EXPECT_EQ(manager().createDirectConnection(), FAILED);  // what the process started as
    EXPECT_TRUE(testedPorts().empty());
    EXPECT_TRUE(records().empty());
}

TEST_F(ManualForwardingTest, DoubleNatSeenByTheAutomaticSearchEndsTheAttempt) {
    setConfig("MANUAL_PORT_FORWARD", "FALSE");
    web.answer("/test?", kOtherNat);
    ASSERT_EQ(manager().createDirectConnection(), FAILED);
    setConfig("MANUAL_PORT_FORWARD", "TRUE");
    forget();
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(testedPorts().empty());
    EXPECT_TRUE(events().empty());
    expectLogged(
        LOG_INFO,
        "ConnectionManager::manualPortForward - relay mode is enforced, therefore don't manual forward ports.\n");
}

TEST_F(ManualForwardingTest, UnpublishedPortsFailOnceAndAreTriedAgain) {
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
    expectLogged(
        LOG_ERR,
        "ConnectionManager::manualPortForward - failed to update port mapping on server.\n");
    web.answer("/forward?", "Success");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
}

class NetworkAddrsTest : public ConnectionTest {
protected:
    NetworkAddrs& addresses = *NetworkAddrs::getInstance();
};

TEST_F(NetworkAddrsTest, NothingIsAskedBeforeSomethingWasPublished) {
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_TRUE(web.urls().empty());
}

TEST_F(NetworkAddrsTest, TellsWhichAddressChanged) {
    addresses.setNetworkAddrs(kWanIp, "192.168.77.99");
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 1);
    EXPECT_FALSE(addresses.hasExternalIPChanged());
    EXPECT_TRUE(addresses.hasInternalIPChanged());
    EXPECT_TRUE(addresses.haveNetworkAddrsChanged());
    EXPECT_EQ(addresses.getLocalIp(), "192.168.77.99");  // only publishing records a new one
}

TEST_F(NetworkAddrsTest, WithoutAGatewayTheServerIsAskedOncePerInterval) {
    gateway.speakUpnp(false);
    web.answer("/myip", "44.128.0.55");
    addresses.SetIntervalDuration(600);
    addresses.setNetworkAddrs(kWanIp, kLanIp);
    clock.advance(600);
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_EQ(web.count("/myip"), 0);
    clock.advance(1);
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 1);
    EXPECT_TRUE(addresses.hasExternalIPChanged());
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_EQ(web.count("/myip"), 1);
}

TEST_F(NetworkAddrsTest, FailedQuestionIsRepeatedAtTheNextChance) {
    gateway.speakUpnp(false);
    web.answer("/myip", "not an address");
    addresses.setNetworkAddrs(kWanIp, kLanIp);
    clock.advance(721);
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_EQ(web.count("/myip"), 2);
    expectLogged(LOG_ERR, "NetworkAddrs::getMyIP - failed to retrieve external IP address\n");
    expectLogged(LOG_ERR, "NetworkAddrs::discoverNetworkAddrs - getMyIP returned false\n");
}

TEST_F(NetworkAddrsTest, WaitsAsOftenAsTheServerAsks) {
    const std::string wait = "<action>wait</action><wait_time>30</wait_time>";
    web.answerOnce("/remote_access_status/", wait);
    web.answerOnce("/remote_access_status/", wait);
    web.answer("/myip", kWanIp);
    std::string ip;
    EXPECT_EQ(addresses.getMyIP(ip), 1);
    EXPECT_EQ(ip, kWanIp);
    EXPECT_EQ(clock.pauses(), (std::vector<long>{30, 30}));
}

TEST_F(NetworkAddrsTest, TerminationEndsAWaitThatTheServerNeverEnds) {
    web.answer("/remote_access_status/", "<action>wait</action><wait_time>30</wait_time>");
    clock.duringPause(3, [] { sigConnKilled = SIGTERM; });
    std::string ip = "untouched";
    EXPECT_EQ(addresses.getMyIP(ip), 0);
    EXPECT_EQ(ip, "untouched");
    EXPECT_EQ(clock.pauses().size(), 3U);
    EXPECT_EQ(web.count("/myip"), 0);
}

}  // namespace
}  // namespace pelorus
