// The fixture of the connection module: the real classes of all modules it uses, between a fake
// gateway, a fake web and a fake shell.
#ifndef PELORUS_UNIT_CONNECTION_FIXTURE_H
#define PELORUS_UNIT_CONNECTION_FIXTURE_H

#include <spawn.h>

#include <filesystem>
#include <regex>

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
inline std::string passed(const std::string& testedIp = kWanIp) {
    return "success Success<action>proceed</action><external_ip>" + testedIp +
           "</external_ip><remote_external_ip>44.128.0.20</remote_external_ip>"
           "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
}

/// What a story() tells of the lines that hold the part: these words and what follows the part, up
/// to the end mark.
struct Word {
    std::string part;
    std::string words;
    std::string end = "\n";
};
// clang-format off
/// The port alone is tested at kWanIp; of ":9091" the server chooses the address.
inline const std::vector<Word> kWords{
    {"/test?device-7350142&44.128.0.20:", "test ", "&HTTP&auth"}, {"/test?device-7350142&", "test ", "&HTTP&auth"},
    {"/forward?device-7350142&", "record ", "&auth"}, {"/setforward?", "tell "}, {"/delforward?", "drop "},
    {"/setstatus?", "status "}, {"/lanip?", "lanip", ""},
    {"unmap TCP ", "unmap "}, {"map TCP ", "map "}, {"hdparm", "disk", ""}, {"start-client", "start", ""}, {"kill -15 ", "stop", ""}};
/// A state without a type is one of PORTFORWARDED.
inline const std::vector<Word> kLogWords{
    {"cloudConnectivity state=", "", " type=portforwarded"}, {"setForceConnect = ", "force "},
    {"increased port test interval to ", "interval ", "."}, {"Port test failed, trying next port", "next port", ""},
    {"Port test failed, retries exceeded", "exceeded", ""},
    {"UPnP not working. Elapsed time ", "elapsed ", ","},
    {"unmapping existing ports", "take over", ""}};
/// Regular expressions, and what a story() says for them: the usual addresses and mappings, and repeated calls.
inline constexpr const char* kShortForms[][2] = {{kWanIp, "WAN"}, {R"(192.168.77.10\b)", "LAN"},
    {R"( -> LAN:8080 Kavra\b)", ""}, {" -> LAN:8443 KavraSSL", " SSL"}, {R"((test \S+), \1, \1)", "$1 x3"},
    {R"((unmap \d+), unmap (\d+))", "$1 $2"}};

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

/// Public, so that the rows of a table can change the world.
class ConnectionTest : public support::PelorusTest {
public:
    using PelorusTest::clock, PelorusTest::commands, PelorusTest::net;
    using PelorusTest::setConfig, PelorusTest::writeFile;

    ConnectionTest() {
        log.onLine([this](const support::LogLine&) { listen(); });
        web.answer("", passed());
        commands.answer("hdparm", "drive state is:  active/idle\n");
        support::FakeFiles::get().redirect(support::kIdleMinutesFile, writeFile("minutes", "0\n"));
        const std::string local = "http://127.0.0.1:%d/";
        givenConfig(
            {{"SERVER_BASE_URL", "https://cloud.kavra.example"}, {"REMOTE_TESTPORTURL", "/test?%s&%s:%d&%s&%s"},
             {"REMOTE_SETFORWARDURL", "/forward?%s&%s&%s&%d&%d&%s"}, {"REMOTE_SETCOMMSTATUSURL", "/lanip?%s&%s&%s"},
             {"LOCAL_SETFORWARDURL", local + "setforward?%s&%d&%d&%s&%d"},
             {"LOCAL_DELFORWARDURL", local + "delforward?%d"}, {"LOCAL_SETCOMMSTATUSURL", local + "setstatus?%s"},
             {"OPENVPN_AUTH_FILE", path("auth.txt")}, {"OPENVPN_PID_FILE", path("client.pid")},
             {"STARTCMD_OUTFILE", path("client.out")}, {"STARTCMD", "start-client"}, {"LOG_SUCCESS_TEXT", "Completed"}},
            {{"INTERNAL_HTTP_PORT", "8080"}, {"INTERNAL_HTTPS_PORT", "8443"}});
    }
    // clang-format on

    void TearDown() override {
        if (client > 0) kill(client, SIGKILL);
        PelorusTest::TearDown();
    }

    ConnectionManager& manager() { return *ConnectionManager::getInstance(); }

    void diskIsAsleep() { commands.answer("hdparm", "drive state is:  standby\n"); }
    /// The tunnel comes up when it is started.
    void relayWorks() { writeFile("client.out", "Completed\n"); }
    /// A client of the relay runs: a process whose executable has the right name.
    void clientRuns() {
        std::string program = path("openvpn");
        std::string seconds = "600";
        std::filesystem::copy_file("/bin/sleep", program);
        char* const arguments[] = {program.data(), seconds.data(), nullptr};
        ASSERT_EQ(posix_spawn(&client, program.c_str(), nullptr, nullptr, arguments, nullptr), 0);
        writeFile("client.pid", std::to_string(client) + "\n");
    }
    /// The next test of @p port fails, with all its attempts.
    void failTest(int port) {
        const std::string part = ":" + std::to_string(port) + "&HTTP&";
        for (int attempt = 0; attempt < 3; ++attempt) web.answerOnce(part, kNotReached);
    }

    /// One pass of the main loop, without the check of the public names.
    ConnectionType cycle(long pause = 120) {
        const ConnectionType type = manager().createConnection();
        clock.advance(pause);
        TavikClient::getInstance()->resetServerSleepTime();
        return type;
    }
    /// Starts as the main loop does and reaches PORTFORWARDED. No story tells of that.
    void givenForwardedPorts() {
        manager().killConnection(PORTFORWARDED);
        ASSERT_EQ(cycle(), PORTFORWARDED);
        setConfig("COMMUNICATION_STATUS", "portforwarded");
        forget();
    }
    /// Begins the next story here.
    void forget() { static_cast<void>(story("")); }
    /// What happened since the last story, in order, then the mapped ports and the result.
    std::string story(const std::string& result) {
        listen();
        std::string all = std::exchange(told, "") + " =";
        for (const auto& mapping : gateway.table) {
            if (mapping.client == kLanIp) all += " " + std::to_string(mapping.externalPort);
        }
        all += " " + result;
        for (const auto& [pattern, form] : kShortForms) {
            all = std::regex_replace(all, std::regex{pattern}, form);
        }
        return all;
    }
    std::string story(ConnectionType type) {
        return story(ConnectionManager::convertEnumConnectionType(type));
    }

    FakeWeb& web = FakeWeb::get();
    FakeGateway& gateway = FakeGateway::get();

private:
    pid_t client = 0;
    std::string told;
    std::size_t heard[4] = {};  // lines of each source

    void listen() {
        const Texts sources[] = {web.urls(), gateway.calls(), commands.lines(), log.texts()};
        for (int i = 0; i < 4; ++i) {
            for (auto& next = heard[i]; next < sources[i].size(); ++next) {
                tell(sources[i][next], i == 3 ? kLogWords : kWords);
            }
        }
    }
    void tell(const std::string& line, const std::vector<Word>& vocabulary) {
        for (const auto& [part, words, end] : vocabulary) {
            const auto at = line.find(part);
            if (at == std::string::npos) continue;
            const auto rest = line.substr(at + part.size());
            const auto shown = rest.substr(0, std::min(rest.find(end), rest.find('\n')));
            told += (told.empty() ? "" : ", ") + words + shown;
            return;
        }
    }
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
