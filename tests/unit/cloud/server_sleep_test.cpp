#include <string>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

const std::string kPath = "http://web.kavra.example/api/1.0/rest/remote_access_status/";
const std::string kRequest = kPath + "device-7350142";
const std::string kWait = "<action>wait</action>";
const std::string kGarbage = "received garbage sleep time from central server. Therefore";

class ServerSleepTest : public CloudTest {};

TEST_F(ServerSleepTest, TheAnswerDecidesTheWaitOfTheCycle) {
    TavikClient& client = givenClient();
    const auto row = [&](const char* name, const std::string& body, int wait,
                         const std::string& line) {
        SCOPED_TRACE(name);
        client.resetServerSleepTime();
        log.clear();
        web.answer(kRequest, body);
        EXPECT_EQ(client.serverRequestedSleep(), wait > 0);
        EXPECT_EQ(client.pollServerForSleepTime(), wait);
        EXPECT_EQ(log.countPart("pollServerForSleepTime - " + line), 1) << log.dump();
    };
    // clang-format off
    row("the time is read", kWait + "x <wait_time> 300s", 300, "sleep time from server is 300 secs.\n");
    row("zero is no wait", kWait + "<wait_time>0</wait_time>", 0, "sleep time from server is 0 secs.\n");
    row("a negative time is garbage", kWait + "<wait_time>-1</wait_time>", 0, kGarbage);
    row("a word is garbage", kWait + "<wait_time>soon</wait_time>", 0, kGarbage);
    row("a huge time is garbage", kWait + "<wait_time>99999999999", 0, kGarbage);
    row("an earlier time is not seen", "<wait_time>300</wait_time>" + kWait, 0, "malformed wait_time from central server. Therefore");
    row("wait beats proceed", "<action>proceed</action>" + kWait + "<wait_time>300", 300, "sleep time from server is 300 secs.\n");
    row("proceed is no wait", "<action>proceed</action><wait_time>300", 0, "central server gave permission to proceed. Sleep time is 0 secs.\n");
    row("case matters", "<ACTION>wait</ACTION><wait_time>300", 0, "missing action from central server. Therefore");
    // clang-format on
}

TEST_F(ServerSleepTest, EveryCycleAsksOnceAndPausesForAtLeastTwoMinutes) {
    TavikClient& client = givenClient();
    for (const int seconds : {121, 119}) {
        web.answerOnce(kRequest, kWait + "<wait_time>" + std::to_string(seconds));
        EXPECT_TRUE(client.serverRequestedSleep());
        EXPECT_EQ(client.getServerSleepTime(), seconds == 121 ? 121 : 120);
        client.resetServerSleepTime();
    }
    EXPECT_FALSE(client.serverRequestedSleep());  // nobody answers
    EXPECT_FALSE(client.serverRequestedSleep());
    EXPECT_EQ(web.urls(), (Urls{kRequest, kRequest, kRequest}));
    EXPECT_EQ(log.countPart(kPath + "*ID_REMOVED*, failed to get response from central"), 1);
    client.resetServerSleepTime();
    setConfig("DEVICEID", "");
    EXPECT_EQ(client.pollServerForSleepTime() + client.pollServerForSleepTime(), 0);
    EXPECT_EQ(web.urls().size(), 3U);
    EXPECT_EQ(log.countPart("failed to get Device ID from DynamicConfig. Therefore"), 2);
}

}  // namespace
}  // namespace pelorus
