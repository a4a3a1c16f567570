#include "cloud/public_address.h"
#include "cloud_fixture.h"

namespace pelorus {
namespace {

const std::string kPoll =
    "http://web.kavra.example/api/1.0/rest/remote_access_status/device-7350142";
const std::string kMyIp = "http://web.kavra.example/api/1.0/rest/myip";
const std::string kRequest =
    "https://web.kavra.example/test?id=device-7350142&ip=44.128.0.20&port=9091&type=HTTP"
    "&auth=auth-91c2f0aa";
const std::string kDevice =
    "<req_device_id>device-7350142</req_device_id><resp_device_id>device-7350142</resp_device_id>";

class PortTestTest : public CloudTest {
protected:
    int test(HttpType type = HTTP) {
        return client.testPort(externalIp, 9091, type, true, checkSleep, &enforceRelay,
                               skipDoubleNat, remoteIp);
    }
    // Tests with answers to all requests; what it leaves, and a line that must be logged once.
    void row(const char* external,
             const std::vector<FakeWeb::Answer>& answers,
             int result,
             const std::string& left,
             const std::string& line) {
        web.clear();
        log.clear();
        for (const auto& answer : answers) web.answerOnce("/test", answer);
        externalIp = external;
        EXPECT_EQ(test(), result) << line;
        EXPECT_EQ(externalIp + ", " + remoteIp + (enforceRelay ? ", relay" : "") +
                      (client.lastPortTestPassed() ? ", passed" : ", failed"),
                  left);
        EXPECT_EQ(web.count("/test"), answers.size()) << line;
        EXPECT_EQ(log.countPart(line), 1) << line << log.dump();
    }

    TavikClient& client = givenClient();
    std::string externalIp;
    bool checkSleep = false;
    bool enforceRelay = true;
    bool skipDoubleNat = false;
    std::string remoteIp = "stale";
};

TEST_F(PortTestTest, TriesThreeTimesUnlessItPassesOrMeetsASecondNat) {
    const FakeWeb::Answer none = FakeWeb::noAnswer();
    const auto no = [](const std::string& seen) {
        return FakeWeb::Answer{"no<remote_external_ip>" + seen + "</remote_external_ip>"};
    };
    const auto passed = [](const std::string& body) { return FakeWeb::Answer{"Success" + body}; };
    const char* const ip = "44.128.0.20";
    // clang-format off
    row(ip, {passed("<external_ip>a</external_ip><remote_external_ip>44.128.0.9</remote_external_ip>" + kDevice)}, PASS_TEST, "44.128.0.20, 44.128.0.9, passed", "testPort[1] - port check URL: [https://web.kavra.example/test?id=*ID_REMOVED*&ip=44.128.0.20&port=9091&type=HTTP&auth=*AUTH_REMOVED*].\n");
    EXPECT_EQ(web.urls(), (Urls{kPoll, kRequest}));
    row(ip, {no("44.128.0.9")}, FAIL_TEST, "44.128.0.20, , relay, passed", "(double-NAT detected");
    EXPECT_EQ(clock.pauses(), std::vector<long>{});
    row(ip, {no(ip), none, "device-7350142 no"}, FAIL_TEST, "44.128.0.20, , failed", "[3] -  failure response from server: [*ID_REMOVED* no].\n");
    EXPECT_EQ(web.urls(), (Urls{kRequest, kRequest, kRequest, "http://127.0.0.1:80/status?is=failed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{5, 5, 5, 1}));
    row(ip, {"no", passed("<remote_external_ip>44.128</remote_external_ip>" + kDevice)}, PASS_TEST, "44.128.0.20, , passed", "testPort[1] -  failure response");
    row(ip, {no("x"), none, none}, FAIL_TEST, "44.128.0.20, , failed", "testPort[2] - httpGet for https://web.kavra.example/test?id=*ID_REMOVED*");
    row("", {no("44.128.0.9"), none, none}, FAIL_TEST, ", , failed", "Response remote external IP: [44.128.0.9].\n");
    row("", {passed("<external_ip>device-7350142</external_ip>" + kDevice)}, PASS_TEST, "device-7350142, , passed", "GOT EXTERNAL IP: [*ID_REMOVED*], start: [20], end: [34]. \n");
    row("", {passed("<req_device_id>a</req_device_id>")}, FAIL_TEST, ", , passed", "received badly formatted response:\n");
    row("", {passed(" 0123here</external_ip>" + kDevice)}, PASS_TEST, "here, , passed", "GOT EXTERNAL IP: [here], start: [12], end: [16]. \n");
    row("", {passed("</external_ip><external_ip>x" + kDevice)}, PASS_TEST, ", , passed", "GOT EXTERNAL IP: [], start: [34], end: [7]. \n");
    row(ip, {passed("789012345678944.128.0.9</remote_external_ip>" + kDevice)}, PASS_TEST, "44.128.0.20, , passed", "Cannot retrieve remote_external_ip from test port response\n");
    row(ip, {passed("<remote_external_ip>44.128.0.9" + kDevice)}, PASS_TEST, "44.128.0.20, , passed", "Cannot retrieve remote_external_ip from test port response\n");
    row(ip, {passed("<req_device_id>b<resp_device_id>b</resp_device_id>")}, FAIL_TEST, "44.128.0.20, , passed", "contains empty request device ID and/or response device ID.\n");
    row(ip, {passed("<req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>")}, FAIL_TEST, "44.128.0.20, , passed", "'*ID_REMOVED*' is different than");
    row(ip, {passed(std::string(1, '\0') + kDevice)}, FAIL_TEST, "44.128.0.20, , passed", "httpGet got Success, 100 bytes");
    row(ip, {passed(std::string(10000, '%') + kDevice)}, PASS_TEST, "44.128.0.20, , passed", "port map check success.\n");
    client.clearPortTestSuccess();
    EXPECT_FALSE(client.lastPortTestPassed());
    skipDoubleNat = true;
    row(ip, {no("44.128.0.9"), none, none}, FAIL_TEST, "44.128.0.20, , failed", "testPort - port map check failed.\n");
    // clang-format on
    test(static_cast<HttpType>(7));
    EXPECT_EQ(web.count("&port=9091&type=HTTPS&auth=auth-91c2f0aa"), 3);
}

TEST_F(PortTestTest, ObstaclesPreventTheTest) {
    commands.answer("hdparm", " drive state is:  standby\n");
    checkSleep = true;
    row("", {}, SKIP_TEST, ", , passed", "testPort - hard disk is asleep.\n");
    checkSleep = false;
    web.answerOnce(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    row("", {}, SKIP_TEST, ", , passed", "testPort - server has requested sleep.\n");
    client.resetServerSleepTime();
    setConfig("DEVICEAUTH", "");
    row("", {}, FAIL_TEST, ", , passed", "testPort - failed to get Device Auth Code");
    setConfig("DEVICEID", "");
    row("", {}, FAIL_TEST, ", , passed", "testPort - failed to get Device ID");
}

TEST_F(PortTestTest, ThePublicAddressIsTheBodyAsItCame) {
    int wait = 5;
    web.answerOnce("/myip", "44.128.0.9");
    EXPECT_TRUE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(wait, 0);
    web.answerOnce("/myip", "device-7350142\n");
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(externalIp, "device-7350142\n");
    client.resetServerSleepTime();
    web.answer(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(wait, 9);
    EXPECT_EQ(web.urls(), (Urls{kPoll, kMyIp, kMyIp, kMyIp, kPoll}));
    for (const char* const bad : {"", "44.128.0.9\n", "44.128.0.256", "::1"}) {
        EXPECT_FALSE(isIpv4Address(bad)) << bad;
    }
    EXPECT_FALSE(isIpv4Address(std::string("1.2.3.4\0x", 9)));
}

}  // namespace
}  // namespace pelorus
