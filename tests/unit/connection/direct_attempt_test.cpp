#include "connection_fixture.h"

namespace pelorus {
namespace {

class DirectConnectionTest : public ConnectionTest {};

TEST_F(DirectConnectionTest, MapsTestsAndPublishesBothServices) {
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(gateway.mappings(),
              (std::vector<FakeGateway::Mapping>{{9091, kLanIp, 80, "Kavra"},
                                                 {9444, kLanIp, 443, "KavraSSL"}}));
    const std::string device = support::kDeviceId;
    const std::string auth = support::kDeviceAuth;
    EXPECT_EQ(web.urls(),
              (Texts{"http://cloud.kavra.example/api/1.0/rest/remote_access_status/" + device,
                     "https://cloud.kavra.example/test?" + device +
                         "&ip=44.128.0.20&port=9091&HTTP&" + auth,
                     "https://cloud.kavra.example/forward?" + device +
                         "&44.128.0.20&192.168.77.10&9091&9444&" + auth,
                     "http://127.0.0.1:80/setforward?44.128.0.20&9091&9444&192.168.77.10&80",
                     "http://127.0.0.1:80/setstatus?portforwarded"}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "connected/portforwarded"}));
    expectLogged(
        LOG_NOTICE,
        "ConnectionManager::createDirectConnection - Resetting HTTP allocated ports due to external or local IP change: [0] / Default Port Only: [0].\n");
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection() - success - internal Http Port: [80] is mapped to external Port: [9091].\n");
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection() - success - internal Https Port: [443] is mapped to external Port: [9444].\n");
}

struct InternalPort {
    const char* name;
    const char* value;
    int mappedTo;
};
class InternalPortTest : public ConnectionTest, public testing::WithParamInterface<InternalPort> {};

TEST_P(InternalPortTest, IsTakenFromTheConfiguration) {
    setConfig("INTERNAL_HTTPS_PORT", GetParam().value);
    setConfig("MANUAL_PORT_FORWARD", "true");  // not the word that chooses manual forwarding
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(gateway.count("map TCP 9444 -> 192.168.77.10:" + std::to_string(GetParam().mappedTo) +
                            " KavraSSL"),
              1);
}
INSTANTIATE_TEST_SUITE_P(Values,
                         InternalPortTest,
                         testing::Values(InternalPort{"Given", "8443", 8443},
                                         InternalPort{"EmptyMeansDefault", "", 443},
                                         InternalPort{"UnreadableMeansDefault", "https", 443}),
                         RowName{});

TEST_F(DirectConnectionTest, RetestsTheHttpPortOnceTheIntervalHasPassed) {
    givenForwardedPorts();  // tested at the start
    clock.set(support::VirtualClock::kStart + 240);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    clock.set(support::VirtualClock::kStart + 241);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));
    EXPECT_TRUE(records().empty());
    EXPECT_TRUE(gateway.calls(" -> ").empty());
}

TEST_F(DirectConnectionTest, SleepingDiskIsNotWokenAndPortsCountAsOpen) {
    givenForwardedPorts();
    clock.advance(300);
    diskIsAsleep();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(testedPorts().empty());
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection() - testPort success 1, current connectionType 1. Going to PORTFORWARDED.\n");
}

TEST_F(DirectConnectionTest, ForcedTestIgnoresDiskAndInterval) {
    givenForwardedPorts();
    diskIsAsleep();
    manager().setForceConnect(true);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "connected/portforwarded"}));
}

TEST_F(DirectConnectionTest, FailedRetestSearchesAgainAndPublishesTheNewPort) {
    givenForwardedPorts();
    clock.advance(300);
    for (int attempt = 0; attempt < 3; ++attempt) web.answerOnce("&port=9091&", kNotReached);
    gateway.add({9093, "192.168.77.66", 80});
    gateway.refusePort(9091);
    gateway.refusePort(9092);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091, 9091, 9091, 9094}));
    EXPECT_EQ(mappedPorts(), (std::vector<int>{9094, 9444}));  // the old ones were cleared away
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&9094&9444"}));
}

TEST_F(DirectConnectionTest, DoubleNatAtARetestGoesToTheRelayAndLeavesTheMappings) {
    givenForwardedPorts();
    clock.advance(300);
    relayWorks();
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(mappedPorts(), (std::vector<int>{9091, 9444}));
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));  // no second attempt
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection() - FAIL - Port Test, Double-NAT detected, switching to RELAY \n");
}

TEST_F(DirectConnectionTest, ChangedExternalAddressDropsTheMappingsAndMakesThemAnew) {
    givenForwardedPorts();
    gateway.setExternalIp("44.128.0.77");
    diskIsAsleep();  // an address change is worth waking it
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(gateway.calls("map TCP"),
              (Texts{"unmap TCP 9091", "unmap TCP 9444", "map TCP 9091 -> 192.168.77.10:80 Kavra",
                     "map TCP 9444 -> 192.168.77.10:443 KavraSSL"}));
    EXPECT_EQ(records(), (Texts{"44.128.0.77&192.168.77.10&9091&9444"}));
}

TEST_F(DirectConnectionTest, OtherPortIsGivenUpWhereOnlyTheDefaultIsAllowed) {
    gateway.refusePort(9091);
    givenForwardedPorts();
    ASSERT_EQ(mappedPorts(), (std::vector<int>{9092, 9444}));
    gateway.acceptPort(9091);
    setConfig("DEFAULT_PORTS_ONLY", "TRUE");
    clock.advance(300);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (std::vector<int>{9091, 9444}));
}

TEST_F(DirectConnectionTest, HttpAloneIsNoConnectionAndIsRemoved) {
    for (int port = 9444; port <= 9543; ++port) gateway.refusePort(port);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_TRUE(records().empty());
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
}

TEST_F(DirectConnectionTest, UnpublishedMappingIsKeptAndTestedAgain) {
    relayWorks();
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(mappedPorts(), (std::vector<int>{9091, 9444}));
    EXPECT_TRUE(statusWords().empty());
    expectLogged(
        LOG_ERR,
        "ConnectionManager::createDirectConnection() - failed to update mapping info, attempting to delete server mapping.\n");
    forget();
    clock.advance(300);
    web.answer("/forward?", "Success");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));
}

struct GatewayGone {
    const char* name;
    std::string answer;
    bool serverSaysWait;
    ConnectionType wanted;
};
class GatewayGoneTest : public ConnectionTest, public testing::WithParamInterface<GatewayGone> {};

TEST_P(GatewayGoneTest, PortsForwardedEarlierAreTestedWithoutIt) {
    givenForwardedPorts();
    gateway.speakUpnp(false);
    diskIsAsleep();  // not asked here
    web.answer("/test?", GetParam().answer);
    if (GetParam().serverSaysWait) {
        web.answer("/remote_access_status/", "<action>wait</action><wait_time>300</wait_time>");
    }
    EXPECT_EQ(manager().createDirectConnection(), GetParam().wanted);
    EXPECT_EQ(testedPorts().empty(), GetParam().serverSaysWait);
    EXPECT_EQ(commands.count("hdparm"), 0);
}
INSTANTIATE_TEST_SUITE_P(Answers,
                         GatewayGoneTest,
                         testing::Values(GatewayGone{"StillOpen", kPassed, false, PORTFORWARDED},
                                         GatewayGone{"NotTested", "", true, PORTFORWARDED},
                                         GatewayGone{"Closed", kNotReached, false, FAILED}),
                         RowName{});

TEST_F(DirectConnectionTest, WithoutAnyGatewayNothingIsTested) {
    gateway.speakUpnp(false);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(web.urls().empty());
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection - Don't test port since either pRouter->isInitialized 0, or allocatedHttpPort 0 is 0, or lastManualPortForward 0 is true.\n");
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createDirectConnection() - Failed trying automatic port test. Resume or try RELAY mode.\n");
}

TEST_F(DirectConnectionTest, RelayedDeviceSearchesEachCycleOnceAGatewayAppears) {
    gateway.speakUpnp(false);
    relayWorks();
    EXPECT_EQ(cycle(), RELAYED);
    setConfig("COMMUNICATION_STATUS", "relayed");
    forget();
    gateway.speakUpnp(true);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(statusWords(), (Texts{"portforwarded"}));
}

TEST_F(DirectConnectionTest, MakersRouterWithoutWanReportsFailedAndMapsNothing) {
    setConfig("DEVICETYPE", "5");
    commands.answer("getip.sh wan", "");
    commands.answer("getip.sh lan", "192.168.77.1\n");
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(commands.count(" add "), 0);
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_FALSE(TavikClient::getInstance()->lastPortTestPassed());
}

TEST_F(DirectConnectionTest, MakersRouterMapsThroughItsScript) {
    setConfig("DEVICETYPE", "5");
    commands.answer("getip.sh wan", "44.128.0.20\n");
    commands.answer("getip.sh lan", "192.168.77.1\n");
    commands.answer("tavik_helper.sh list", "OTHER,TCP,9091,192.168.77.66,80,web\n");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_EQ(commands.count("add \"TCP,9091,"), 0);
    EXPECT_EQ(commands.count("tavik_helper.sh add \"TCP,9092,192.168.77.1,80,Kavra\""), 1);
    EXPECT_EQ(commands.count("tavik_helper.sh add \"TCP,9444,192.168.77.1,443,KavraSSL\""), 1);
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.1&9092&9444"}));
    EXPECT_TRUE(gateway.calls().empty());
}

}  // namespace
}  // namespace pelorus
