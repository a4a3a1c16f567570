// The fixture of the connection module: the real classes of all modules it uses, between a fake
// gateway, a fake web and a tunnel whose start command writes its output.
#ifndef PELORUS_UNIT_CONNECTION_FIXTURE_H
#define PELORUS_UNIT_CONNECTION_FIXTURE_H

#include <spawn.h>
#include <sys/wait.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <functional>
#include <iterator>
#include <regex>
#include <string>

#include "cloud/tavik_client.h"
#include "connection/connection_manager.h"
#include "connection/network_addrs.h"
#include "relay/vpn_manager.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus {

using support::FakeGateway;
using support::FakeWeb;
using support::RowName;
using support::Texts;

inline constexpr const char* kLanIp = "192.168.77.10";
inline constexpr const char* kWanIp = "44.128.0.20";
inline const std::string kWait = "<action>wait</action><wait_time>300</wait_time>";
inline const std::string kPassed =
    "<s>Success</s><remote_external_ip>44.128.0.20</remote_external_ip>"
    "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
inline const std::string kNotReached =
    "<s>Failure</s><remote_external_ip>44.128.0.20</remote_external_ip>";
inline const std::string kOtherNat =
    "<s>Failure</s><remote_external_ip>44.128.9.9</remote_external_ip>";

// What many stories share.
inline const std::string kSearch = "connecting/portforwarded, map 9091>LAN:8080 Kavra, test 9091, ";
inline const std::string kPublish =
    "map 9444>LAN:8443 KavraSSL, record WAN&LAN&9091&9444, tell WAN&9091&9444&LAN&8080, connected/portforwarded";
inline const std::string kByHand =
    "connecting/portforwarded, test 18080, record WAN&LAN&18080&18443, tell WAN&18080&18443&LAN&8080, ";
inline const std::string kNoRelay =
    "connecting/relayed, record NULL&LAN&0&0, withdraw 8080, start, failed/relayed";
inline const std::string kKept = " = 9091 9444 portforwarded";

/// What a story() tells of the lines that hold the part: these words and what follows the part, up
/// to the end mark.
struct Word {
    const char* part = "";
    const char* words = "";
    const char* end = "\n";
    bool isLog = false;
};
// clang-format off
inline constexpr Word kWords[] = {
    {"&port=", "test ", "&"}, {"/forward?device-7350142&", "record ", "&auth"}, {"/setforward?", "tell "},
    {"/delforward?", "withdraw "}, {"/setstatus?", "status "}, {"/lanip?", "lanip", ""},
    {"natpmp map TCP ", "natpmp ", " for"}, {"unmap TCP ", "unmap "}, {"map TCP ", "map "},
    {"hdparm", "disk", ""}, {"start-client", "start", ""}, {"kill -15 ", "stop", ""},
    {"helper.sh add ", "add "}, {"helper.sh remove ", "remove "},
    {"cloudConnectivity state=", "", "\n", true}, {"setForceConnect = ", "force ", "\n", true},
    {"Port test failed, ", "failed: ", ".", true}};
// clang-format on

/// Public, so that the rows of a table can change the world.
class ConnectionTest : public support::PelorusTest {
public:
    using PelorusTest::clock;
    using PelorusTest::commands;
    using PelorusTest::net;
    using PelorusTest::setConfig;
    using PelorusTest::writeFile;

    ConnectionTest() {
        web.reset();
        gateway.reset();
        files.reset();
        log.onLine([this](const support::LogLine&) { listen(); });
        for (const char* part : {"/setstatus", "/setforward", "/delforward", "/setlanip"}) {
            web.answer(part, "success");
        }
        web.answer("/remote_access_status/", "<action>proceed</action>");
        web.answer("/forward?", "Success");
        web.answer("/lanip?", "Success");
        web.answer("/test?", kPassed);
        diskIsAwake();
        // clang-format off
        const std::string local = "http://127.0.0.1:%d/";
        givenConfig(
            {{"SERVER_BASE_URL", "https://cloud.kavra.example"}, {"REMOTE_TESTPORTURL", "/test?%s&ip=%s&port=%d&%s&%s"},
             {"REMOTE_SETFORWARDURL", "/forward?%s&%s&%s&%d&%d&%s"}, {"REMOTE_SETCOMMSTATUSURL", "/lanip?%s&%s&%s"},
             {"LOCAL_SETFORWARDURL", local + "setforward?%s&%d&%d&%s&%d"}, {"LOCAL_DELFORWARDURL", local + "delforward?%d"},
             {"LOCAL_SETCOMMSTATUSURL", local + "setstatus?%s"}, {"LOCAL_SETLOCALIPURL", local + "setlanip?%s"},
             {"OPENVPN_CONFIG_PATH", folder}, {"OPENVPN_AUTH_FILE", path("auth.txt")}, {"STARTCMD", "start-client"},
             {"STARTCMD_OUTFILE", path("client.out")}, {"LOG_SUCCESS_TEXT", "Completed"},
             {"OPENVPN_PID_FILE", path("client.pid")}},
            {{"INTERNAL_HTTP_PORT", "8080"}, {"INTERNAL_HTTPS_PORT", "8443"}});
        // clang-format on
    }

    void TearDown() override {
        if (client > 0) {
            kill(client, SIGKILL);
            waitpid(client, nullptr, 0);
        }
        web.checkBalance();
        gateway.checkReleased();
        PelorusTest::TearDown();
    }

    ConnectionManager& manager() { return *ConnectionManager::getInstance(); }

    void diskIsAwake() {
        commands.answer("hdparm", "drive state is:  active/idle\n");
        files.redirect(support::kIdleMinutesFile, writeFile("minutes", "0\n"));
    }
    void diskIsAsleep() { commands.answer("hdparm", "drive state is:  standby\n"); }
    /// The tunnel comes up when it is started.
    void relayWorks() {
        support::FakeCommands::Answer start;
        start.action = [this](const std::string&) {
            writeFile("client.out",
                      "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\nCompleted\n");
        };
        commands.answer("start-client", start);
    }

    /// A client of the relay runs: a process whose executable has the right name.
    void clientRuns() {
        std::string program = path("openvpn");
        std::string seconds = "600";
        std::filesystem::copy_file("/bin/sleep", program);
        char* const arguments[] = {program.data(), seconds.data(), nullptr};
        ASSERT_EQ(posix_spawn(&client, program.c_str(), nullptr, nullptr, arguments, nullptr), 0);
        writeFile("client.pid", std::to_string(client) + "\n");
    }
    /// The device is the maker's router; an empty @p wan: without a connection.
    void givenMakersRouter(const std::string& wan, const std::string& list) {
        setConfig("DEVICETYPE", "5");
        commands.answer("getip.sh wan", wan);
        commands.answer("getip.sh lan", "192.168.77.1\n");
        commands.answer("tavik_helper.sh list", list);
    }
    /// The next test of @p port fails, with all its attempts.
    void failTest(int port) {
        const std::string part = "&port=" + std::to_string(port) + "&";
        for (int attempt = 0; attempt < 3; ++attempt) web.answerOnce(part, kNotReached);
    }

    /// One pass of the main loop, without the check of the public names.
    ConnectionType cycle(long pause = 120) {
        const ConnectionType type = manager().createConnection();
        clock.advance(pause);
        TavikClient::getInstance()->resetServerSleepTime();
        return type;
    }
    /// Starts as the main loop does, reaches PORTFORWARDED (through 9091 and 9444 when nothing
    /// prevents it) and forgets what was asked and logged.
    void givenForwardedPorts() {
        manager().killConnection(PORTFORWARDED);
        ASSERT_EQ(cycle(), PORTFORWARDED);
        setConfig("COMMUNICATION_STATUS", "portforwarded");
        forget();
    }
    void forget() {
        web.clear();
        gateway.clear();
        commands.clear();
        log.clear();
        told.clear();
        std::fill(std::begin(heard), std::end(heard), 0);
    }

    /// What happened since the last story, in order, then the mapped ports and the result.
    std::string story(const std::string& result) {
        listen();
        std::string all = told.substr(std::min<std::size_t>(told.size(), 2)) + " =";
        told.clear();
        for (const auto& mapping : gateway.mappings()) {
            if (mapping.client == kLanIp) all += " " + std::to_string(mapping.externalPort);
        }
        all = std::regex_replace(all, std::regex{kWanIp}, "WAN");
        all = std::regex_replace(all, std::regex{kLanIp}, "LAN");
        all = std::regex_replace(all, std::regex{" type="}, "/");
        return std::regex_replace(all, std::regex{" -> "}, ">") + " " + result;
    }
    std::string story(ConnectionType type) {
        return story(ConnectionManager::convertEnumConnectionType(type));
    }
    /// What follows @p part in the log lines that hold it.
    Texts logged(const std::string& part) const { return tails(log.texts(), part); }

    FakeWeb& web = FakeWeb::get();
    FakeGateway& gateway = FakeGateway::get();
    support::FakeFiles& files = support::FakeFiles::get();

private:
    pid_t client = 0;
    std::string told;
    std::size_t heard[4] = {};  // lines of each source

    void listen() {
        const Texts sources[] = {web.urls(), gateway.calls(), commands.lines(), log.texts()};
        for (int source = 0; source < 4; ++source) {
            for (auto& seen = heard[source]; seen < sources[source].size(); ++seen) {
                tell(sources[source][seen], source == 3);
            }
        }
    }
    void tell(const std::string& line, bool isLog) {
        for (const Word& word : kWords) {
            const auto rest = tails({line}, word.part);
            if (word.isLog != isLog || rest.empty()) continue;
            told += std::string{", "} + word.words + rest[0].substr(0, rest[0].find(word.end));
            return;
        }
    }
    // What follows part in each line that holds it.
    static Texts tails(const Texts& lines, const std::string& part) {
        Texts found;
        for (const auto& line : lines) {
            const auto at = line.find(part);
            if (at != std::string::npos) found.push_back(line.substr(at + part.size()));
        }
        return found;
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
