// What the central server is asked: whether to wait, the public address, whether a port is open; and
// how its answers are read.
#include <tuple>

#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/sleep_answer.h"
#include "cloud_fixture.h"

namespace pelorus {
namespace {

using Answers = std::vector<FakeWeb::Answer>;
using ServerRequestsTest = CloudTest;

const std::string kRest = "http://web.kavra.example/api/1.0/rest/";
const std::string kPoll = kRest + "remote_access_status/device-7350142";
const std::string kWait = "<action>wait</action>";

// clang-format off
TEST(AnswersTest, AWaitNeedsATimeBehindItsAction) {
    const std::tuple<const char*, SleepAnswer::Kind, std::optional<int>> rows[]{
        {"<action>proceed</action><action>wait</action>x <wait_time> 121s", SleepAnswer::WAIT, 121},
        {"<action>wait</action><wait_time>0</wait_time>", SleepAnswer::WAIT, 0},
        {"<action>wait</action><wait_time>-1", SleepAnswer::BAD_TIME, {}},
        {"<action>wait</action><wait_time>soon", SleepAnswer::BAD_TIME, {}},
        {"<wait_time>300</wait_time><action>wait</action>", SleepAnswer::NO_TIME, {}},
        {"<action>proceed</action><wait_time>300", SleepAnswer::PROCEED, 0},
        {"<ACTION>wait</ACTION><wait_time>300", SleepAnswer::NO_ACTION, {}}};
    for (const auto& [text, kind, seconds] : rows) {
        const SleepAnswer answer = readSleepAnswer(text);
        EXPECT_TRUE(answer.kind == kind && answer.seconds == seconds) << text;
    }
}

TEST(AnswersTest, PartsOfAPortTestStandBetweenTheirTags) {
    const TaggedText none{"none"};
    struct { const char *name, *text; bool passed; const char *remote, *tested, *devices; } const rows[]{
        {"all parts", "Success<remote_external_ip>r</remote_external_ip><external_ip>t</external_ip>"
            "<req_device_id>1</req_device_id><resp_device_id>2</resp_device_id>", true, "r", "t", "1,2"},
        {"other case", "success", false, "none", "none", ","},
        {"the first of two", "<external_ip>a</external_ip><external_ip>b</external_ip>", false, "none", "a", ","},
        {"not closed", "<remote_external_ip>r<external_ip>t<req_device_id>1<resp_device_id>2</resp_device_id>", false, "none", "none", ",2"},
        {"remote address not opened", "345678901234567890r</remote_external_ip>", false, "none", "none", ","},
        {"tested address not opened", "Success 0123here</external_ip>", true, "none", "here", ","},
        {"closed before it is opened", "Success</external_ip><external_ip>x", true, "none", "", ","}};
    for (const auto& [name, text, passed, remote, tested, devices] : rows) {
        const PortTestAnswer answer = readPortTestAnswer(text);
        EXPECT_EQ(answer.passed, passed) << name;
        EXPECT_EQ(answer.remoteAddress.value_or(none).text, remote) << name;
        EXPECT_EQ(answer.testedAddress.value_or(none).text, tested) << name;
        EXPECT_EQ(answer.requestedDevice + "," + answer.respondingDevice, devices) << name;
    }
}
// clang-format on

TEST(AnswersTest, AnAddressIsFourNumbersAndNothingElse) {
    EXPECT_TRUE(isIpv4Address("0.0.0.0") && isIpv4Address("255.255.255.255"));
    const std::string bad[]{"", "1.2.3.4\n", "1.2.3", "1.2.3.256", "::1", {"1.2.3.4\0x", 9}};
    for (const auto& text : bad) EXPECT_FALSE(isIpv4Address(text)) << text;
}

TEST_F(ServerRequestsTest, TheRequestedWaitHoldsForOneCycle) {
    const auto row = [&](const std::string& body, int wait, const std::string& line) {
        web.answer(kPoll, body);
        EXPECT_EQ(client.serverRequestedSleep(), wait > 0) << body;
        EXPECT_EQ(log.texts().back().find("TavikClient::pollServerForSleepTime - " + line), 0U);
        EXPECT_EQ(client.pollServerForSleepTime(), wait) << body;
        EXPECT_EQ(client.getServerSleepTime(), std::max(wait, 120));
        client.resetServerSleepTime();
    };
    row(kWait + "<wait_time>121", 121, "sleep time from server is 121");
    row(kWait + "<wait_time>soon", 0, "received garbage sleep time from central server.");
    row(kWait, 0, "malformed wait_time from central server.");
    row("<action>proceed</action>", 0, "central server gave permission to proceed.");
    row("", 0, "httpGet for " + kRest + "remote_access_status/*ID_REMOVED*, failed");
    row("wait", 0, "missing action from central server.");
    setConfig("DEVICEID", "");
    EXPECT_EQ(client.pollServerForSleepTime() + client.pollServerForSleepTime(), 0);
    EXPECT_EQ(log.countPart("failed to get Device ID from DynamicConfig. Therefore"), 2);
    EXPECT_EQ(web.urls(), Urls(6, kPoll));
}

TEST_F(ServerRequestsTest, ThePublicAddressIsTheBodyAsItCame) {
    std::string ip;
    int wait = 5;
    web.answerOnce("/myip", "44.128.0.9");
    EXPECT_TRUE(client.getMyIP(ip, wait) && wait == 0);
    web.answerOnce("/myip", "device-7350142\n");
    EXPECT_FALSE(client.getMyIP(ip, wait) || client.getMyIP(ip, wait));
    EXPECT_EQ(ip, "device-7350142\n");
    client.resetServerSleepTime();
    web.answer(kPoll, kWait + "<wait_time>9</wait_time>");
    EXPECT_TRUE(!client.getMyIP(ip, wait) && wait == 9);
    EXPECT_EQ(web.urls(), (Urls{kPoll, kRest + "myip", kRest + "myip", kRest + "myip", kPoll}));
}

class PortTestTest : public CloudTest {
protected:
    // What a test with these answers returns and leaves, and a line that it must log once.
    void row(std::string ip, const Answers& answers, const std::string& left, const char* line) {
        web.clear();
        log.clear();
        for (const auto& answer : answers) web.answerOnce("/test", answer);
        const int result =
            client.testPort(ip, 9091, type, true, checkSleep, &relay, skipNat, remote);
        const char* const results[]{"", "skip", "fail", "pass"};
        EXPECT_EQ(results[result] + (", " + ip) + ", " + remote + (relay ? ", relay" : "") +
                      (client.lastPortTestPassed() ? "" : ", last failed"),
                  left);
        EXPECT_EQ(web.count("/test"), answers.size()) << line;
        EXPECT_EQ(log.countPart(line), 1) << line << log.dump();
    }

    HttpType type = HTTP;
    bool checkSleep = false, relay = true, skipNat = false;
    std::string remote = "stale";
};

TEST_F(PortTestTest, TriesThreeTimesUnlessItPassesOrMeetsASecondNat) {
    const std::string ip = "44.128.0.20", ok = "Success", large = ok + std::string(9900, '%');
    const std::string passed = "pass, 44.128.0.20, ", failed = "fail, 44.128.0.20, , last failed";
    // clang-format off
    const auto seen = [](const std::string& by) { return "<remote_external_ip>" + by + "</remote_external_ip>"; };
    const std::string device = "<req_device_id>device-7350142</req_device_id><resp_device_id>device-7350142</resp_device_id>";
    const std::string request = "https://web.kavra.example/test?id=device-7350142&ip=44.128.0.20&port=9091&type=HTTP&auth=auth-91c2f0aa";
    row(ip, {large + "<external_ip>a</external_ip>" + seen("44.128.0.9") + device}, passed + "44.128.0.9",
        "testPort[1] - port check URL: [https://web.kavra.example/test?id=*ID_REMOVED*&ip=44.128.0.20&port=9091&type=HTTP&auth=*AUTH_REMOVED*].\n");
    EXPECT_EQ(web.urls(), (Urls{kPoll, request}));
    row(ip, {"no" + seen("44.128.0.9")}, "fail, 44.128.0.20, , relay", "(double-NAT detected");
    row(ip, {"no" + seen(ip), none, "device-7350142 no" + seen("x")}, failed,
        "[3] -  failure response from server: [*ID_REMOVED* no<");
    EXPECT_EQ(log.countPart("testPort[2] - httpGet for https://web.kavra.example/test?id=*ID_REMOVED*"), 1);
    EXPECT_EQ(web.urls(), (Urls{request, request, request, "http://127.0.0.1:80/status?is=failed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{5, 5, 5, 1}));
    row(ip, {"no", ok + seen("44.128") + device}, passed, "testPort[1] -  failure response");
    row("", {"no" + seen("44.128.0.9"), none, none}, "fail, , , last failed", "Response remote external IP: [44.128.0.9].\n");
    row("", {ok + "<external_ip>device-7350142</external_ip>" + device}, "pass, device-7350142, ",
        "GOT EXTERNAL IP: [*ID_REMOVED*], start: [20], end: [34]. \n");
    row("", {ok + "<req_device_id>a</req_device_id>"}, "fail, , ", "received badly formatted response:\n");
    row(ip, {ok + "<resp_device_id>b</resp_device_id>"}, "fail, 44.128.0.20, ",
        "contains empty request device ID and/or response device ID.\n");
    row(ip, {ok + "<req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>"}, "fail, 44.128.0.20, ",
        "'*ID_REMOVED*' is different than");
    row(ip, {ok + '\0' + device}, "fail, 44.128.0.20, ", "httpGet got Success, 100 bytes");
    // clang-format on
    skipNat = true;
    row(ip, {"no" + seen("44.128.0.9"), none, none}, failed, "testPort - port map check failed.\n");
    type = static_cast<HttpType>(7);
    row(ip, {ok + device}, passed, "Cannot retrieve remote_external_ip from");
    EXPECT_EQ(web.count("&port=9091&type=HTTPS&auth=auth-91c2f0aa"), 1);
}

TEST_F(PortTestTest, ObstaclesPreventTheTest) {
    client.clearPortTestSuccess();
    web.answerOnce(kPoll, kWait + "<wait_time>9</wait_time>");
    row("", {}, "skip, , , last failed", "testPort - server has requested sleep.\n");
    client.resetServerSleepTime();
    setConfig("DEVICEAUTH", "");
    row("", {}, "fail, , , last failed", "testPort - failed to get Device Auth Code");
    setConfig("DEVICEID", "");
    row("", {}, "fail, , , last failed", "testPort - failed to get Device ID");
    commands.answer("hdparm", " drive state is:  standby\n");
    checkSleep = true;
    row("", {}, "skip, , , last failed", "testPort - hard disk is asleep.\n");
}

}  // namespace
}  // namespace pelorus
