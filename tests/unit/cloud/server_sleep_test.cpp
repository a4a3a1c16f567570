#include "cloud_fixture.h"

namespace pelorus {
namespace {

const std::string kPath = "http://web.kavra.example/api/1.0/rest/remote_access_status/";
const std::string kWait = "<action>wait</action>";
const std::string kProceed = "<action>proceed</action>";

class ServerSleepTest : public CloudTest {};

TEST_F(ServerSleepTest, TheAnswerHoldsForOneCycle) {
    TavikClient& client = givenClient();
    const auto row = [&](const std::string& body, int wait, const std::string& line) {
        log.clear();
        web.answer(kPath + "device-7350142", body);
        EXPECT_EQ(client.serverRequestedSleep(), wait > 0) << body;
        EXPECT_EQ(client.pollServerForSleepTime(), wait) << body;
        EXPECT_EQ(client.getServerSleepTime(), std::max(wait, 120));
        EXPECT_EQ(log.countPart("pollServerForSleepTime - " + line), 1) << log.dump();
        client.resetServerSleepTime();
        EXPECT_EQ(client.getServerSleepTime(), 120);
    };
    // clang-format off
    row(kProceed + kWait + "x <wait_time> 121s", 121, "sleep time from server is 121 secs.\n");
    row(kWait + "<wait_time>0</wait_time>", 0, "sleep time from server is 0 secs.\n");
    row(kWait + "<wait_time>-1", 0, "received garbage sleep time from central server.");
    row(kWait + "<wait_time>soon", 0, "received garbage sleep time from central server.");
    row("<wait_time>300</wait_time>" + kWait, 0, "malformed wait_time from central server.");
    row(kProceed + "<wait_time>300", 0, "central server gave permission to proceed.");
    row("", 0, "httpGet for " + kPath + "*ID_REMOVED*, failed to get response");
    row("<ACTION>wait</ACTION><wait_time>300", 0, "missing action from central server.");
    // clang-format on
    EXPECT_EQ(web.urls(), Urls(8, kPath + "device-7350142"));
    setConfig("DEVICEID", "");
    EXPECT_EQ(client.pollServerForSleepTime() + client.pollServerForSleepTime(), 0);
    EXPECT_EQ(log.countPart("failed to get Device ID from DynamicConfig. Therefore"), 2);
    EXPECT_EQ(web.urls().size(), 8U);
}

}  // namespace
}  // namespace pelorus
