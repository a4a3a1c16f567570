#include "daemon/daemon_control.h"

#include <filesystem>

#include "common/log.h"
#include "common/stop_budget.h"
#include "common/termination.h"
#include "daemon/signals.h"
#include "daemon_fixture.h"

namespace pelorus {
namespace {

using std::filesystem::exists;
using support::LogLine;

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
    const std::string again =
        "status connecting, connecting/disabled, status disabled, unmap 9091, record NULL&LAN&0&0, withdraw 8080 = disabled";
    const std::vector<std::pair<const char*, std::string>> rows{
        {"failed",
         "connecting/disabled, status disabled, lanip, unmap 9091, record NULL&LAN&0&0, withdraw 8080 = disabled"},
        {"", again},
        {"disabled", again}};
    for (const auto& [status, wanted] : rows) {
        forget();
        setConfig("COMMUNICATION_STATUS", status);
        gateway.add({9091, kLanIp, 80, "Kavra"});
        control.disableRemoteAccess();
        control.run();
        EXPECT_EQ(story(NONE), wanted);
    }
    EXPECT_TRUE(process.selfKills.empty());
}

TEST_F(DaemonControlTest, AnEnabledStartRemovesWhatAnEarlierRunLeft) {
    givenEnabled();
    gateway.add({9555, kLanIp, 80, "Kavra"});
    writeFile("client.pid", "999999\n");
    log.onLine([&](const LogLine& line) {
        if (line.text.find("DaemonControl::run - nslookup check interval") != 0) return;
        EXPECT_TRUE(gateway.mappings().empty());
        EXPECT_FALSE(exists(path("client.pid")));
        terminate();
    });
    control.run();
    EXPECT_EQ(process.selfKills.size(), 1U);
}

struct PauseRow {
    const char* name;
    int ownPeriod;
    int serverWait;
    long pause;
    const char* line = "retry connection after";
};
class Pause : public DaemonControlTest, public ::testing::WithParamInterface<PauseRow> {};

TEST_P(Pause, IsTheLongerOfTheTwoPeriods) {
    givenEnabled(GetParam().ownPeriod);
    const std::string wait = std::to_string(GetParam().serverWait);
    web.answer("/remote_access_status/",
               "<action>wait</action><wait_time>" + wait + "</wait_time>");
    inPauseOfCycle(2, [this] {
        EXPECT_EQ(clock.pauses().back(), GetParam().pause);
        terminate();
    });
    control.run();
    EXPECT_EQ(log.count(LOG_INFO, std::string{"DaemonControl::run - "} + GetParam().line + " " +
                                      std::to_string(GetParam().pause) + " secs.\n"),
              2);
    EXPECT_EQ(web.count("/remote_access_status/"), 2) << "asked anew in each cycle";
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rows, Pause, ::testing::Values(
    PauseRow{"ServersWait", 300, 301, 301},
    PauseRow{"OwnWhenBothAreEqual", 300, 300, 300, "sleep"},
    PauseRow{"OwnIsAtMost900", 1000, 0, 900, "sleep"},
    PauseRow{"OwnIsAtLeast30", -1, 0, 120}), RowName{});
// clang-format on

// Raised between the last look at the flag and the wait.
TEST_F(DaemonControlTest, ASignalInThePauseEndsItAndTearsDown) {
    givenEnabled(900);
    time_t before = 0;
    inPauseOfCycle(2, [&] {
        EXPECT_EQ(gateway.mappings().size(), 2U);
        forget();
        before = clock.now();
        writeFile("client.pid", "999999\n");  // of a relay client that has ended
        terminate();
    });
    control.run();
    EXPECT_LT(clock.now() - before, 900);
    support::expectLoggedInOrder(
        {"sigTrap - sigConnKilled is set to incoming signal.\n",
         "TavikClient::sendAnalytics - COMMUNICATION status:[disabled]  connectionType:[1]  connectionSubType:[0]\n",
         "DaemonControl::run - Remote access disabled.\n"});
    EXPECT_EQ(
        story(NONE),
        "status disabled, record NULL&LAN&0&0, withdraw 8080, unmap 9091, unmap 9444, connecting/disabled = disabled");
    EXPECT_FALSE(exists(path("client.pid")));
    EXPECT_EQ(process.selfKills, std::vector<int>{SIGTERM});
}

TEST_F(DaemonControlTest, ASignalWhileTheCycleWorksIsNotSleptOver) {
    givenEnabled(900);
    gateway.onCall([](const std::string& call) {
        if (call.find("map TCP 9091") == 0) terminate();
        if (call.find("map TCP 9444") == 0) renewStopBudget(0);  // the clean-up has its own
    });
    control.run();
    EXPECT_LT(clock.elapsed(), 900);
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_EQ(process.selfKills, std::vector<int>{SIGTERM});
}

// The capture fails the test when the handler's line comes within another one.
TEST_F(DaemonControlTest, NoLineOfAWholeRunLetsASignalIn) {
    givenEnabled();
    gateway.refuseAllPorts();
    for (const int signal : {SIGINT, SIGQUIT}) {
        std::signal(signal, [](int) { logLine(LOG_INFO, "handler\n"); });
    }
    int handled = 0;
    int cycles = 0;
    log.onLine([&](const LogLine& line) {
        if (line.text == "handler\n") {
            ++handled;
        } else if (endsCycle(line) && ++cycles == 2) {
            terminate();
        } else if (!terminationRequested()) {
            raise(handled % 2 == 0 ? SIGINT : SIGQUIT);
        }
    });
    control.run();
    EXPECT_GT(handled, 50);
}

}  // namespace
}  // namespace pelorus
