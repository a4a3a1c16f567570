#include "daemon/daemon_control.h"

#include <filesystem>

#include "daemon/signals.h"
#include "daemon_fixture.h"

namespace pelorus {
namespace {

class DaemonControlTest : public DaemonTest {
protected:
    void givenEnabled(int sleepTime = 30) {
        ASSERT_TRUE(installSignalHandlers());
        control.enableRemoteAccess();
        control.setSleepTime(sleepTime);
        forget();
    }
    static void terminate() { raise(SIGTERM); }
};

TEST_F(DaemonControlTest, ADisabledStartOnlyTearsDown) {
    const std::string end = "unmap 9091, " + withdraw("LAN") + " = disabled";
    const std::string switched = "connecting type=disabled, status disabled, ";
    const std::pair<const char*, std::string> rows[]{
        {"failed", switched + "lanip, " + end},
        {"", "status connecting, " + switched + end},
        {"disabled", "status connecting, " + switched + end}};
    for (const auto& [status, wanted] : rows) {
        forget();
        setConfig("COMMUNICATION_STATUS", status);
        gateway.table.push_back({9091, kLanIp, 80, "Kavra"});
        control.disableRemoteAccess();
        control.run();
        EXPECT_EQ(story(NONE), wanted);
    }
    EXPECT_TRUE(process.selfKills.empty());
}

TEST_F(DaemonControlTest, ThePauseIsTheLongerOfTheTwoPeriods) {
    givenEnabled(300);
    const int laterPeriods[]{300, -1, 1000};  // own, the server's are in its answers
    for (const std::string wait : {"301", "300", "30", "30"}) {
        web.answerOnce("/remote_access_status/",
                       "<action>wait</action><wait_time>" + wait + "</wait_time>");
    }
    std::string pauses;
    inEachPause([&](unsigned cycles, const std::string& line) {
        pauses += line + std::to_string(clock.pauses().back()) + " ";
        if (cycles == 4) return terminate();
        control.setSleepTime(laterPeriods[cycles - 1]);
    });
    control.run();
    EXPECT_EQ(pauses,
              "DaemonControl::run - retry connection after 301 secs.\n301 "
              "DaemonControl::run - sleep 300 secs.\n300 "
              "DaemonControl::run - retry connection after 120 secs.\n120 "
              "DaemonControl::run - sleep 900 secs.\n900 ");
    EXPECT_EQ(web.count("/remote_access_status/"), 4) << "asked anew in each cycle";
}

// Raised between the last look at the flag and the wait.
TEST_F(DaemonControlTest, ARunCleansUpFirstAndTearsDownOnASignalInThePause) {
    givenEnabled(900);
    gateway.table.push_back({9555, kLanIp, 80, "Kavra"});  // by an earlier run, as is the client
    clientRuns();
    inEachPause([&](unsigned, const std::string&) {
        EXPECT_EQ(gateway.calls("unmap ").front(), "unmap TCP 9555") << "before the search";
        EXPECT_EQ(commands.count("kill"), 0) << "only its file is removed";
        forget();
        writeFile("client.pid", "999999\n");  // of a relay client that has ended
        terminate();
    });
    control.run();
    EXPECT_LT(clock.elapsed(), 900);
    EXPECT_EQ(story(NONE), "status disabled, " + withdraw("LAN") +
                               ", unmap 9091 9444, connecting type=disabled = disabled");
    const std::string type = "connectionType:[1]  connectionSubType:[0]\n";
    EXPECT_EQ(log.countPart("COMMUNICATION status:[disabled]  " + type), 1);
    EXPECT_FALSE(std::filesystem::exists(path("client.pid")));
    EXPECT_EQ(process.selfKills, std::vector<int>{SIGTERM});
}

}  // namespace
}  // namespace pelorus
