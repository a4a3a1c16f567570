#include "connection_fixture.h"

#include <spawn.h>

#include <filesystem>
#include <regex>

namespace pelorus {
namespace {

// What a story() tells of the lines that hold the part: these words and what follows the part, up
// to the end mark.
struct Word {
    std::string part;
    std::string words;
    std::string end = "\n";
};
// clang-format off
// The port alone is tested at kWanIp; of ":9091" the server chooses the address.
const std::vector<Word> kWords{
    {"/test?device-7350142&44.128.0.20:", "test ", "&HTTP&auth"}, {"/test?device-7350142&", "test ", "&HTTP&auth"},
    {"/forward?device-7350142&", "record ", "&auth"}, {"/setforward?", "tell "}, {"/delforward?", "drop "},
    {"/setstatus?", "status "}, {"/lanip?", "lanip", ""},
    {"unmap TCP ", "unmap "}, {"map TCP ", "map "}, {"hdparm", "disk", ""}, {"start-client", "start", ""}, {"kill -15 ", "stop", ""}};
// A state without a type is one of PORTFORWARDED.
const std::vector<Word> kLogWords{
    {"cloudConnectivity state=", "", " type=portforwarded"}, {"setForceConnect = ", "force "},
    {"increased port test interval to ", "interval ", "."}, {"Port test failed, trying next port", "next port", ""},
    {"Port test failed, retries exceeded", "exceeded", ""},
    {"UPnP not working. Elapsed time ", "elapsed ", ","},
    {"unmapping existing ports", "take over", ""}};
// Regular expressions, and what a story() says for them: the usual addresses and mappings, and repeated calls.
constexpr const char* kShortForms[][2] = {{kWanIp, "WAN"}, {R"(192.168.77.10\b)", "LAN"},
    {R"( -> LAN:8080 Kavra\b)", ""}, {" -> LAN:8443 KavraSSL", " SSL"}, {R"((test \S+), \1, \1)", "$1 x3"},
    {R"((unmap \d+), unmap (\d+))", "$1 $2"}};
// clang-format on

// What a story tells of the line; empty when it tells nothing.
std::string wordsFor(const std::string& line, const std::vector<Word>& vocabulary) {
    for (const auto& [part, words, end] : vocabulary) {
        const auto at = line.find(part);
        if (at == std::string::npos) continue;
        const auto rest = line.substr(at + part.size());
        return words + rest.substr(0, std::min(rest.find(end), rest.find('\n')));
    }
    return "";
}

}  // namespace

std::string passed(const std::string& testedIp) {
    return "success Success<action>proceed</action><external_ip>" + testedIp +
           "</external_ip><remote_external_ip>44.128.0.20</remote_external_ip>"
           "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
}

// clang-format off
ConnectionTest::ConnectionTest() {
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

void ConnectionTest::TearDown() {
    if (client > 0) kill(client, SIGKILL);
    PelorusTest::TearDown();
}

void ConnectionTest::clientRuns() {
    std::string program = path("openvpn");
    std::string seconds = "600";
    std::filesystem::copy_file("/bin/sleep", program);
    char* const arguments[] = {program.data(), seconds.data(), nullptr};
    ASSERT_EQ(posix_spawn(&client, program.c_str(), nullptr, nullptr, arguments, nullptr), 0);
    writeFile("client.pid", std::to_string(client) + "\n");
}

void ConnectionTest::failTest(int port) {
    const std::string part = ":" + std::to_string(port) + "&HTTP&";
    for (int attempt = 0; attempt < 3; ++attempt) web.answerOnce(part, kNotReached);
}

ConnectionType ConnectionTest::cycle(long pause) {
    const ConnectionType type = manager().createConnection();
    clock.advance(pause);
    TavikClient::getInstance()->resetServerSleepTime();
    return type;
}

void ConnectionTest::givenForwardedPorts() {
    manager().killConnection(PORTFORWARDED);
    ASSERT_EQ(cycle(), PORTFORWARDED);
    setConfig("COMMUNICATION_STATUS", "portforwarded");
    forget();
}

std::string ConnectionTest::story(const std::string& result) {
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

std::string ConnectionTest::story(ConnectionType type) {
    return story(ConnectionManager::convertEnumConnectionType(type));
}

void ConnectionTest::listen() {
    const Texts sources[] = {web.urls(), gateway.calls(), commands.lines(), log.texts()};
    for (int i = 0; i < 4; ++i) {
        for (auto& next = heard[i]; next < sources[i].size(); ++next) {
            const auto words = wordsFor(sources[i][next], i == 3 ? kLogWords : kWords);
            if (!words.empty()) told += (told.empty() ? "" : ", ") + words;
        }
    }
}

}  // namespace pelorus
