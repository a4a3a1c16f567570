#include "connection_fixture.h"

namespace pelorus {
namespace {

class DirectAttemptTest : public ConnectionTest {};

TEST_F(DirectAttemptTest, MapsTestsAndPublishesBothServices) {
    clientRuns();
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(gateway.mappings(),
              (std::vector<FakeGateway::Mapping>{{9091, kLanIp, 8080, "Kavra"},
                                                 {9444, kLanIp, 8443, "KavraSSL"}}));
    const std::string device = support::kDeviceId;
    const std::string auth = support::kDeviceAuth;
    EXPECT_EQ(web.urls(),
              (Texts{"http://cloud.kavra.example/api/1.0/rest/remote_access_status/" + device,
                     "https://cloud.kavra.example/test?" + device +
                         "&ip=44.128.0.20&port=9091&HTTP&" + auth,
                     "https://cloud.kavra.example/forward?" + device +
                         "&44.128.0.20&192.168.77.10&9091&9444&" + auth,
                     "http://127.0.0.1:8080/setforward?44.128.0.20&9091&9444&192.168.77.10&8080",
                     "http://127.0.0.1:8080/setstatus?portforwarded"}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "connected/portforwarded"}));
    EXPECT_EQ(commands.count("kill -15 "), 1);  // the relay is not needed any more
    gateway.speakUpnp(false);
    std::string ip;
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
    EXPECT_EQ(ip, kWanIp);  // as the server saw it
}

TEST_F(DirectAttemptTest, UnreadableInternalPortsCountAsTheUsualOnes) {
    setConfig("INTERNAL_HTTP_PORT", "http");
    setConfig("INTERNAL_HTTPS_PORT", "");
    setConfig("MANUAL_PORT_FORWARD", "true");  // not the word that chooses manual forwarding
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(gateway.mappings(),
              (std::vector<FakeGateway::Mapping>{{9091, kLanIp, 80, "Kavra"},
                                                 {9444, kLanIp, 443, "KavraSSL"}}));
}

TEST_F(DirectAttemptTest, RetestsTheHttpPortOnceTheIntervalHasPassed) {
    givenForwardedPorts();  // tested at the start
    clock.set(support::VirtualClock::kStart + 240);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    for (int round = 0; round < 2; ++round) {
        clock.set(support::VirtualClock::kStart + 241);
        EXPECT_EQ(cycle(), PORTFORWARDED);
        EXPECT_EQ(testedPorts(), (Ports{9091}));  // the second round is within the interval
    }
    EXPECT_TRUE(records().empty());
    EXPECT_TRUE(events().empty());
    EXPECT_TRUE(gateway.calls(" -> ").empty());
}

TEST_F(DirectAttemptTest, MappingsPastHalfOfTheirLeaseAreRenewedHttpFirst) {
    manager().killConnection(PORTFORWARDED);  // finds the gateway, as at the daemon's start
    manager().setReqPortMappingLifetime(600, 600);
    givenForwardedPorts();
    clock.advance(300);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(gateway.calls(" -> "), (Texts{"map TCP 9091 -> 192.168.77.10:8080 ",
                                            "map TCP 9444 -> 192.168.77.10:8443 "}));
}

TEST_F(DirectAttemptTest, PortsCountAsOpenWhileTheDiskSleeps) {
    givenForwardedPorts();
    clock.advance(300);
    diskIsAsleep();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_TRUE(testedPorts().empty());
    EXPECT_EQ(mappedPorts(), (Ports{9091, 9444}));
    diskIsAwake();
    EXPECT_EQ(cycle(0), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091}));  // a skipped test starts no interval
}

TEST_F(DirectAttemptTest, ForcedTestIgnoresDiskAndInterval) {
    givenForwardedPorts();
    diskIsAsleep();
    manager().setForceConnect(true);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "connected/portforwarded"}));
}

TEST_F(DirectAttemptTest, FailedRetestSearchesAgainAndPublishesTheNewPort) {
    givenForwardedPorts();
    clock.advance(300);
    failTest(9091);
    gateway.add({9093, "192.168.77.66", 80});
    gateway.refusePort(9091);
    gateway.refusePort(9092);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091, 9091, 9091, 9094}));
    EXPECT_EQ(gateway.calls("map TCP 90"),
              (Texts{"map TCP 9091 -> 192.168.77.10:8080 Kavra", "unmap TCP 9091",
                     "map TCP 9092 -> 192.168.77.10:8080 Kavra", "unmap TCP 9091", "unmap TCP 9091",
                     "map TCP 9094 -> 192.168.77.10:8080 Kavra"}));
    EXPECT_EQ(mappedPorts(), (Ports{9094, 9444}));
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.10&9094&9444"}));
    EXPECT_EQ(gateway.count("discover "), 2);  // the search looks for the gateway anew
}

TEST_F(DirectAttemptTest, DoubleNatAtARetestGoesToTheRelayAndLeavesTheMappings) {
    givenForwardedPorts();
    clock.advance(300);
    relayWorks();
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(mappedPorts(), (Ports{9091, 9444}));
    EXPECT_EQ(testedPorts(), (Ports{9091}));  // no second attempt
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
}

TEST_F(DirectAttemptTest, DoubleNatAtASearchLeavesTheHttpsPortButRetestsNothing) {
    givenForwardedPorts();
    failTest(9091);
    manager().setForceConnect(true);
    web.answer("/test?", kOtherNat);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(mappedPorts(), (Ports{9444}));
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded",
                               "connecting/portforwarded", "failed/portforwarded"}));
    forget();
    web.answer("/test?", kPassed);
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091}));
}

TEST_F(DirectAttemptTest, ChangedAddressDropsTheMappingsAndMakesThemAnew) {
    givenForwardedPorts();
    gateway.setExternalIp("44.128.0.77");
    diskIsAsleep();  // an address change is worth waking it
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(gateway.calls("map TCP"),
              (Texts{"unmap TCP 9091", "unmap TCP 9444", "map TCP 9091 -> 192.168.77.10:8080 Kavra",
                     "map TCP 9444 -> 192.168.77.10:8443 KavraSSL"}));
    EXPECT_EQ(records(), (Texts{"44.128.0.77&192.168.77.10&9091&9444"}));
    forget();
    net.setInterfaces({{"eth0", "192.168.77.11"}});
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(records(), (Texts{"44.128.0.77&192.168.77.11&9091&9444"}));
}

TEST_F(DirectAttemptTest, OtherPortIsGivenUpWhereOnlyTheDefaultIsAllowed) {
    gateway.refusePort(9091);
    givenForwardedPorts();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    ASSERT_EQ(mappedPorts(), (Ports{9092, 9444}));
    EXPECT_EQ(gateway.count("map TCP"), 0);
    gateway.acceptPort(9091);
    setConfig("DEFAULT_PORTS_ONLY", "TRUE");
    clock.advance(300);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    EXPECT_EQ(mappedPorts(), (Ports{9091, 9444}));
}

TEST_F(DirectAttemptTest, HttpAloneIsNoConnectionAndIsRemoved) {
    for (int port = 9444; port <= 9543; ++port) gateway.refusePort(port);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(gateway.count(" -> "), 1 + 100 + 99 + 99);
    EXPECT_EQ(gateway.count("map TCP 9444 -> "), 3);  // once a cycle
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_TRUE(records().empty());
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
}

TEST_F(DirectAttemptTest, UnpublishedMappingIsKeptAndTestedAgain) {
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(mappedPorts(), (Ports{9091, 9444}));
    EXPECT_TRUE(statusWords().empty());
    EXPECT_EQ(events(), (Texts{"connecting/portforwarded", "failed/portforwarded"}));
    forget();
    clock.advance(300);
    web.answer("/forward?", "Success");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091}));
}

TEST_F(DirectAttemptTest, PortsForwardedEarlierAreTestedWithoutTheirGateway) {
    givenForwardedPorts();
    gateway.speakUpnp(false);
    diskIsAsleep();  // not asked here
    web.answer("/test?", kPassed);
    EXPECT_EQ(cycle(), PORTFORWARDED);
    askToWait();
    EXPECT_EQ(cycle(), PORTFORWARDED);  // not tested is not closed
    EXPECT_EQ(testedPorts(), (Ports{9091}));
    web.answer("/remote_access_status/", "<action>proceed</action>");
    web.answer("/test?", kNotReached);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(commands.count("hdparm"), 0);
    EXPECT_EQ(log.countPart("due to UPnP not working. Elapsed time 0, "), 1) << log.dump();
    forget();
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(web.urls().empty());  // no port is left to test
}

struct FileStatus {
    const char* name;
    std::string word;
    ConnectionType kept;
    bool searches;
};
class FileStatusTest : public DirectAttemptTest, public testing::WithParamInterface<FileStatus> {};

TEST_P(FileStatusTest, IsKeptUntilTheNextSearch) {
    for (int port = 9444; port <= 9543; ++port) gateway.refusePort(port);
    manager().killConnection(PORTFORWARDED);
    ASSERT_EQ(cycle(), FAILED);  // the HTTP port was tested, HTTPS refused, the relay is down
    clock.set(support::VirtualClock::kStart + 240);  // the end of the interval
    setConfig("COMMUNICATION_STATUS", "connecting");
    EXPECT_EQ(manager().createDirectConnection(), CONNECTING);
    setConfig("COMMUNICATION_STATUS", GetParam().word);
    forget();
    EXPECT_EQ(manager().createDirectConnection(), GetParam().kept);
    EXPECT_EQ(testedPorts().empty(), !GetParam().searches);
}
INSTANTIATE_TEST_SUITE_P(Words,
                         FileStatusTest,
                         testing::Values(FileStatus{"Forwarded", "portforwarded", PORTFORWARDED,
                                                    false},
                                         FileStatus{"Failed", "failed", FAILED, false},
                                         FileStatus{"Relayed", "relayed", FAILED, true}),
                         RowName{});

TEST_F(DirectAttemptTest, SearchesUntilItsPortIsTestedAndWhileRelayedOncePerInterval) {
    givenForwardedPorts();
    EXPECT_EQ(cycle(), PORTFORWARDED);
    manager().killConnection(PORTFORWARDED);
    clock.advance(300);
    diskIsAsleep();
    for (const char* status : {"portforwarded", "portforwarded", "relayed", "portforwarded"}) {
        setConfig("COMMUNICATION_STATUS", status);
        manager().createDirectConnection();
    }
    // A search for a connection that held does not wake the disk, so that its port stays untested.
    EXPECT_EQ(gateway.count("map TCP 9091 -> "), 3);
    EXPECT_TRUE(testedPorts().empty());
}

TEST_F(DirectAttemptTest, WithoutAnyGatewayNothingIsTested) {
    gateway.speakUpnp(false);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(events().empty());
}

TEST_F(DirectAttemptTest, MakersRouterWithoutWanReportsFailedAndMapsNothing) {
    givenMakersRouter("", "");
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(commands.count(" add "), 0);
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_FALSE(TavikClient::getInstance()->lastPortTestPassed());
}

TEST_F(DirectAttemptTest, MakersRouterMapsThroughItsScript) {
    givenMakersRouter("44.128.0.20\n", "OTHER,TCP,9091,192.168.77.66,80,web\n");
    EXPECT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    EXPECT_EQ(commands.count("add \"TCP,9091,"), 0);
    EXPECT_EQ(commands.count("tavik_helper.sh add \"TCP,9092,192.168.77.1,8080,Kavra\""), 1);
    EXPECT_EQ(commands.count("tavik_helper.sh add \"TCP,9444,192.168.77.1,8443,KavraSSL\""), 1);
    EXPECT_EQ(records(), (Texts{"44.128.0.20&192.168.77.1&9092&9444"}));
    EXPECT_TRUE(gateway.calls().empty());
}

}  // namespace
}  // namespace pelorus
