#include "connection_fixture.h"

namespace pelorus {
namespace {

class DirectConnection : public ConnectionTest {};

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
    Row{"MapsTestsAndPublishesBothServices", [](World& w) { w.clientRuns(); },
        {"unmap 0 0, connecting, map 9091, test 9091, map 9444 SSL, publish WAN LAN 9091 9444, stop, up = 9091 9444 portforwarded"}},
    // "true" is not the word that chooses manual forwarding.
    Row{"UnreadableInternalPortsCountAsTheUsualOnes", [](World& w) {
            w.setConfig("INTERNAL_HTTP_PORT", "http");
            w.setConfig("INTERNAL_HTTPS_PORT", "");
            w.setConfig("MANUAL_PORT_FORWARD", "true");
        }, {"unmap 0 0, connecting, map 9091>LAN:80 Kavra, test 9091, map 9444>LAN:443 KavraSSL, "
            "record WAN&LAN&9091&9444, tell WAN&9091&9444&LAN&80, up = 9091 9444 portforwarded"}},
    Row{"UnpublishedMappingIsKeptAndTestedAgain", [](World& w) { w.web.answerOnce("/forward?", FakeWeb::noAnswer()); },
        {"unmap 0 0, connecting, map 9091, test 9091, map 9444 SSL, record WAN&LAN&9091&9444, failed = 9091 9444 failed",
         "unmap 9091 9444, connecting, map 9091, test 9091, map 9444 SSL, publish WAN LAN 9091 9444, up = 9091 9444 portforwarded"}},
    Row{"WithoutAnyGatewayNothingIsTested", [](World& w) { w.gateway.speakUpnp(false); }, {" = failed"}},
    Row{"MakersRouterWithoutWanReportsFailed", [](World& w) { w.givenMakersRouter("", ""); }, {"status failed = failed"}},
    Row{"MakersRouterMapsThroughItsScript",
        [](World& w) { w.givenMakersRouter("OTHER,TCP,9091,192.168.77.66,80,web\n"); },
        {"connecting, check 9091, range 9092, add \"TCP,9092,192.168.77.1,8080,Kavra\", test 9092, check 9444, "
         "add \"TCP,9444,192.168.77.1,8443,KavraSSL\", publish WAN 192.168.77.1 9092 9444, up = portforwarded",
         "disk, test 9092 = portforwarded"}},
    Row{"PredefinedPortsOfTheMakersRouterComeFirst", [](World& w) {
            w.givenMakersRouter("OTHER,TCP,6000-6001,192.168.77.1,8888,other\n"
                "OTHER,TCP,7000-7001,192.168.77.1,8080,web\nOTHER,TCP,1,192.168.77.1,8443,web\n");
            w.failTest(7000);
        }, {"connecting, test 7000 x3, status failed, test 7001, publish WAN 192.168.77.1 7001 1, up = portforwarded",
            "disk, test 7001 = portforwarded"}},
    Row{"LeavesAPortOnlyWhereTheDefaultIsWanted", [](World& w) {
            w.gateway.refusePort(9091);
            w.manager().createDirectConnection();
            w.gateway.acceptPort(9091);
            w.setConfig("DEFAULT_PORTS_ONLY", "TRUE");
            w.forget();
        }, {"unmap 9092 9444, connecting, map 9091, test 9091, map 9444 SSL, publish WAN LAN 9091 9444, connected, force 0"
            " = 9091 9444 portforwarded"}}),
    RowName{});
// clang-format on

TEST_F(DirectConnection, HttpAloneIsNoConnectionAndIsRemoved) {
    refuseHttps(*this);
    EXPECT_EQ(manager().createDirectConnection(), FAILED);
    EXPECT_EQ(gateway.count(" -> "), 1 + 100 + 99 + 99);
    EXPECT_EQ(gateway.count("map TCP 9444 -> "), 3);  // once a cycle
    EXPECT_TRUE(gateway.mappings().empty());
}

class LaterDirectAttempt : public StoryTest {};
TEST_P(LaterDirectAttempt, TellsAsExpected) {
    manager().killConnection(PORTFORWARDED);
    manager().setReqPortMappingLifetime(1200, 1200);
    givenForwardedPorts();
    clock.set(support::VirtualClock::kStart + 240);
    EXPECT_EQ(story(cycle(1)), " = 9091 9444 portforwarded");
    expectStories([this] { return cycle(); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, LaterDirectAttempt, testing::Values(
    Row{"RetestsTheHttpPortOnceTheIntervalHasPassed", [](World&) {},
        {"disk, test 9091 = 9091 9444 portforwarded", " = 9091 9444 portforwarded"}},
    Row{"RenewsMappingsPastHalfOfTheirLease", [](World& w) { w.clock.advance(360); },
        {"map 9091>LAN:8080 , map 9444>LAN:8443 , disk, test 9091 = 9091 9444 portforwarded"}},
    Row{"CountsThePortsAsOpenWhileTheDiskSleeps", [](World& w) { w.diskIsAsleep(); },
        {"disk = 9091 9444 portforwarded", "disk = 9091 9444 portforwarded"}},
    Row{"IgnoresDiskAndIntervalWhenForced", [](World& w) { w.diskIsAsleep(); w.manager().setForceConnect(true); },
        {"force 1, connecting, test 9091, connected = 9091 9444 portforwarded",
         "connecting, test 9091, connected = 9091 9444 portforwarded"}},
    Row{"SearchesAgainAfterAFailedRetest", [](World& w) {
            w.failTest(9091);
            w.gateway.add({9093, "192.168.77.66", 80});
            w.gateway.refusePort(9091);
            w.gateway.refusePort(9092);
        }, {"disk, test 9091 x3, status failed, connecting, map 9091, unmap 9091 9444, map 9092, unmap 9091 9444, "
            "unmap 9091 9444, map 9094, disk, test 9094, map 9444 SSL, publish WAN LAN 9094 9444, up = 9094 9444 portforwarded"}},
    Row{"DoubleNatAtARetestGoesToTheRelay", [](World& w) { w.relayWorks(); w.web.answer("/test?", kOtherNat); },
        {"disk, test 9091, relay up = 9091 9444 relayed"}},
    Row{"DoubleNatAtASearchLeavesTheHttpsPort", [](World& w) {
            w.failTest(9091);
            w.manager().setForceConnect(true);
            w.web.answer("/test?", kOtherNat);
        }, {"force 1, connecting, test 9091 x3, status failed, failed, connecting, map 9091, test 9091, unmap 9091, failed, "
            "no relay = 9444 failed", "connecting, map 9091, test 9091, unmap 9091, failed, no relay = 9444 failed"}},
    // An address change is worth waking the disk.
    Row{"NewExternalAddressMakesTheMappingsAnew", [](World& w) { w.diskIsAsleep(); w.gateway.setExternalIp("44.128.0.77"); },
        {"unmap 9091 9444, connecting, map 9091, test 44.128.0.77:9091, map 9444 SSL, publish 44.128.0.77 LAN 9091 9444, "
         "connected, force 0 = 9091 9444 portforwarded", " = 9091 9444 portforwarded"}},
    Row{"NewLocalAddressMakesTheMappingsAnew", [](World& w) {
            w.diskIsAsleep();
            w.net.setInterfaces({{"eth0", "192.168.77.11"}});
        }, {"unmap 9091 9444, connecting, map 9091>192.168.77.11:8080 Kavra, test 9091, map 9444>192.168.77.11:8443 KavraSSL, "
            "publish WAN 192.168.77.11 9091 9444, connected, force 0 = portforwarded"}},
    // A skipped test is no evidence against the ports.
    Row{"TestsThePortsWithoutTheirGateway", [](World& w) {
            w.gateway.speakUpnp(false);
            w.diskIsAsleep();
            w.web.answerOnce("/remote_access_status/", kWait);
        }, {" = 9091 9444 portforwarded", "test :9091 = 9091 9444 portforwarded"}},
    Row{"ClosedPortsWithoutTheirGatewayAreForgotten", [](World& w) {
            w.gateway.speakUpnp(false);
            w.web.answer("/test?", kNotReached);
        }, {"test :9091 x3, status failed, no relay = 9091 9444 failed", "no relay = 9091 9444 failed"}}),
    RowName{});
// clang-format on

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
    for (const char* status : {"portforwarded", "portforwarded", "relayed"}) {
        setConfig("COMMUNICATION_STATUS", status);
        EXPECT_EQ(story(manager().createDirectConnection()),
                  "connecting, map 9091, disk, unmap 9091, next port, unmap 0 0, failed = failed");
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
// clang-format off
INSTANTIATE_TEST_SUITE_P(Words, FileStatus, testing::Values(
    Row{"Forwarded", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "portforwarded"); }, {" = portforwarded"}},
    Row{"Failed", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "failed"); }, {" = failed"}},
    Row{"Relayed", [](World& w) { w.setConfig("COMMUNICATION_STATUS", "relayed"); },
        {"connecting, map 9091, test 9091, map 9444 SSL, unmap 0, map 9445 SSL, publish WAN LAN 9091 9445, up"
         " = 9091 9445 portforwarded", " = 9091 9445 portforwarded"}}),
    RowName{});
// clang-format on

}  // namespace
}  // namespace pelorus
