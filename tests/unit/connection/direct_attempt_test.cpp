#include "connection_fixture.h"

namespace pelorus {
namespace {

class DirectConnection : public ConnectionTest {};

TEST_F(DirectConnection, MapsTestsAndPublishesBothServices) {
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
    EXPECT_EQ(
        story(PORTFORWARDED),
        "unmap 0, unmap 0, " + kSearch +
            "map 9444>LAN:8443 KavraSSL, record WAN&LAN&9091&9444, tell WAN&9091&9444&LAN&8080, stop, connected/portforwarded, status portforwarded, force 0" +
            kKept);
    gateway.speakUpnp(false);
    std::string ip;
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
    EXPECT_EQ(ip, kWanIp);  // as the server saw it
}

void refuseHttps(World& w) {
    for (int port = 9445; port <= 9543; ++port) w.gateway.refusePort(port);
    w.gateway.refusePort(9444);
}

class FirstDirectAttempt : public StoryTest {};
TEST_P(FirstDirectAttempt, TellsAsExpected) {
    expectStories([this] {
        const auto type = manager().createDirectConnection();
        clock.advance(300);
        return type;
    });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, FirstDirectAttempt, testing::Values(
    // "true" is not the word that chooses manual forwarding.
    Row{"UnreadableInternalPortsCountAsTheUsualOnes", [](World& w) {
            w.setConfig("INTERNAL_HTTP_PORT", "http");
            w.setConfig("INTERNAL_HTTPS_PORT", "");
            w.setConfig("MANUAL_PORT_FORWARD", "true");
        }, {"unmap 0, unmap 0, connecting/portforwarded, map 9091>LAN:80 Kavra, test 9091, map 9444>LAN:443 KavraSSL, record WAN&LAN&9091&9444, tell WAN&9091&9444&LAN&80, connected/portforwarded, status portforwarded, force 0" + kKept}},
    Row{"UnpublishedMappingIsKeptAndTestedAgain", [](World& w) { w.web.answerOnce("/forward?", FakeWeb::noAnswer()); },
        {"unmap 0, unmap 0, " + kSearch + "map 9444>LAN:8443 KavraSSL, record WAN&LAN&9091&9444, failed/portforwarded = 9091 9444 failed", "unmap 9091, unmap 9444, " + kSearch + kPublish + ", status portforwarded, force 0" + kKept}},
    Row{"WithoutAnyGatewayNothingIsTested", [](World& w) { w.gateway.speakUpnp(false); }, {" = failed"}},
    Row{"MakersRouterWithoutWanReportsFailed", [](World& w) { w.givenMakersRouter("", ""); }, {"status failed = failed"}},
    Row{"MakersRouterMapsThroughItsScript",
        [](World& w) { w.givenMakersRouter("44.128.0.20\n", "OTHER,TCP,9091,192.168.77.66,80,web\n"); }, {"connecting/portforwarded, add \"TCP,9092,192.168.77.1,8080,Kavra\", test 9092, add \"TCP,9444,192.168.77.1,8443,KavraSSL\", record WAN&192.168.77.1&9092&9444, tell WAN&9092&9444&192.168.77.1&8080, connected/portforwarded, status portforwarded, force 0 = portforwarded", "disk, test 9092 = portforwarded"}},
    Row{"PredefinedPortsOfTheMakersRouterComeFirst", [](World& w) {
            w.givenMakersRouter("44.128.0.20\n", "OTHER,TCP,6000-6001,192.168.77.1,8888,other\n"
                "OTHER,TCP,7000-7001,192.168.77.1,8080,web\nOTHER,TCP,7443,192.168.77.1,8443,web\n");
            w.failTest(7000);
        }, {"connecting/portforwarded, test 7000, test 7000, test 7000, status failed, test 7001, record WAN&192.168.77.1&7001&7443, tell WAN&7001&7443&192.168.77.1&8080, connected/portforwarded, status portforwarded, force 0 = portforwarded"}},
    Row{"LeavesAPortOnlyWhereTheDefaultIsWanted", [](World& w) {
            w.gateway.refusePort(9091);
            w.manager().createDirectConnection();
            w.gateway.acceptPort(9091);
            w.setConfig("DEFAULT_PORTS_ONLY", "TRUE");
            w.forget();
        }, {"unmap 9092, unmap 9444, " + kSearch + kPublish + ", force 0" + kKept}}),
    RowName{});
// clang-format on

TEST_F(DirectConnection, HttpAloneIsNoConnectionAndIsRemoved) {
    refuseHttps(*this);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(gateway.count(" -> "), 1 + 100 + 99 + 99);
    EXPECT_EQ(gateway.count("map TCP 9444 -> "), 3);  // once a cycle
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_EQ(logged("state="),
              (Texts{"connecting type=portforwarded", "failed type=portforwarded"}));
}

class LaterDirectAttempt : public StoryTest {};
TEST_P(LaterDirectAttempt, TellsAsExpected) {
    manager().killConnection(PORTFORWARDED);
    manager().setReqPortMappingLifetime(1200, 1200);
    givenForwardedPorts();
    clock.set(support::VirtualClock::kStart + 240);
    EXPECT_EQ(story(cycle(1)), kKept);
    expectStories([this] { return cycle(); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, LaterDirectAttempt, testing::Values(
    Row{"RetestsTheHttpPortOnceTheIntervalHasPassed", [](World&) {}, {"disk, test 9091" + kKept, kKept}},
    Row{"RenewsMappingsPastHalfOfTheirLease", [](World& w) { w.clock.advance(360); }, {"map 9091>LAN:8080 , map 9444>LAN:8443 , disk, test 9091" + kKept}},
    Row{"CountsThePortsAsOpenWhileTheDiskSleeps", [](World& w) { w.diskIsAsleep(); }, {"disk" + kKept, "disk" + kKept}},
    Row{"IgnoresDiskAndIntervalWhenForced", [](World& w) {
            w.diskIsAsleep();
            w.manager().setForceConnect(true);
        }, {"force 1, connecting/portforwarded, test 9091, connected/portforwarded" + kKept, "connecting/portforwarded, test 9091, connected/portforwarded" + kKept}},
    Row{"SearchesAgainAfterAFailedRetest", [](World& w) {
            w.failTest(9091);
            w.gateway.add({9093, "192.168.77.66", 80});
            w.gateway.refusePort(9091);
            w.gateway.refusePort(9092);
        }, {"disk, test 9091, test 9091, test 9091, status failed, connecting/portforwarded, map 9091>LAN:8080 Kavra, unmap 9091, unmap 9444, map 9092>LAN:8080 Kavra, unmap 9091, unmap 9444, unmap 9091, unmap 9444, map 9094>LAN:8080 Kavra, disk, test 9094, map 9444>LAN:8443 KavraSSL, record WAN&LAN&9094&9444, tell WAN&9094&9444&LAN&8080, connected/portforwarded, status portforwarded, force 0 = 9094 9444 portforwarded"}},
    Row{"DoubleNatAtARetestGoesToTheRelay", [](World& w) {
            w.relayWorks();
            w.web.answer("/test?", kOtherNat);
        }, {"disk, test 9091, connecting/relayed, record NULL&LAN&0&0, withdraw 8080, start, connected/relayed, status relayed, force 0 = 9091 9444 relayed"}},
    Row{"DoubleNatAtASearchLeavesTheHttpsPort", [](World& w) {
            w.failTest(9091);
            w.manager().setForceConnect(true);
            w.web.answer("/test?", kOtherNat);
        }, {"force 1, connecting/portforwarded, test 9091, test 9091, test 9091, status failed, failed/portforwarded, " + kSearch + "unmap 9091, failed/portforwarded, " + kNoRelay + " = 9444 failed", kSearch + "unmap 9091, failed/portforwarded, " + kNoRelay + " = 9444 failed"}},
    // An address change is worth waking the disk.
    Row{"NewExternalAddressMakesTheMappingsAnew", [](World& w) {
            w.diskIsAsleep();
            w.gateway.setExternalIp("44.128.0.77");
        }, {"unmap 9091, unmap 9444, " + kSearch + "map 9444>LAN:8443 KavraSSL, record 44.128.0.77&LAN&9091&9444, tell 44.128.0.77&9091&9444&LAN&8080, connected/portforwarded, force 0" + kKept, kKept}},
    Row{"NewLocalAddressMakesTheMappingsAnew", [](World& w) {
            w.diskIsAsleep();
            w.net.setInterfaces({{"eth0", "192.168.77.11"}});
        }, {"unmap 9091, unmap 9444, connecting/portforwarded, map 9091>192.168.77.11:8080 Kavra, test 9091, map 9444>192.168.77.11:8443 KavraSSL, record WAN&192.168.77.11&9091&9444, tell WAN&9091&9444&192.168.77.11&8080, connected/portforwarded, force 0 = portforwarded"}},
    // A skipped test is no evidence against the ports.
    Row{"TestsThePortsWithoutTheirGateway", [](World& w) {
            w.gateway.speakUpnp(false);
            w.diskIsAsleep();
            w.web.answerOnce("/remote_access_status/", kWait);
        }, {kKept, "test 9091" + kKept}},
    Row{"ClosedPortsWithoutTheirGatewayAreForgotten", [](World& w) {
            w.gateway.speakUpnp(false);
            w.web.answer("/test?", kNotReached);
        }, {"test 9091, test 9091, test 9091, status failed, " + kNoRelay + " = 9091 9444 failed", kNoRelay + " = 9091 9444 failed"}}),
    RowName{});

TEST_F(DirectConnection, TestWithoutAGatewayStartsTheInterval) {
    givenForwardedPorts();
    gateway.speakUpnp(false);
    web.answer("/test?", kNotReached);
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("due to UPnP not working. Elapsed time 0, "), 1);
}

// A search for a connection that held does not wake the disk, so that its port stays untested.
TEST_F(DirectConnection, SearchesUntilItsPortIsTestedAndWhileRelayedOncePerInterval) {
    givenForwardedPorts();
    cycle();
    manager().killConnection(PORTFORWARDED);
    clock.advance(300);
    diskIsAsleep();
    forget();
    const std::string search = "connecting/portforwarded, map 9091>LAN:8080 Kavra, disk, unmap 9091, failed: trying next port in range, unmap 0, unmap 0, failed/portforwarded = failed";
    for (const char* status : {"portforwarded", "portforwarded", "relayed"}) {
        setConfig("COMMUNICATION_STATUS", status);
        EXPECT_EQ(story(manager().createDirectConnection()), search);
    }
    setConfig("COMMUNICATION_STATUS", "portforwarded");
    EXPECT_EQ(story(manager().createDirectConnection()), " = portforwarded");
}

class FileStatus : public StoryTest {};
TEST_P(FileStatus, IsKeptUntilTheNextSearch) {
    refuseHttps(*this);
    manager().killConnection(PORTFORWARDED);
    ASSERT_EQ(cycle(), FAILED);  // the HTTP port was tested, HTTPS refused, the relay is down
    clock.set(support::VirtualClock::kStart + 240);  // the end of the interval
    setConfig("COMMUNICATION_STATUS", "connecting");
    EXPECT_EQ(manager().createDirectConnection(), CONNECTING);
    for (int port = 9445; port <= 9543; ++port) gateway.acceptPort(port);
    forget();
    expectStories([this] { return manager().createDirectConnection(); });
}
INSTANTIATE_TEST_SUITE_P(Words, FileStatus, testing::Values(
    Row{"Forwarded", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "portforwarded"); }, {" = portforwarded"}},
    Row{"Failed", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "failed"); }, {" = failed"}},
    Row{"Relayed", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "relayed"); }, {kSearch + "map 9444>LAN:8443 KavraSSL, unmap 0, map 9445>LAN:8443 KavraSSL, record WAN&LAN&9091&9445, tell WAN&9091&9445&LAN&8080, connected/portforwarded, status portforwarded, force 0 = 9091 9445 portforwarded", " = 9091 9445 portforwarded"}}),
    RowName{});
// clang-format on

}  // namespace
}  // namespace pelorus
