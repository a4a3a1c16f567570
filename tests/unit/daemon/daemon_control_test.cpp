#include "daemon/daemon_control.h"

#include <unistd.h>

#include <ostream>

#include "common/log.h"
#include "daemon/signals.h"
#include "daemon_fixture.h"

namespace pelorus::support {
namespace {

using Words = std::vector<std::string>;

class DaemonControlTest : public DaemonTest {
protected:
    void givenEnabled(const Settings& changes = {}) {
        Settings all = settings();
        for (const auto& [key, value] : changes) all[key] = value;
        givenConfig(all);
        ASSERT_TRUE(installSignalHandlers());
        control.enableRemoteAccess();
        control.setSleepTime(30);
        log.clear();
    }
    [[nodiscard]] bool exists(const std::string& name) const {
        return access(path(name).c_str(), F_OK) == 0;
    }
    // Lines of the main loop itself and of the handler, and the events.
    [[nodiscard]] Words ownLines() const {
        Words own;
        for (const auto& text : log.texts()) {
            for (const char* start : {"DaemonControl::", "sigTrap", "cloudConnectivity"}) {
                if (text.find(start) == 0) own.push_back(text);
            }
        }
        return own;
    }
};

// --- start ---------------------------------------------------------------------------------

TEST_F(DaemonControlTest, ADisabledStartOnlyTearsDown) {
    Settings all = settings();
    all["COMMUNICATION_STATUS"] = "disabled";
    givenConfig(all);
    gateway.add({9091, kDeviceAddress, 80, "Kavra"});
    control.disableRemoteAccess();
    log.clear();
    control.run();
    EXPECT_EQ(ownLines(),
              (Words{"DaemonControl::run - Update local comm mode.\n",
                     "DaemonControl::run - nslookup check interval 86400\n",
                     "DaemonControl::run - UPnP lifetime 4294967295, NAT-PMP lifetime 4294967295\n",
                     "cloudConnectivity state=connecting type=disabled",
                     "DaemonControl::run - Remote access disabled.\n"}));
    EXPECT_EQ(statusWords(), (Words{"connecting", "disabled"}));
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_EQ(web.count("/test?"), 0);
    EXPECT_TRUE(process.selfKills().empty());
}

struct StatusRow {
    const char* name;
    const char* status;
    Words told;
};
void PrintTo(const StatusRow& row, std::ostream* out) {
    *out << row.name;
}
class StartStatus : public DaemonControlTest, public ::testing::WithParamInterface<StatusRow> {};

TEST_P(StartStatus, IsToldWhenThereIsNoneYet) {
    Settings all = settings();
    all["COMMUNICATION_STATUS"] = GetParam().status;
    givenConfig(all);
    control.disableRemoteAccess();
    control.run();
    EXPECT_EQ(statusWords(), GetParam().told);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    StartStatus,
    ::testing::Values(StatusRow{"Missing", "", {"connecting", "disabled"}},
                      StatusRow{"Disabled", "disabled", {"connecting", "disabled"}},
                      StatusRow{"Failed", "failed", {"disabled"}},
                      StatusRow{"Portforwarded", "portforwarded", {"disabled"}}),
    RowName{});

TEST_F(DaemonControlTest, AnEnabledStartRemovesWhatAnEarlierRunLeft) {
    givenEnabled();
    gateway.add({9555, kDeviceAddress, 80, "Kavra"});
    writeFile("client.pid", "999999\n");
    bool looked = false;
    log.onLine([&](const LogLine& line) {
        if (line.text.find("DaemonControl::run - nslookup check interval") != 0) return;
        looked = true;
        EXPECT_TRUE(gateway.mappings().empty());
        EXPECT_FALSE(exists("client.pid"));
        raise(SIGTERM);
    });
    control.run();
    EXPECT_TRUE(looked);
    expectLogged(LOG_NOTICE, "DaemonControl::run - Kill direct connection comm mode.\n");
}

// --- cycles --------------------------------------------------------------------------------

struct PauseRow {
    const char* name;
    int ownPeriod;
    int serverWait;
    const char* line;
    long pause;
};
void PrintTo(const PauseRow& row, std::ostream* out) {
    *out << row.name;
}
class Pause : public DaemonControlTest, public ::testing::WithParamInterface<PauseRow> {};

TEST_P(Pause, IsTheLongerOfTheTwoPeriods) {
    givenEnabled();
    control.setSleepTime(GetParam().ownPeriod);
    web.answer("/remote_access_status/", "<action>wait</action><wait_time>" +
                                             std::to_string(GetParam().serverWait) +
                                             "</wait_time>");
    std::vector<long> pauses;
    inPauseOfCycle(1, [&] { pauses.push_back(clock.pauses().back()); });
    // The server is asked anew in the second cycle.
    const time_t end = clock.now() + GetParam().pause + 100;
    clock.at(end, [this] { clock.raiseSignal(SIGTERM); });
    control.run();
    EXPECT_EQ(pauses, std::vector<long>{GetParam().pause});
    EXPECT_EQ(log.count(LOG_INFO, GetParam().line), 2) << log.dump();
    EXPECT_EQ(web.count("/remote_access_status/"), 2);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    Pause,
    ::testing::Values(
        PauseRow{"ServersLeast", 30, 0, "DaemonControl::run - retry connection after 120 secs.\n",
                 120},
        PauseRow{"ServersWait", 300, 301, "DaemonControl::run - retry connection after 301 secs.\n",
                 301},
        PauseRow{"Own", 300, 200, "DaemonControl::run - sleep 300 secs.\n", 300},
        PauseRow{"OwnWhenBothAreEqual", 300, 300, "DaemonControl::run - sleep 300 secs.\n", 300},
        PauseRow{"OwnIsAtMost900", 1000, 0, "DaemonControl::run - sleep 900 secs.\n", 900},
        PauseRow{"OwnIsAtLeast30", -1, 0, "DaemonControl::run - retry connection after 120 secs.\n",
                 120}),
    RowName{});

TEST_F(DaemonControlTest, WithoutCredentialsItIdles) {
    givenEnabled({{"DEVICEID", ""}, {"DEVICEAUTH", ""}});
    inPauseOfCycle(3, [this] { clock.raiseSignal(SIGTERM); });
    control.run();
    EXPECT_EQ(log.countPart("DaemonControl::run - retry connection after 120 secs.\n"), 3);
    EXPECT_EQ(gateway.count("map "), 0);
    EXPECT_TRUE(web.urls(FakeWeb::Side::CENTRAL).empty());
}

// --- end -----------------------------------------------------------------------------------

TEST_F(DaemonControlTest, ASignalInThePauseEndsItAndTearsDown) {
    givenEnabled();
    inPauseOfCycle(2, [this] {
        EXPECT_EQ(gateway.mappings().size(), 2U);
        log.clear();
        web.clear();
        writeFile("client.pid", "999999\n");  // of a relay client that has ended
        clock.raiseSignal(SIGTERM);
    });
    control.run();
    EXPECT_EQ(ownLines(),
              (Words{"sigTrap - Received SIGTERM signal.\n",
                     "DaemonControl::disableRemoteAccess - remote access is disabled.\n",
                     "sigTrap - sigConnKilled is set to incoming signal.\n",
                     "cloudConnectivity state=connecting type=disabled",
                     "DaemonControl::run - Remote access disabled.\n"}));
    expectLogged(
        LOG_INFO,
        "TavikClient::sendAnalytics - COMMUNICATION status:[disabled]  connectionType:[1]  connectionSubType:[0]\n");
    EXPECT_EQ(statusWords(), Words{"disabled"});
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_FALSE(exists("client.pid"));
    EXPECT_EQ(process.selfKills(), std::vector<int>{SIGTERM});
}

struct MomentRow {
    const char* name;
    // Arranges for the signal.
    void (*arrange)(LogCapture& log, VirtualClock& clock, FakeGateway& gateway);
};
void PrintTo(const MomentRow& row, std::ostream* out) {
    *out << row.name;
}
class SignalBeforeThePause : public DaemonControlTest,
                             public ::testing::WithParamInterface<MomentRow> {};

// What comes before the wait must not be slept over.
TEST_P(SignalBeforeThePause, KeepsItFromWaiting) {
    givenEnabled();
    control.setSleepTime(900);
    GetParam().arrange(log, clock, gateway);
    control.run();
    EXPECT_EQ(log.countPart("DaemonControl::run - sleep 900 secs.\n"), 1) << "one cycle";
    EXPECT_LT(clock.elapsed(), 900);
    EXPECT_EQ(process.selfKills(), std::vector<int>{SIGTERM});
    EXPECT_TRUE(gateway.mappings().empty());
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    SignalBeforeThePause,
    ::testing::Values(MomentRow{"WhileTheCycleWorks",
                                [](LogCapture&, VirtualClock&, FakeGateway& gateway) {
                                    gateway.onCall([](const std::string& call) {
                                        if (call.find("map TCP 9091") == 0) raise(SIGTERM);
                                    });
                                }},
                      MomentRow{"InTheLastLineOfTheCycle",
                                [](LogCapture& log, VirtualClock&, FakeGateway&) {
                                    log.onLine([](const LogLine& line) {
                                        if (line.text.find("DaemonControl::run - sleep") == 0)
                                            raise(SIGTERM);
                                    });
                                }},
                      MomentRow{"AsTheWaitBegins",
                                [](LogCapture& log, VirtualClock& clock, FakeGateway&) {
                                    log.onLine([&clock](const LogLine& line) {
                                        if (line.text.find("DaemonControl::run - sleep") != 0)
                                            return;
                                        clock.beforePause(1, [] { raise(SIGTERM); });
                                    });
                                }}),
    RowName{});

extern "C" void logOnSignal(int /*signal*/) {
    logLine(LOG_INFO, "handler\n");
}

// The capture fails the test when the handler's line comes within another one.
TEST_F(DaemonControlTest, NoLineOfAWholeRunLetsASignalIn) {
    givenEnabled();
    gateway.refuseAllPorts();
    for (const int signal : {SIGINT, SIGQUIT}) std::signal(signal, logOnSignal);
    int handled = 0;
    int end = 0;
    log.onLine([&](const LogLine& line) {
        if (line.text == "handler\n") {
            ++handled;
            return;
        }
        if (line.text.find("DaemonControl::run - retry") == 0 && ++end == 2) raise(SIGTERM);
        if (!terminationRequested()) raise(handled % 2 == 0 ? SIGINT : SIGQUIT);
    });
    control.run();
    EXPECT_GT(handled, 50);
}

// The relay's client runs for weeks: it must not keep anything of the daemon open.
TEST_F(DaemonControlTest, ChildrenInheritNoDescriptor) {
    const std::string list = "ls /proc/self/fd";
    givenEnabled({{"STARTCMD", list + " > " + path("inherited")}});
    gateway.refuseAllPorts();
    commands.runForReal(list);
    ASSERT_EQ(std::system((list + " > " + path("before")).c_str()), 0);
    inPauseOfCycle(1, [this] { clock.raiseSignal(SIGTERM); });
    control.run();
    EXPECT_FALSE(readFile(path("inherited")).empty());
    EXPECT_EQ(readFile(path("inherited")), readFile(path("before")));
}

}  // namespace
}  // namespace pelorus::support
