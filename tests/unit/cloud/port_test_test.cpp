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

std::string remote(const std::string& address) {
    return "<remote_external_ip>" + address + "</remote_external_ip>";
}

class PortTestTest : public CloudTest {
protected:
    int test(HttpType type = HTTP) {
        return client.testPort(externalIp, 9091, type, true, checkSleep, &enforceRelay,
                               skipDoubleNat, remoteIp);
    }

    TavikClient& client = givenClient();
    std::string externalIp = "44.128.0.20";
    bool checkSleep = false;
    bool enforceRelay = true;
    bool skipDoubleNat = false;
    std::string remoteIp = "stale";
};

TEST_F(PortTestTest, APassTakesOneRequestAndGivesTheRemoteAddress) {
    web.answer("/test", "Success<external_ip>a</external_ip>" + remote("44.128.0.9") + kDevice);
    EXPECT_EQ(test(), PASS_TEST);
    EXPECT_EQ(web.urls(), (Urls{kPoll, kRequest}));
    EXPECT_EQ(externalIp + " " + remoteIp, "44.128.0.20 44.128.0.9");
    EXPECT_FALSE(enforceRelay);
    EXPECT_EQ(log.countPart("?id=*ID_REMOVED*&ip=44.128.0.20&port=9091&type=HTTP&auth=*AUTH"), 2);
}

TEST_F(PortTestTest, ThreeFailuresPauseThreeTimesAndReportFailed) {
    web.answerOnce("/test", "no" + remote("44.128.0.20"));
    web.answerOnce("/test", FakeWeb::noAnswer());
    web.answerOnce("/test", "device-7350142 no");
    EXPECT_EQ(test(), FAIL_TEST);
    EXPECT_EQ(web.urls(),
              (Urls{kPoll, kRequest, kRequest, kRequest, "http://127.0.0.1:80/status?is=failed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{5, 5, 5, 1}));
    EXPECT_FALSE(client.lastPortTestPassed());
    EXPECT_EQ(remoteIp, "");
    EXPECT_EQ(log.countPart("Cannot retrieve remote_external_ip"), 2);
    EXPECT_EQ(log.countPart("auth=*AUTH_REMOVED*, no response from central server.\n"), 1);
    EXPECT_EQ(log.countPart("[3] -  failure response from server: [*ID_REMOVED* no].\n"), 1);
}

TEST_F(PortTestTest, ALaterAttemptMayPass) {
    web.answer("/test", "Success" + remote("44.128") + kDevice);
    web.answerOnce("/test", "no");
    client.clearPortTestSuccess();
    EXPECT_EQ(test(static_cast<HttpType>(7)), PASS_TEST);
    EXPECT_EQ(web.count("&port=9091&type=HTTPS&auth=auth-91c2f0aa"), 2);
    EXPECT_EQ(remoteIp, "");
    EXPECT_TRUE(client.lastPortTestPassed());
}

TEST_F(PortTestTest, OnlyAnotherAddressIsASecondNatAndEndsTheTestAtOnce) {
    const auto relays = [&](const char* external, const char* seen) {
        web.clear();
        web.answer("/test", "no " + remote(seen));
        externalIp = external;
        EXPECT_EQ(test(), FAIL_TEST);
        EXPECT_EQ(web.count("/test"), enforceRelay ? 1 : 3);
        return enforceRelay;
    };
    EXPECT_TRUE(relays("44.128.0.20", "44.128.0.9"));
    EXPECT_TRUE(client.lastPortTestPassed());
    EXPECT_FALSE(relays("44.128.0.20", "44.128.0.20"));
    EXPECT_FALSE(relays("44.128.0.20", "x"));
    EXPECT_FALSE(relays("", "44.128.0.9"));
    skipDoubleNat = true;
    EXPECT_FALSE(relays("44.128.0.20", "44.128.0.9"));
}

TEST_F(PortTestTest, APassTakesTheTestedAddressAndFailsForAnotherDevice) {
    const auto row = [&](const std::string& body, int result, const std::string& line) {
        log.clear();
        web.answer("/test", "Success" + body);
        externalIp.clear();
        EXPECT_EQ(test(), result) << line;
        EXPECT_EQ(log.countPart(line), 1) << line << log.dump();
        EXPECT_EQ(log.countPart("'*ID_REMOVED*' is different than"), result == PASS_TEST ? 0 : 1);
        return externalIp;
    };
    // clang-format off
    EXPECT_EQ(row("<external_ip>device-7350142</external_ip>" + kDevice, PASS_TEST, "GOT EXTERNAL IP: [*ID_REMOVED*], start: [20], end: [34]. \n"), "device-7350142");
    EXPECT_EQ(row("<req_device_id>a</req_device_id>", FAIL_TEST, "received badly formatted response:\n"), "");
    row("<resp_device_id>b</resp_device_id>", FAIL_TEST, "contains empty request device ID and/or response device ID.\n");
    row("<req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>", FAIL_TEST, "testPort - result data [Success<req");
    row(std::string(1, '\0') + kDevice, FAIL_TEST, "httpGet got Success, 100 bytes");
    row(std::string(10000, '%') + kDevice, PASS_TEST, "port map check success.\n");
    // clang-format on
}

TEST_F(PortTestTest, ObstaclesPreventTheTest) {
    commands.answer("hdparm", " drive state is:  standby\n");
    checkSleep = true;
    EXPECT_EQ(test(), SKIP_TEST);
    EXPECT_EQ(remoteIp, "");
    EXPECT_FALSE(enforceRelay);
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
}

}  // namespace
}  // namespace pelorus
