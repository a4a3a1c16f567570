#include "connection_fixture.h"

namespace pelorus {
namespace {

// An automatic attempt, before the user takes over.
void automaticCycle(World& w) {
    w.setConfig("MANUAL_PORT_FORWARD", "FALSE");
    w.cycle();
    w.setConfig("MANUAL_PORT_FORWARD", "TRUE");
    w.forget();
}

// The ports were published so many seconds ago; 240 is the end of the test interval.
void published(World& w, long ago = 240) {
    w.cycle(ago);
    w.forget();
}

class ManualForwarding : public StoryTest {};
TEST_P(ManualForwarding, DoesThisInOrder) {
    setConfig("MANUAL_PORT_FORWARD", "TRUE");
    setConfig("MANUAL_EXTERNAL_HTTP_PORT", "18080");
    setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "18443");
    expectStories([this] { return cycle(); });
}
// clang-format off
INSTANTIATE_TEST_SUITE_P(Worlds, ManualForwarding, testing::Values(
    Row{"PublishesAndStopsTheRelayThoughTheDiskSleeps", [](World& w) { w.clientRuns(); w.diskIsAsleep(); },
        {"take over, " + kPublishByHand + ", stop, " + kReported + " = portforwarded", " = portforwarded"}},
    Row{"RelayThatCannotBeStoppedFailsTheReport", [](World& w) { w.clientRuns(); w.commands.answer("kill -", "", 1); },
        {"take over, " + kPublishByHand + ", stop, stop, stop, failed = portforwarded", " = portforwarded"}},
    Row{"TakingOverRemovesTheAutomaticMappingsAndOnlyThem",
        [](World& w) { w.gateway.table.push_back({5000, kLanIp, 22, "ssh"}); w.cycle(); automaticCycle(w); },
        {"take over, unmap 9091 9444, " + kPublishByHand + ", connected, force 0 = 5000 portforwarded"}},
    Row{"SkippedTestKeepsThePreviousConnectionType",
        [](World& w) { automaticCycle(w); w.web.answer("/remote_access_status/", kWait); },
        {"take over, unmap 9091 9444, connecting, failed = portforwarded"}},
    Row{"UnpublishedPortsFailAndAreTriedAgain", [](World& w) { w.web.answerOnce("/forward?", FakeWeb::noAnswer()); },
        {"take over, connecting, test :18080, record WAN&LAN&18080&18443, failed, " + relayFails() +
         ", status failed, lanip = failed", "take over, " + kPublishByHand + ", " + kReported + " = portforwarded"}},
    Row{"TestsUnchangedPortsAfterTheInterval", [](World& w) { published(w, 241); },
        {"disk, test :18080 = portforwarded", " = portforwarded"}},
    Row{"LetsTheDiskSleep", [](World& w) { published(w, 241); w.diskIsAsleep(); },
        {"disk = portforwarded", "disk = portforwarded"}},
    Row{"PublishesANewHttpsPort", [](World& w) { published(w); w.setConfig("MANUAL_EXTERNAL_HTTPS_PORT", "28443"); },
        {"connecting, test :18080, " + publish(18080, 28443) + ", connected, force 0 = portforwarded"}},
    // The server may send anything as an address; the fixture looks for secrets in all lines.
    Row{"PublishesANewAddressAndMasksIt", [](World& w) {
            w.web.answer("/test?", passed(support::kDeviceId));
            published(w);
            w.web.answer("/test?", passed());
        }, {kPublishByHand + ", connected, force 0 = portforwarded", " = portforwarded"}},
    Row{"PublishesWhenForced", [](World& w) { published(w); w.manager().setForceConnect(true); },
        {"force 1, " + kPublishByHand + ", connected, force 0 = portforwarded", " = portforwarded"}},
    Row{"EndsWithTheRelay", [](World& w) { published(w, 241); w.relayWorks(); w.failTest(18080); },
        {"disk, test :18080 x3, status failed, " + relayStarts() + ", lanip = relayed",
         "take over, " + kPublishByHand + ", " + kReported + " = portforwarded"}}), RowName{});
// clang-format on

TEST_F(ConnectionTest, ManuallyForwardedPortsMustBeWithinTheRange) {
    setConfig("MANUAL_PORT_FORWARD", "TRUE");
    const auto attempt = [this](const char* http, const char* https) {
        setConfig("MANUAL_EXTERNAL_HTTP_PORT", http);
        setConfig("MANUAL_EXTERNAL_HTTPS_PORT", https);
        return manager().createDirectConnection();
    };
    for (const char* http : {"0", "65536", "web"}) EXPECT_EQ(attempt(http, "443"), FAILED);
    EXPECT_EQ(attempt("80", ""), FAILED);
    EXPECT_EQ(attempt("1", "65535"), PORTFORWARDED);
    EXPECT_EQ(manager().createRelayConnection(), PORTFORWARDED) << "both ports count as mapped";
}

}  // namespace
}  // namespace pelorus
