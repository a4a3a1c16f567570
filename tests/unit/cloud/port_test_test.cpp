#include <string>
#include <vector>

#include "cloud_fixture.h"

namespace pelorus {

namespace {

const std::string kPoll =
    "http://web.kavra.example/api/1.0/rest/remote_access_status/device-7350142";
const std::string kMyIp = "http://web.kavra.example/api/1.0/rest/myip";
const std::string kMasked =
    "https://web.kavra.example/test?id=*ID_REMOVED*&ip=44.128.0.20&port=9091&type=HTTP&auth=*AUTH_REMOVED*";
const std::string kDevice =
    "<req_device_id>device-7350142</req_device_id><resp_device_id>device-7350142</resp_device_id>";
const std::string kDeviceMasked =
    "<req_device_id>*ID_REMOVED*</req_device_id><resp_device_id>*ID_REMOVED*</resp_device_id>";

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
    const std::string address = "<remote_external_ip>44.128.0.9</remote_external_ip>";
    web.answer("/test", "Success" + address + kDevice);
    EXPECT_EQ(test(), PASS_TEST);
    EXPECT_EQ(web.urls(), (Urls{kPoll, request("44.128.0.20")}));
    EXPECT_EQ(externalIp, "44.128.0.20");
    EXPECT_EQ(remoteIp, "44.128.0.9");
    EXPECT_FALSE(enforceRelay);
    EXPECT_EQ(clock.pauses(), std::vector<long>{});
    const std::vector<support::LogLine> lines(log.lines().end() - 6, log.lines().end());
    const std::vector<support::LogLine> wanted{
        {LOG_INFO, "TavikClient::testPort[1-3] - Port Test URL: [" + kMasked + "].\n"},
        {LOG_INFO, "TavikClient::testPort[1] - port check URL: [" + kMasked + "].\n"},
        {LOG_NOTICE, "TavikClient::testPort[1] - httpGet got Success" + address + kDeviceMasked +
                         ", 150 bytes from central server.\n"},
        {LOG_INFO, "TavikClient::testPort - Response remote external IP: [44.128.0.9].\n"},
        {LOG_INFO,
         "TavikClient::testPort - port test succeeded for requested external IP: [44.128.0.20]\n"},
        {LOG_INFO, "TavikClient::testPort - port map check success.\n"}};
    EXPECT_EQ(lines, wanted);
}

TEST_F(PortTestTest, ThreeFailuresPauseThreeTimesAndReportFailed) {
    givenClient();
    const std::string first = "no<remote_external_ip>44.128.0.20</remote_external_ip>";
    web.answerOnce("/test", first);
    web.answerOnce("/test", FakeWeb::noAnswer());
    web.answerOnce("/test", "device-7350142 no");
    EXPECT_EQ(test(), FAIL_TEST);
    const std::string url = request("44.128.0.20");
    EXPECT_EQ(web.urls(), (Urls{kPoll, url, url, url, "http://127.0.0.1:80/status?is=failed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{5, 5, 5, 1}));
    EXPECT_FALSE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_FALSE(enforceRelay);
    EXPECT_EQ(remoteIp, "");
    expectLoggedInOrder(
        {"TavikClient::testPort[1] - port check failed, retrying in 5 seconds, url:  [" + kMasked +
             "].\n",
         "TavikClient::testPort[1] -  failure response from server: [" + first + "].\n",
         "TavikClient::testPort[2] - port check URL: [" + kMasked + "].\n",
         "TavikClient::testPort[2] - httpGet for " + kMasked +
             ", no response from central server.\n",
         "TavikClient::testPort - Cannot retrieve remote_external_ip from test port response\n",
         "TavikClient::testPort - port test failed for requested external IP: [44.128.0.20]\n",
         "TavikClient::testPort[2] - port check failed, retrying in 5 seconds, url:  [" + kMasked +
             "].\n",
         "TavikClient::testPort[3] -  failure response from server: [*ID_REMOVED* no].\n",
         "TavikClient::testPort - port map check failed.\n"});
    expectNotLogged("testPort[2] -  failure response");
}

TEST_F(PortTestTest, ALaterAttemptMayPassAndEndsTheTest) {
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

struct NatRow : Case {
    const char* externalIp;
    std::string remote;
    bool skip;
    bool relay;
    const char* line;
};

class DoubleNat : public PortTestTest, public ::testing::WithParamInterface<NatRow> {};

TEST_P(DoubleNat, EndsTheTestAtOnceWhenItIsFound) {
    givenClient();
    web.answer("/test", "no <remote_external_ip>" + GetParam().remote + "</remote_external_ip>");
    externalIp = GetParam().externalIp;
    skipDoubleNat = GetParam().skip;
    const bool relay = GetParam().relay;
    EXPECT_EQ(test(), FAIL_TEST);
    EXPECT_EQ(enforceRelay, relay);
    EXPECT_EQ(web.count("/test"), relay ? 1 : 3);
    EXPECT_EQ(web.count("is=failed"), relay ? 0 : 1);
    EXPECT_EQ(clock.pauses().empty(), relay);
    EXPECT_EQ(TavikClient::getInstance()->lastPortTestPassed(), relay);
    EXPECT_EQ(log.countPart(GetParam().line), relay ? 1 : 3) << log.dump();
    EXPECT_EQ(log.countPart("double-NAT"), relay ? 1 : 0);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rows, DoubleNat, ::testing::Values(
    NatRow{{"AnotherAddressIsOne"}, "44.128.0.20", "44.128.0.9", false, true, "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected: Server-returned external IP != router's external IP).\n"},
    NatRow{{"NotWhenNobodyLooks"}, "44.128.0.20", "44.128.0.9", true, false, "TavikClient::testPort - Response remote external IP: [44.128.0.9].\n"},
    NatRow{{"NotTheSameAddress"}, "44.128.0.20", "44.128.0.20", false, false, "TavikClient::testPort - PORT TEST RESPONSE, GOT REMOTE EXTERNAL IP: [44.128.0.20], start: [23], end: [34]\n"},
    NatRow{{"NotSomethingElse"}, "44.128.0.20", "x", false, false, "TavikClient::testPort - Requested external IP: [44.128.0.20] / Respond remote external IP: [x].\n"},
    NatRow{{"NotWithoutARequest"}, "", "44.128.0.9", false, false, "TavikClient::testPort - port test failed for requested external IP: []\n"}),
    CaseName{});
// clang-format on

struct AnswerRow : Case {
    std::string body;
    bool sameDevice;
    std::string externalIp;
    const char* line;
};

class PassedAnswer : public PortTestTest, public ::testing::WithParamInterface<AnswerRow> {};

TEST_P(PassedAnswer, TellsTheTestedAddressAndTheDevice) {
    const bool sameDevice = GetParam().sameDevice;
    givenClient();
    web.answer("/test", GetParam().body);
    externalIp.clear();
    EXPECT_EQ(test(), sameDevice ? PASS_TEST : FAIL_TEST);
    EXPECT_EQ(externalIp, GetParam().externalIp);
    EXPECT_EQ(web.urls(), (Urls{kPoll, request("")}));
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(log.countPart(GetParam().line), 1) << log.dump();
    EXPECT_EQ(log.countPart("TavikClient::testPort - result data ["), sameDevice ? 0 : 1);
    EXPECT_EQ(
        log.count(
            LOG_ERR,
            "TavikClient::testPort - Port test response Device ID '*ID_REMOVED*' is different than the Device ID of this unit '*ID_REMOVED*'.\n"),
        sameDevice ? 0 : 1);
}

const std::string kLong(10000, 'x');

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rows, PassedAnswer, ::testing::Values(
    AnswerRow{{"TheAddressIsTaken"}, "Success<external_ip>44.128.0.20</external_ip>" + kDevice, true, "44.128.0.20", "TavikClient::testPort - PORT TEST RESPONSE, GOT EXTERNAL IP: [44.128.0.20], start: [20], end: [31]. \n"},
    AnswerRow{{"NoTagsAreBadlyFormatted"}, "Success", false, "", "TavikClient::testPort - port map check received badly formatted response:\n"},
    AnswerRow{{"EmptyTextIsNoDevice"}, "Success</external_ip><req_device_id></req_device_id><resp_device_id></resp_device_id>", false, "", "TavikClient::testPort - Port test response contains empty request device ID and/or response device ID.\n"},
    AnswerRow{{"AnotherDeviceFails"}, "Success</external_ip><req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>", false, "", "TavikClient::testPort - result data [Success</external_ip><req"},
    AnswerRow{{"AnUnopenedAddressStartsAtTwelve"}, "Success 0123here</external_ip>" + kDevice, true, "here", "GOT EXTERNAL IP: [here], start: [12], end: [16]. \n"},
    AnswerRow{{"ClosedBeforeOpenedIsEmpty"}, "Success</external_ip><external_ip>x" + kDevice, true, "", "GOT EXTERNAL IP: [], start: [34], end: [7]. \n"},
    AnswerRow{{"AnIdentifierAsAddressIsMasked"}, "Success<external_ip>device-7350142</external_ip>" + kDevice, true, "device-7350142", "GOT EXTERNAL IP: [*ID_REMOVED*]"},
    AnswerRow{{"BehindANulNothingIsSeen"}, "Success</external_ip>" + std::string(1, '\0') + kDevice, false, "", "httpGet got Success</external_ip>, 114 bytes"},
    AnswerRow{{"PercentSignsAreText"}, "Success%n%s</external_ip>" + kDevice, true, "", "httpGet got Success%n%s</external_ip>"},
    AnswerRow{{"ALargeAnswerIsRead"}, kLong + "</external_ip>Success" + kDevice, true, kLong.substr(12), "port map check success.\n"}),
    CaseName{});
// clang-format on

TEST_F(PortTestTest, ObstaclesKeepTheTestFromRunning) {
    TavikClient& client = givenClient();
    commands.answer("hdparm", " drive state is:  standby\n");
    checkSleep = true;
    EXPECT_EQ(test(), SKIP_TEST);
    EXPECT_EQ(web.urls(), Urls{});
    checkSleep = false;
    web.answerOnce(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    EXPECT_EQ(test(), SKIP_TEST);
    client.resetServerSleepTime();
    setConfig("DEVICEAUTH", "");
    EXPECT_EQ(test(), FAIL_TEST);
    setConfig("DEVICEID", "");
    EXPECT_EQ(test(), FAIL_TEST);
    EXPECT_EQ(web.urls(), (Urls{kPoll, kPoll}));
    EXPECT_TRUE(client.lastPortTestPassed());
    expectLogged(LOG_INFO, "TavikClient::testPort - hard disk is asleep.\n");
    expectLogged(LOG_INFO, "TavikClient::testPort - server has requested sleep.\n");
    expectLogged(LOG_ERR,
                 "TavikClient::testPort - failed to get Device Auth Code from DynamicConfig.\n");
    expectLogged(LOG_ERR, "TavikClient::testPort - failed to get Device ID from DynamicConfig.\n");
}

TEST_F(PortTestTest, ABadTemplateIsReportedOnceAndIsNoAnswer) {
    givenClient();
    setConfig("REMOTE_TESTPORTURL", "/test/%d");
    EXPECT_EQ(test(), FAIL_TEST);
    EXPECT_EQ(log.countPart("REMOTE_TESTPORTURL"), 1);
    EXPECT_EQ(log.count(LOG_INFO, "TavikClient:httpGet - empty url\n"), 3);
}

TEST_F(PortTestTest, ThePublicAddressIsTheBodyAsItCame) {
    TavikClient& client = givenClient();
    web.answerOnce("/myip", "44.128.0.9");
    web.answerOnce("/myip", "44.128.0.9\n");
    web.answerOnce("/myip", "device-7350142");
    int wait = 5;
    EXPECT_TRUE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(externalIp, "44.128.0.9");
    EXPECT_EQ(wait, 0);
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(externalIp, "44.128.0.9\n");
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(web.urls(), (Urls{kPoll, kMyIp, kMyIp, kMyIp}));
    expectLoggedInOrder({"TavikClient::getMyIP - get my IP url: " + kMyIp + "\n",
                         "TavikClient::getMyIP - httpGet Response [10 bytes]: 44.128.0.9\n",
                         "TavikClient::getMyIP - httpGet Response [14 bytes]: *ID_REMOVED*\n"});
}

TEST_F(PortTestTest, WithoutAnAnswerThePublicAddressStays) {
    TavikClient& client = givenClient();
    int wait = 5;
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(wait, 0);
    client.resetServerSleepTime();
    web.answer(kPoll, "<action>wait</action><wait_time>9</wait_time>");
    EXPECT_FALSE(client.getMyIP(externalIp, wait));
    EXPECT_EQ(wait, 9);
    EXPECT_EQ(externalIp, "44.128.0.20");
    EXPECT_EQ(web.urls(), (Urls{kPoll, kMyIp, kPoll}));
    expectLoggedInOrder(
        {"TavikClient::getMyIP - httpGet failed to get response from central server for url " +
             kMyIp + ".\n",
         "TavikClient::getMyIP - server has requested sleep 9 seconds.\n"});
}

}  // namespace

}  // namespace pelorus
