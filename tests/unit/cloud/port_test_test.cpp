#include <string>
#include <vector>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

const std::string kPoll =
    "http://web.kavra.example/api/1.0/rest/remote_access_status/device-7350142";
const std::string kMyIp = "http://web.kavra.example/api/1.0/rest/myip";
const std::string kDevice =
    "<req_device_id>device-7350142</req_device_id><resp_device_id>device-7350142</resp_device_id>";
std::string request(const std::string& externalIp, const std::string& type = "HTTP") {
    return "https://web.kavra.example/test?id=device-7350142&ip=" + externalIp +
           "&port=9091&type=" + type + "&auth=auth-91c2f0aa";
}

class PortTestTest : public CloudTest {
protected:
    int test(HttpType type = HTTP) {
        return TavikClient::getInstance()->testPort(externalIp, 9091, type, true, checkSleep,
                                                    &enforceRelay, skipDoubleNat, remoteIp);
    }

    std::string externalIp = "44.128.0.20";
    bool checkSleep = false;
    bool enforceRelay = true;
    bool skipDoubleNat = false;
    std::string remoteIp = "stale";
};

TEST_F(PortTestTest, APassTakesOneRequestAndTellsTheRemoteAddress) {
    givenClient();
    web.answer("/test", "Success<remote_external_ip>44.128.0.9</remote_external_ip>" + kDevice);
    EXPECT_EQ(test(), PASS_TEST);
    EXPECT_EQ(web.urls(), (Urls{kPoll, request("44.128.0.20")}));
    EXPECT_EQ(remoteIp, "44.128.0.9");
    EXPECT_FALSE(enforceRelay);
    EXPECT_EQ(log.countPart("?id=*ID_REMOVED*&ip=44.128.0.20&port=9091&type=HTTP&auth=*AUTH"), 2);
}

TEST_F(PortTestTest, ThreeFailuresPauseThreeTimesAndReportFailed) {
    givenClient();
    web.answerOnce("/test", "no<remote_external_ip>44.128.0.20</remote_external_ip>");
    web.answerOnce("/test", FakeWeb::noAnswer());
    web.answerOnce("/test", "device-7350142 no");
    EXPECT_EQ(test(), FAIL_TEST);
    const std::string url = request("44.128.0.20");
    EXPECT_EQ(web.urls(), (Urls{kPoll, url, url, url, "http://127.0.0.1:80/status?is=failed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{5, 5, 5, 1}));
    EXPECT_FALSE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(remoteIp, "");
    EXPECT_EQ(log.countPart("testPort - Cannot retrieve remote_external_ip from test port"), 2);
    EXPECT_EQ(log.countPart("auth=*AUTH_REMOVED*, no response from central server.\n"), 1);
    EXPECT_EQ(log.countPart("testPort[3] -  failure response from server: [*ID_REMOVED* no].\n"),
              1);
}

TEST_F(PortTestTest, ALaterAttemptMayPass) {
    givenClient();
    web.answer("/test", "Success<remote_external_ip>44.128</remote_external_ip>" + kDevice);
    web.answerOnce("/test", "no");
    TavikClient::getInstance()->clearPortTestSuccess();
    EXPECT_EQ(test(static_cast<HttpType>(7)), PASS_TEST);
    EXPECT_EQ(web.count(request("44.128.0.20", "HTTPS")), 2);
    EXPECT_EQ(clock.pauses(), std::vector<long>{5});
    EXPECT_EQ(remoteIp, "");
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
}

TEST_F(PortTestTest, OnlyAnotherAddressIsADoubleNatAndEndsTheTestAtOnce) {
    givenClient();
    const auto relays = [&](const char* external, const std::string& remote, bool skip) {
        web.clear();
        web.answer("/test", "no <remote_external_ip>" + remote + "</remote_external_ip>");
        externalIp = external;
        skipDoubleNat = skip;
        EXPECT_EQ(test(), FAIL_TEST);
        EXPECT_EQ(web.count("/test"), enforceRelay ? 1 : 3);
        return enforceRelay;
    };
    EXPECT_TRUE(relays("44.128.0.20", "44.128.0.9", false));
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_FALSE(relays("44.128.0.20", "44.128.0.9", true));
    EXPECT_FALSE(relays("44.128.0.20", "44.128.0.20", false));
    EXPECT_FALSE(relays("44.128.0.20", "x", false));
    EXPECT_FALSE(relays("", "44.128.0.9", false));
}

TEST_F(PortTestTest, APassTellsTheTestedAddressAndFailsForAnotherDevice) {
    givenClient();
    const auto row = [&](const char* name, const std::string& body, int result,
                         const std::string& address, const char* line) {
        SCOPED_TRACE(name);
        log.clear();
        web.answer("/test", body);
        externalIp.clear();
        EXPECT_EQ(test(), result);
        EXPECT_EQ(externalIp, address);
        EXPECT_EQ(log.countPart(line), 1) << log.dump();
        EXPECT_EQ(log.countPart("'*ID_REMOVED*' is different than"), result == PASS_TEST ? 0 : 1);
    };
    const std::string large(10000, '%');
    // clang-format off
    row("the address is taken", "Success<external_ip>44.128.0.20</external_ip>" + kDevice, PASS_TEST, "44.128.0.20", "GOT EXTERNAL IP: [44.128.0.20], start: [20], end: [31]. \n");
    row("no tags are badly formatted", "Success", FAIL_TEST, "", "testPort - port map check received badly formatted response:\n");
    row("empty text is no device", "Success</external_ip><req_device_id></req_device_id><resp_device_id></resp_device_id>", FAIL_TEST, "", "contains empty request device ID and/or response device ID.\n");
    row("another device fails", "Success</external_ip><req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>", FAIL_TEST, "", "testPort - result data [Success</external_ip><req");
    row("an unopened address starts at twelve", "Success 0123here</external_ip>" + kDevice, PASS_TEST, "here", "[here], start: [12], end: [16]. \n");
    row("closed before opened is empty", "Success</external_ip><external_ip>x" + kDevice, PASS_TEST, "", "[], start: [34], end: [7]. \n");
    row("an identifier as address is masked", "Success<external_ip>device-7350142</external_ip>" + kDevice, PASS_TEST, "device-7350142", "GOT EXTERNAL IP: [*ID_REMOVED*]");
    row("behind a NUL nothing is seen", "Success</external_ip>" + std::string(1, '\0') + kDevice, FAIL_TEST, "", "httpGet got Success</external_ip>, 114 bytes");
    row("a large answer of percent signs is read", large + "</external_ip>Success" + kDevice, PASS_TEST, large.substr(12), "port map check success.\n");
    // clang-format on
    EXPECT_EQ(web.count("/test"), 9);
}

TEST_F(PortTestTest, ObstaclesKeepTheTestFromRunning) {
    TavikClient& client = givenClient();
    commands.answer("hdparm", " drive state is:  standby\n");
    checkSleep = true;
    EXPECT_EQ(test(), SKIP_TEST);
    checkSleep = false;
    web.answerOnce(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    EXPECT_EQ(test(), SKIP_TEST);
    client.resetServerSleepTime();
    for (const char* const key : {"DEVICEAUTH", "DEVICEID"}) {
        setConfig(key, "");
        EXPECT_EQ(test(), FAIL_TEST);
    }
    EXPECT_EQ(web.urls(), (Urls{kPoll, kPoll}));
    EXPECT_TRUE(client.lastPortTestPassed());
    EXPECT_EQ(log.countPart("testPort - failed to get Device "), 2);
}

TEST_F(PortTestTest, ThePublicAddressIsTheBodyAsItCameAndStaysWithoutOne) {
    TavikClient& client = givenClient();
    int wait = 5;
    for (const std::string body : {"44.128.0.9", "44.128.0.9\n", "device-7350142"}) {
        web.answerOnce("/myip", body);
        EXPECT_EQ(client.getMyIP(externalIp, wait), body == "44.128.0.9");
        EXPECT_EQ(externalIp, body);
        EXPECT_EQ(wait, 0);
    }
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    client.resetServerSleepTime();
    web.answer(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(wait, 9);
    EXPECT_EQ(externalIp, "device-7350142");
    EXPECT_EQ(web.urls(), (Urls{kPoll, kMyIp, kMyIp, kMyIp, kMyIp, kPoll}));
}

}  // namespace
}  // namespace pelorus
