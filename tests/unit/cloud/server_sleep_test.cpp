#include <string>

#include "cloud_fixture.h"

namespace pelorus {

namespace {

const std::string kPrefix = "TavikClient::pollServerForSleepTime - ";
const std::string kPath = "http://web.kavra.example/api/1.0/rest/remote_access_status/";
const std::string kRequest = kPath + "device-7350142";
const std::string kMasked = kPath + "*ID_REMOVED*";

class ServerSleepTest : public CloudTest {};

struct Row : Case {
    std::string body;
    int seconds;
    const char* line;
};

class SleepAnswer : public CloudTest, public ::testing::WithParamInterface<Row> {};

TEST_P(SleepAnswer, DecidesTheWaitOfTheCycle) {
    const std::string& body = GetParam().body;
    const int seconds = GetParam().seconds;
    TavikClient& client = givenClient();
    web.answer(kRequest, body);
    EXPECT_EQ(client.serverRequestedSleep(), seconds > 0);
    EXPECT_EQ(client.pollServerForSleepTime(), seconds);
    EXPECT_EQ(web.urls(), Urls{kRequest});
    expectLogIs({{LOG_INFO, "TavikClient::getRestUrl - restURL " + kPath + "_s.\n"},
                 {LOG_INFO, kPrefix + "remote status url: " + kMasked + ".\n"},
                 {LOG_INFO, kPrefix + "httpGet got " + body + ", " + std::to_string(body.size()) +
                                " bytes.\n"},
                 {LOG_INFO, kPrefix + GetParam().line},
                 {LOG_INFO, kPrefix + "central server already polled. Sleep time is " +
                                std::to_string(seconds) + " secs.\n"}});
}

const std::string kWait = "<action>wait</action>";

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rows, SleepAnswer, ::testing::Values(
    Row{{"TheTimeIsRead"}, kWait + "x <wait_time> 300s", 300, "sleep time from server is 300 secs.\n"},
    Row{{"ZeroIsNoWait"}, kWait + "<wait_time>0</wait_time>", 0, "sleep time from server is 0 secs.\n"},
    Row{{"ANegativeTimeIsGarbage"}, kWait + "<wait_time>-1</wait_time>", 0, "received garbage sleep time from central server. Therefore using sleep time 0 secs.\n"},
    Row{{"AWordIsGarbage"}, kWait + "<wait_time>soon</wait_time>", 0, "received garbage sleep time from central server. Therefore using sleep time 0 secs.\n"},
    Row{{"AHugeTimeIsGarbage"}, kWait + "<wait_time>99999999999", 0, "received garbage sleep time from central server. Therefore using sleep time 0 secs.\n"},
    Row{{"AnEarlierTimeIsNotSeen"}, "<wait_time>300</wait_time>" + kWait, 0, "malformed wait_time from central server. Therefore using sleep time 0 secs.\n"},
    Row{{"WaitBeatsProceed"}, "<action>proceed</action>" + kWait + "<wait_time>300", 300, "sleep time from server is 300 secs.\n"},
    Row{{"ProceedIsNoWait"}, "<action>proceed</action><wait_time>300", 0, "central server gave permission to proceed. Sleep time is 0 secs.\n"},
    Row{{"CaseMatters"}, "<ACTION>wait</ACTION><wait_time>300", 0, "missing action from central server. Therefore using sleep time 0 secs.\n"}),
    CaseName{});
// clang-format on

TEST_F(ServerSleepTest, EveryCycleAsksOnceAndPausesForAtLeastTwoMinutes) {
    TavikClient& client = givenClient();
    web.answerOnce(kRequest, kWait + "<wait_time>121</wait_time>");
    web.answerOnce(kRequest, kWait + "<wait_time>119</wait_time>");
    EXPECT_TRUE(client.serverRequestedSleep());
    EXPECT_EQ(client.getServerSleepTime(), 121);
    client.resetServerSleepTime();
    EXPECT_TRUE(client.serverRequestedSleep());
    EXPECT_EQ(client.getServerSleepTime(), 120);
    client.resetServerSleepTime();
    EXPECT_FALSE(client.serverRequestedSleep());
    EXPECT_FALSE(client.serverRequestedSleep());
    EXPECT_EQ(web.urls(), (Urls{kRequest, kRequest, kRequest}));
    expectLogged(
        LOG_ERR,
        kPrefix + "httpGet for " + kMasked +
            ", failed to get response from central server. Therefore using sleep time 0 secs.\n");
}

TEST_F(ServerSleepTest, WithoutAnIdentifierEachQuestionFailsAndNothingIsSent) {
    TavikClient& client = givenClient();
    setConfig("DEVICEID", "");
    EXPECT_EQ(client.pollServerForSleepTime() + client.pollServerForSleepTime(), 0);
    EXPECT_EQ(web.urls(), Urls{});
    EXPECT_EQ(
        log.count(
            LOG_ERR,
            kPrefix +
                "failed to get Device ID from DynamicConfig. Therefore using sleep time 0 secs.\n"),
        2);
}

}  // namespace

}  // namespace pelorus
