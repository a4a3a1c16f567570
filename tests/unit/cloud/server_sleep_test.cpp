#include <string>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

const std::string kPath = "http://web.kavra.example/api/1.0/rest/remote_access_status/";
const std::string kRequest = kPath + "device-7350142";
const std::string kWait = "<action>wait</action><wait_time>";

class ServerSleepTest : public CloudTest {};

TEST_F(ServerSleepTest, TheAnswerHoldsForOneCycle) {
    TavikClient& client = givenClient();
    const auto row = [&](const std::string& body, int wait, const std::string& line) {
        log.clear();
        web.answer(kRequest, body);
        EXPECT_EQ(client.serverRequestedSleep(), wait > 0) << body;
        EXPECT_EQ(client.pollServerForSleepTime(), wait) << body;
        EXPECT_EQ(client.getServerSleepTime(), std::max(wait, 120));
        EXPECT_EQ(log.countPart("pollServerForSleepTime - " + line), 1) << log.dump();
        client.resetServerSleepTime();
        EXPECT_EQ(client.getServerSleepTime(), 120);
    };
    row(kWait + "121", 121, "sleep time from server is 121 secs.\n");
    row(kWait + "119", 119, "sleep time from server is 119 secs.\n");
    row(kWait + "soon", 0, "received garbage sleep time from central server.");
    row("<action>wait</action>", 0, "malformed wait_time from central server.");
    row("<action>proceed</action>", 0, "central server gave permission to proceed.");
    row("", 0, "httpGet for " + kPath + "*ID_REMOVED*, failed to get response");
    row("what?", 0, "missing action from central server.");
    setConfig("DEVICEID", "");
    EXPECT_EQ(client.pollServerForSleepTime() + client.pollServerForSleepTime(), 0);
    EXPECT_EQ(log.countPart("failed to get Device ID from DynamicConfig. Therefore"), 2);
    EXPECT_EQ(web.urls(), Urls(7, kRequest));
}

}  // namespace
}  // namespace pelorus
