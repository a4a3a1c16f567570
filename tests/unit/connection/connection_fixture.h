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
#include <utility>
#include <vector>

#include "cloud/tavik_client.h"
#include "connection/connection_manager.h"
#include "connection/network_addrs.h"
#include "relay/vpn_manager.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus {

using support::expectLogged;
using support::expectLoggedInOrder;
using support::FakeGateway;
using support::FakeWeb;
using support::RowName;
using support::Texts;
using Ports = std::vector<int>;

inline constexpr const char* kLanIp = "192.168.77.10";
inline constexpr const char* kWanIp = "44.128.0.20";
inline constexpr const char* kRelayIp = "44.128.0.1";
inline const std::string kWait = "<action>wait</action><wait_time>300</wait_time>";
inline const std::string kPassed =
    "<s>Success</s><remote_external_ip>44.128.0.20</remote_external_ip>"
    "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
inline const std::string kNotReached =
    "<s>Failure</s><remote_external_ip>44.128.0.20</remote_external_ip>";
inline const std::string kOtherNat =
    "<s>Failure</s><remote_external_ip>44.128.9.9</remote_external_ip>";

/// What a story() tells of the lines that hold the part: these words and what follows the part, up
/// to the end mark.
struct Word {
    const char* part;
    const char* words;
    const char* end;
};
// clang-format off
inline constexpr Word kCalls[] = {
    {"&port=", "test ", "&"}, {"/forward?device-7350142&", "record ", "&auth"}, {"/setforward?", "tell ", "\n"},
    {"/delforward?", "withdraw ", "\n"}, {"/setstatus?", "status ", "\n"}, {"/lanip?", "lanip", ""},
    {"/myip", "myip", ""}, {"natpmp map TCP ", "natpmp ", " for"}, {"unmap TCP ", "unmap ", "\n"},
    {"map TCP ", "map ", "\n"}, {"hdparm", "disk", ""}, {"start-client", "start", ""}, {"kill -15 ", "stop", ""},
    {"helper.sh add ", "add ", "\n"}, {"helper.sh remove ", "remove ", "\n"}};
inline constexpr Word kLogLines[] = {{"cloudConnectivity state=", "", "\n"}, {"setForceConnect = ", "force ", "\n"},
    {"Port test failed, ", "failed: ", "."}};
// clang-format on

/// Public, so that the rows of a table can change the world.
class ConnectionTest : public support::PelorusTest {
public:
    using PelorusTest::clock;
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
        givenConfig({{"SERVER_BASE_URL", "https://cloud.kavra.example"},
                     {"REMOTE_TESTPORTURL", "/test?%s&ip=%s&port=%d&%s&%s"},
                     {"REMOTE_SETFORWARDURL", "/forward?%s&%s&%s&%d&%d&%s"},
                     {"REMOTE_SETCOMMSTATUSURL", "/lanip?%s&%s&%s"},
                     {"LOCAL_SETFORWARDURL", "http://127.0.0.1:%d/setforward?%s&%d&%d&%s&%d"},
                     {"LOCAL_DELFORWARDURL", "http://127.0.0.1:%d/delforward?%d"},
                     {"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1:%d/setstatus?%s"},
                     {"LOCAL_SETLOCALIPURL", "http://127.0.0.1:%d/setlanip?%s"},
                     {"OPENVPN_CONFIG_PATH", folder},
                     {"OPENVPN_AUTH_FILE", path("auth.txt")},
                     {"STARTCMD", "start-client"},
                     {"STARTCMD_OUTFILE", path("client.out")},
                     {"LOG_SUCCESS_TEXT", "Completed"},
                     {"OPENVPN_PID_FILE", path("client.pid")}},
                    {{"INTERNAL_HTTP_PORT", "8080"}, {"INTERNAL_HTTPS_PORT", "8443"}});
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
            writeFile("client.out", std::string{"Peer Connection Initiated with [AF_INET]"} +
                                        kRelayIp + ":1194\nCompleted\n");
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
    void clientCannotBeStopped() { commands.answer("kill -", "", 1); }
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

    /// The external ports that lead to this device, in order.
    Ports mappedPorts() const {
        Ports ports;
        for (const auto& mapping : gateway.mappings()) {
            if (mapping.client == kLanIp) ports.push_back(mapping.externalPort);
        }
        return ports;
    }
    /// The ports the server was asked to test, in order.
    Ports testedPorts() const {
        Ports ports;
        for (const auto& tail : tails(web.urls(), "&port=")) ports.push_back(std::stoi(tail));
        return ports;
    }
    /// What happened since the last story, in order, then the mapped ports and the result.
    std::string story(const std::string& result) {
        listen();
        std::string all = told.substr(std::min<std::size_t>(told.size(), 2)) + " =";
        told.clear();
        for (const int port : mappedPorts()) all += " " + std::to_string(port);
        all += " " + result;
        for (const auto& [text, shorter] : {std::pair<const char*, const char*>{kWanIp, "WAN"},
                                            {kLanIp, "LAN"},
                                            {" type=", "/"},
                                            {" -> ", ">"}}) {
            all = std::regex_replace(all, std::regex{text}, shorter);
        }
        return all;
    }
    std::string story(ConnectionType type) {
        return story(ConnectionManager::convertEnumConnectionType(type));
    }
    std::string story(int port) { return story(std::to_string(port)); }
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
        tell(web.urls(), heard[0], kCalls);
        tell(gateway.calls(), heard[1], kCalls);
        tell(commands.lines(), heard[2], kCalls);
        tell(log.texts(), heard[3], kLogLines);
    }
    template <std::size_t count>
    void tell(const Texts& lines, std::size_t& seen, const Word (&words)[count]) {
        for (; seen < lines.size(); ++seen) {
            for (const Word& word : words) {
                const Texts rest = tails({lines[seen]}, word.part);
                if (rest.empty()) continue;
                told += std::string{", "} + word.words + rest[0].substr(0, rest[0].find(word.end));
                break;
            }
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
