#include "connection_fixture.h"

namespace pelorus {
namespace {

TEST_F(ConnectionTest, SteadyTypeStretchesThePortTestIntervalAndANewOneResetsIt) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 31; ++unchanged) cycle();
    EXPECT_EQ(story(PORTFORWARDED),
              "disk, test 9091, interval 360, disk, test 9091, interval 480, disk, test 9091, "
              "interval 600, interval 720, disk, test 9091, interval 840, interval 960, disk, "
              "test 9091, interval 960 = 9091 9444 portforwarded");
    clientRuns();
    gateway.upnp = false;
    failTest(9091);
    for (int relayed = 0; relayed < 5; ++relayed) EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(story(RELAYED),
              "test :9091 x3, status failed, elapsed 0, status relayed, force 0, elapsed 121, "
              "force 0, elapsed 241, force 0, elapsed 361, force 0, elapsed 481, force 0, "
              "interval 360 = 9091 9444 relayed");
    EXPECT_FALSE(manager().checkDNS(RELAYED)) << "a new type forces a check; no name is known";
}

TEST_F(ConnectionTest, LifetimesAreUnknownUntilThereIsAGatewayObject) {
    unsigned upnp = 0, natpmp = 0;
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_TRUE(upnp == 4294967295U && natpmp == 4294967295U);
    manager().setReqPortMappingLifetime(600, 700);
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_TRUE(upnp == 600 && natpmp == 700);
}

class RelayAttempt : public StoryTest {};
TEST_P(RelayAttempt, DoesThisInOrder) {
    expectStories([this] { return manager().createRelayConnection(); });
}
class KillConnection : public StoryTest {};
TEST_P(KillConnection, DoesThisInOrderAndForgetsThePorts) {
    expectStories([this] {
        manager().killConnection(PORTFORWARDED);
        return NONE;
    });
    log.clear();
    for (const auto type : {NONE, CONNECTING, FAILED}) manager().killConnection(type);
    EXPECT_TRUE(log.lines().empty());
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("Port 9"), 0) << "the ports are forgotten";
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, RelayAttempt, testing::Values(
    Row{"WithdrawsTheRecordBeforeTheTunnelStarts", [](World& w) { w.relayWorks(); }, {relayStarts("") + " = relayed"}},
    Row{"KeepsARunningTunnelAndEndsTheForce", [](World& w) { w.clientRuns(); }, {"status relayed, force 0 = relayed"}}), RowName{});
INSTANTIATE_TEST_SUITE_P(Worlds, KillConnection, testing::Values(
    // The gateway object is new at the first, and so is the LAN address.
    Row{"RemovesOwnMappingsAndTheRecordOnly", [](World& w) {
            w.gateway.table = {{9091, kLanIp, 8080, "Kavra"}, {5000, kLanIp, 22, "ssh"},
                               {9093, "192.168.77.66", 80, "Kavra"}, {9444, kLanIp, 8443, "KavraSSL"}};
        }, {"lanip, unmap 9091 9444, " + withdraw("LAN") + " = 5000 disabled", withdraw("LAN") + " = 5000 disabled"}},
    Row{"ChangesNothingWithoutAGateway", [](World& w) { w.gateway.upnp = false; }, {" = disabled"}},
    Row{"WithdrawsTheRecordWhenTheGatewayWentAway",
        [](World& w) { w.givenForwardedPorts(); w.gateway.upnp = false; w.cycle(); w.forget(); },
        {withdraw("LAN") + " = 9091 9444 disabled"}},
    Row{"NoInternalPortKeepsTheRecord", [](World& w) { w.setConfig("INTERNAL_HTTP_PORT", ""); }, {"lanip = disabled"}}), RowName{});
// clang-format on

TEST_F(ConnectionTest, RelayForgetsThePortsThoughTheRecordStays) {
    givenForwardedPorts();
    ASSERT_EQ(manager().createDirectConnection(), PORTFORWARDED);  // maps nothing
    relayWorks();
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(
        story(manager().createRelayConnection()),
        "connecting type=relayed, record NULL&LAN&0&0, start, connected type=relayed, status relayed, "
        "force 0 = 9091 9444 relayed");
    log.clear();
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("allocatedHttpPort 0, allocatedHttpsPort 0."), 1);
}

}  // namespace
}  // namespace pelorus
