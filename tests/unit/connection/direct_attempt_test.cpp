#include "connection_fixture.h"

namespace pelorus {
namespace {

class FirstDirectAttempt : public StoryTest {};
TEST_P(FirstDirectAttempt, DoesThisInOrder) {
    expectStories([this] { return cycle(300); });
}
class LaterDirectAttempt : public StoryTest {};
TEST_P(LaterDirectAttempt, DoesThisInOrder) {
    manager().killConnection(PORTFORWARDED);
    manager().setReqPortMappingLifetime(1200, 1200);
    givenForwardedPorts();
    clock.set(support::VirtualClock::kStart + 240);
    EXPECT_EQ(story(cycle(1)), kForwarded);
    expectStories([this] { return cycle(); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, FirstDirectAttempt, testing::Values(
    Row{"MapsTestsAndPublishesBothServices", [](World& w) { w.clientRuns(); },
        {"unmap 0 0, " + kMapAndPublish + ", stop, " + kReported + kForwarded}},
    // "true" is not the word that chooses manual forwarding.
    Row{"UnreadableInternalPortsCountAsTheUsualOnes", [](World& w) {
            w.setConfig("INTERNAL_HTTP_PORT", "http");
            w.setConfig("INTERNAL_HTTPS_PORT", "");
            w.setConfig("MANUAL_PORT_FORWARD", "true");
        }, {"unmap 0 0, connecting, map 9091 -> LAN:80 Kavra, test 9091, map 9444 -> LAN:443 KavraSSL, "
            "record WAN&LAN&9091&9444, tell WAN&9091&9444&LAN&80, " + kReported + kForwarded}},
    Row{"UnpublishedMappingIsKeptAndTriedAgain", [](World& w) { w.web.answerOnce("/forward?", FakeWeb::noAnswer()); },
        {"unmap 0 0, connecting, map 9091, test 9091, map 9444 SSL, record WAN&LAN&9091&9444, failed, " +
         relayFails() + ", status failed, lanip = 9091 9444 failed", kMapAndPublish + ", " + kReported + kForwarded}}), RowName{});
INSTANTIATE_TEST_SUITE_P(Worlds, LaterDirectAttempt, testing::Values(
    Row{"RenewsMappingsPastHalfOfTheirLease", [](World& w) { w.clock.advance(360); },
        {"map 9091 -> LAN:8080 , map 9444 -> LAN:8443 , disk, test 9091" + kForwarded}},
    Row{"IgnoresDiskAndIntervalWhenForced", [](World& w) { w.diskIsAsleep(); w.manager().setForceConnect(true); },
        {"force 1, connecting, test 9091, connected" + kForwarded, "connecting, test 9091, connected" + kForwarded}},
    Row{"SearchesAgainAfterAFailedRetest", [](World& w) {
            w.failTest(9091);
            w.gateway.table.push_back({9093, "192.168.77.66", 80});
            w.gateway.refused = {9091, 9092};
        }, {"disk, test 9091 x3, status failed, connecting, map 9091, unmap 9091 9444, map 9092, "
            "unmap 9091 9444, unmap 9091 9444, map 9094, disk, test 9094, map 9444 SSL, " +
            publish(9094, 9444) + ", " + kReported + " = 9094 9444 portforwarded"}},
    Row{"AddressThatChangesDuringARetestWakesTheDisk", [](World& w) {
            w.failTest(9091);
            const auto change = [&w](auto&) { w.gateway.externalIp = "44.128.0.77"; };
            w.commands.answer("hdparm", {"active/idle\n", 0, false, change});
        }, {"disk, test 9091 x3, status failed, connecting, map 9091, test 44.128.0.77:9091, map 9444 SSL, " +
            publish(9091, 9444, "44.128.0.77") + ", " + kReported + kForwarded}},
    Row{"DoubleNatAtASearchLeavesTheHttpsPort",
        [](World& w) { w.failTest(9091); w.manager().setForceConnect(true); w.web.answer("/test?", kOtherNat); },
        {"force 1, connecting, test 9091 x3, status failed, failed, connecting, map 9091, test 9091, unmap 9091, "
         "failed, " + relayFails() + " = 9444 failed",
         "connecting, map 9091, test 9091, unmap 9091, failed, " + relayFails() + " = 9444 failed"}},
    // A skipped test is no evidence against the ports.
    Row{"TestsThePortsWithoutTheirGateway",
        [](World& w) { w.gateway.upnp = false; w.diskIsAsleep(); w.web.answerOnce("/remote_access_status/", kWait); },
        {kForwarded, "test :9091" + kForwarded}}), RowName{});
// clang-format on

// A search for a connection that held does not wake the disk, so that its port stays untested.
TEST_F(ConnectionTest, SearchesUntilItsPortIsTestedAndWhileRelayedOncePerInterval) {
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

TEST_F(ConnectionTest, StatusOfTheFileIsKeptUntilTheNextSearch) {
    for (int port = 9444; port <= 9543; ++port) gateway.refused.insert(port);
    manager().killConnection(PORTFORWARDED);
    ASSERT_EQ(cycle(), FAILED);  // the HTTP port was tested, HTTPS refused, the relay is down
    gateway.refused.erase(9445);
    clock.set(support::VirtualClock::kStart + 240);  // the end of the interval
    forget();
    for (const std::string status : {"connecting", "portforwarded", "failed"}) {
        setConfig("COMMUNICATION_STATUS", status);
        EXPECT_EQ(story(manager().createDirectConnection()), " = " + status);
    }
    setConfig("COMMUNICATION_STATUS", "relayed");
    EXPECT_EQ(story(manager().createDirectConnection()),
              "connecting, map 9091, test 9091, map 9444 SSL, unmap 0, map 9445 SSL, " +
                  publish(9091, 9445) + ", " + kReported + " = 9091 9445 portforwarded");
}

}  // namespace
}  // namespace pelorus
