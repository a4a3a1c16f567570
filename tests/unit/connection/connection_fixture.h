// The fixture of the connection module: the real classes of all modules it uses, between a fake
// gateway, a fake web and a fake shell.
#ifndef PELORUS_UNIT_CONNECTION_FIXTURE_H
#define PELORUS_UNIT_CONNECTION_FIXTURE_H

#include "cloud/tavik_client.h"
#include "connection/connection_manager.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus {

using support::FakeGateway, support::FakeWeb, support::RowName, support::Texts;

inline constexpr const char* kLanIp = support::kDeviceAddress;
inline constexpr const char* kWanIp = "44.128.0.20";
inline const std::string kWait = "<action>wait</action><wait_time>300</wait_time>";
inline const std::string kNotReached = "<remote_external_ip>44.128.0.20</remote_external_ip>";
inline const std::string kOtherNat = "<remote_external_ip>44.128.9.9</remote_external_ip>";
/// Success for everything that is asked; @p testedIp is what the server says it tested.
std::string passed(const std::string& testedIp = kWanIp);

// clang-format off
/// Publishing: the record of the central server, then the device's own web server.
inline std::string publish(int http, int https, const std::string& wan = "WAN", const std::string& lan = "LAN") {
    const std::string ports = std::to_string(http) + "&" + std::to_string(https);
    return "record " + wan + "&" + lan + "&" + ports + ", tell " + wan + "&" + ports + "&" + lan + "&8080";
}
/// The same two without the ports.
inline std::string withdraw(const std::string& lan) { return "record NULL&" + lan + "&0&0, drop 8080"; }
/// The search that succeeds with its first ports.
inline const std::string kMapAndPublish = "connecting, map 9091, test 9091, map 9444 SSL, " + publish(9091, 9444);
/// The attempt with the ports that the user forwards himself.
inline const std::string kPublishByHand = "connecting, test :18080, " + publish(18080, 18443);
/// The end of an attempt that changed the connection type to PORTFORWARDED; its usual ports and result.
inline const std::string kReported = "connected, status portforwarded, force 0";
inline const std::string kForwarded = " = 9091 9444 portforwarded";
/// A relay attempt whose tunnel comes up.
inline std::string relayStarts(const std::string& lan = "LAN") {
    return "connecting type=relayed, " + withdraw(lan) + ", start, connected type=relayed, status relayed, force 0";
}
/// A relay attempt whose tunnel does not come up.
inline std::string relayFails(const std::string& lan = "LAN") {
    return "connecting type=relayed, " + withdraw(lan) + ", start, failed type=relayed";
}
// clang-format on

/// Public, so that the rows of a table can change the world.
class ConnectionTest : public support::PelorusTest {
public:
    using PelorusTest::clock, PelorusTest::commands, PelorusTest::net;
    using PelorusTest::setConfig, PelorusTest::writeFile;

    ConnectionTest();
    void TearDown() override;

    ConnectionManager& manager() { return *ConnectionManager::getInstance(); }

    void diskIsAsleep() { commands.answer("hdparm", "drive state is:  standby\n"); }
    /// The tunnel comes up when it is started.
    void relayWorks() { writeFile("client.out", "Completed\n"); }
    /// A client of the relay runs: a process whose executable has the right name.
    void clientRuns();
    /// The next test of @p port fails, with all its attempts.
    void failTest(int port);

    /// One pass of the main loop, without the check of the public names.
    ConnectionType cycle(long pause = 120);
    /// Starts as the main loop does and reaches PORTFORWARDED. No story tells of that.
    void givenForwardedPorts();
    /// Begins the next story here.
    void forget() { static_cast<void>(story("")); }
    /// What happened since the last story, in order, then the mapped ports and the result.
    std::string story(const std::string& result);
    std::string story(ConnectionType type);

    FakeWeb& web = FakeWeb::get();
    FakeGateway& gateway = FakeGateway::get();

private:
    pid_t client = 0;
    std::string told;
    std::size_t heard[4] = {};  // lines of each source

    void listen();
};

using World = ConnectionTest;

/// A row of a table of stories: how the world differs, and what each following step tells.
struct Row {
    const char* name;
    std::function<void(World&)> world;
    Texts stories;
};

class StoryTest : public ConnectionTest, public testing::WithParamInterface<Row> {
protected:
    /// Changes the world and compares the story of each @p step.
    template <typename Step>
    void expectStories(Step step) {
        GetParam().world(*this);
        for (const auto& wanted : GetParam().stories) EXPECT_EQ(story(step()), wanted);
    }
};

}  // namespace pelorus

#endif
