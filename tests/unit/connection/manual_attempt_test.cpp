#include "connection_fixture.h"

namespace pelorus {
namespace {

// Without an address in the request the server tells the one it tested.
void serverSees(World& w, const std::string& ip) {
    w.web.answer("/test?", kPassed + "<external_ip>" + ip + "</external_ip>");
}

class ManualAttemptTest : public StoryTest {
protected:
    ManualAttemptTest() {
        setConfig("MANUAL_PORT_FORWARD", "TRUE");
        setConfig("MANUAL_EXTERNAL_HTTP_PORT", "18080");
        setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "18443");
        serverSees(*this, kWanIp);
    }
};

// The automatic attempt of a device whose user has not taken over yet.
void automaticCycle(World& w) {
    w.setConfig("MANUAL_PORT_FORWARD", "FALSE");
    w.cycle();
    w.setConfig("MANUAL_PORT_FORWARD", "TRUE");
    w.forget();
}

class FirstManualAttempt : public ManualAttemptTest {};
TEST_P(FirstManualAttempt, TellsAsExpected) {
    expectStories([this] { return cycle(); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, FirstManualAttempt, testing::Values(
    Row{"PublishesAndStopsTheRelayThoughTheDiskSleeps", [](World& w) {
            w.clientRuns();
            w.diskIsAsleep();
        }, {kByHand + "stop, connected/portforwarded, status portforwarded, force 0 = portforwarded", " = portforwarded"}},
    Row{"RelayThatCannotBeStoppedFailsOnlyTheReport", [](World& w) {
            w.clientRuns();
            w.commands.answer("kill -", "", 1);
        }, {kByHand + "stop, stop, stop, failed/portforwarded = portforwarded", " = portforwarded"}},
    Row{"TakingOverRemovesTheAutomaticMappingsAndOnlyThem", [](World& w) {
            w.gateway.add({5000, kLanIp, 22, "ssh"});
            automaticCycle(w);
        }, {"unmap 9091, unmap 9444, " + kByHand + "connected/portforwarded, force 0 = 5000 portforwarded", " = 5000 portforwarded"}},
    Row{"TakingOverWithoutAGatewayRemovesNothing", [](World& w) { w.gateway.speakUpnp(false); }, {kByHand + "connected/portforwarded, status portforwarded, force 0 = portforwarded"}},
    // The user's router may well sit behind another one: only the test counts.
    Row{"ClosedPortFailsAndIsReported", [](World& w) { w.web.answer("/test?", kOtherNat); }, {"connecting/portforwarded, test 18080, test 18080, test 18080, status failed, failed/portforwarded, " + kNoRelay + ", lanip = failed"}},
    Row{"SkippedTestKeepsThePreviousConnectionType", [](World& w) {
            automaticCycle(w);
            w.web.answer("/remote_access_status/", kWait);
        }, {"unmap 9091, unmap 9444, connecting/portforwarded, failed/portforwarded = portforwarded"}},
    Row{"DoubleNatSeenByTheAutomaticSearchEndsTheAttempt", [](World& w) {
            w.web.answer("/test?", kOtherNat);
            automaticCycle(w);
        }, {kNoRelay + " = failed"}},
    Row{"UnpublishedPortsFailAndAreTriedAgain", [](World& w) { w.web.answerOnce("/forward?", FakeWeb::noAnswer()); },
        {"connecting/portforwarded, test 18080, record WAN&LAN&18080&18443, failed/portforwarded, " + kNoRelay + ", status failed, lanip = failed", kByHand + "connected/portforwarded, status portforwarded, force 0 = portforwarded"}}),
    RowName{});

class LaterManualAttempt : public ManualAttemptTest {};
TEST_P(LaterManualAttempt, TellsAsExpected) {
    ASSERT_EQ(cycle(), PORTFORWARDED);
    forget();
    EXPECT_EQ(story(cycle()), " = portforwarded");
    expectStories([this] { return cycle(0); });
}
INSTANTIATE_TEST_SUITE_P(Worlds, LaterManualAttempt, testing::Values(
    Row{"TestsUnchangedPortsAfterTheInterval", [](World& w) { w.clock.advance(1); }, {"disk, test 18080 = portforwarded", " = portforwarded"}},
    Row{"LetsTheDiskSleep", [](World& w) {
            w.clock.advance(300);
            w.diskIsAsleep();
        }, {"disk = portforwarded", "disk = portforwarded"}},
    Row{"PublishesAChangedHttpPort", [](World& w) { w.setConfig("MANUAL_EXTERNAL_HTTP_PORT", "28080"); }, {"connecting/portforwarded, test 28080, record WAN&LAN&28080&18443, tell WAN&28080&18443&LAN&8080, connected/portforwarded, force 0 = portforwarded", " = portforwarded"}},
    Row{"PublishesAChangedHttpsPort", [](World& w) { w.setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "28443"); }, {"connecting/portforwarded, test 18080, record WAN&LAN&18080&28443, tell WAN&18080&28443&LAN&8080, connected/portforwarded, force 0 = portforwarded", " = portforwarded"}},
    Row{"PublishesWhenForced", [](World& w) { w.manager().setForceConnect(true); }, {"force 1, " + kByHand + "connected/portforwarded, force 0 = portforwarded", " = portforwarded"}},
    Row{"EndsWithTheRelay", [](World& w) {
            w.clock.advance(300);
            w.relayWorks();
            for (int attempt = 0; attempt < 3; ++attempt) w.web.answerOnce("/test?", kNotReached);
        }, {"disk, test 18080, test 18080, test 18080, status failed, connecting/relayed, record NULL&LAN&0&0, withdraw 8080, start, connected/relayed, status relayed, force 0, lanip = relayed", kByHand + "connected/portforwarded, status portforwarded, force 0 = portforwarded"}}),
    RowName{});
// clang-format on

// The server may send anything as an address; the fixture looks for secrets in all lines.
TEST_F(ManualAttemptTest, ChangedExternalAddressIsPublishedAndStaysMasked) {
    serverSees(*this, support::kDeviceId);
    cycle();
    story(PORTFORWARDED);
    serverSees(*this, kWanIp);
    EXPECT_EQ(story(cycle()), kByHand + "connected/portforwarded, force 0 = portforwarded");
    EXPECT_EQ(log.countPart("detected change to external IP [*ID_REMOVED*]"), 1) << log.dump();
    EXPECT_EQ(manager().createRelayConnection(), PORTFORWARDED) << "both ports count as mapped";
}

struct BadPort {
    const char* http;
    const char* https;
    Texts services;
};

TEST_F(ManualAttemptTest, PortsMustBeWithinTheRange) {
    for (const auto& row : std::vector<BadPort>{{"80", "", {"HTTPS Port.\n"}},
                                                {"0", "443", {"HTTP Port.\n"}},
                                                {"65536", "443", {"HTTP Port.\n"}},
                                                {"web", "443", {"HTTP Port.\n"}},
                                                {"1", "65535", {}}}) {
        log.clear();
        setConfig("MANUAL_EXTERNAL_HTTP_PORT", row.http);
        setConfig("MANUAL_EXTERNAL_HTTPS_PORT", row.https);
        EXPECT_EQ(manager().createDirectConnection(),
                  row.services.empty() ? PORTFORWARDED : FAILED);
        EXPECT_EQ(logged("bad value for manually configured "), row.services);
    }
}

}  // namespace
}  // namespace pelorus
