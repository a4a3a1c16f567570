#include "daemon/startup.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <ostream>

#include "daemon_fixture.h"

namespace pelorus::support {
namespace {

using Arguments = std::vector<std::string>;

constexpr const char* kPidFile = "/tmp/tavik_cm_pid";

/// What became of the two processes.
struct Ended {
    int parentStatus = 0;             ///< exit status of the process that was started
    std::optional<int> daemonStatus;  ///< wait status of its child, if there was one
    std::string report;               ///< the daemon's log lines, and its state at its exit
    std::string out;
    std::string err;
};

// Where the children write what the test wants to know.
int reportFile = -1;
pid_t startedProcess = 0;

void report(const std::string& text) {
    if (write(reportFile, text.data(), text.size()) < 0) std::abort();
}

bool isOpen(int descriptor) {
    return fcntl(descriptor, F_GETFD) >= 0;
}

void reportExit() {
    const LogCapture& log = LogCapture::get();
    if (getpid() == startedProcess) return;
    const mode_t mask = umask(0);
    std::array<char, PATH_MAX> folder{};
    std::array<char, PATH_MAX> line{};
    std::snprintf(line.data(), line.size(), "exit: umask %o, folder %s, streams %d%d%d\n", mask,
                  getcwd(folder.data(), folder.size()), isOpen(0) ? 1 : 0, isOpen(1) ? 1 : 0,
                  isOpen(2) ? 1 : 0);
    report(line.data());
    for (const auto& opened : log.openlogCalls()) {
        report("openlog " + opened.ident + " " + std::to_string(opened.option) + " " +
               std::to_string(opened.facility) + "\n");
    }
    for (const int level : log.setlogmaskCalls()) report("level " + std::to_string(level) + "\n");
    for (const auto& opened : FakeProcess::get().redirected()) {
        const bool safe = (opened.flags & (O_CLOEXEC | O_NOFOLLOW)) == (O_CLOEXEC | O_NOFOLLOW);
        report("opened " + opened.path + (safe ? " safely\n" : " carelessly\n"));
    }
    if (::testing::Test::HasFailure()) report("a check failed\n");
}

class StartupTest : public DaemonTest {
protected:
    StartupTest() {
        process.redirectOpen(kPidFile, path("pid"));
        givenFiles(settings());
    }

    /// The configuration the daemon will find.
    void givenFiles(const Settings& fixed) {
        std::string text = "DYNAMIC_CONFIG=" + folder + "\n";
        for (const auto& [key, value] : fixed) text.append(key + "=" + value + "\n");
        setenv("TAVIK_STATIC_CONFIG", writeFile("static.ini", text).c_str(), 1);
        writeFile("dynamicconfig.ini",
                  std::string{"DEVICEID="} + kDeviceId + "\nDEVICEAUTH=" + kDeviceAuth + "\n");
    }

    /// Runs the daemon to its end, the forks included.
    Ended start(const Arguments& arguments) const {
        prctl(PR_SET_CHILD_SUBREAPER, 1);
        std::fflush(nullptr);
        const pid_t child = fork();
        if (child == 0) runChild(arguments);
        Ended ended;
        int status = 0;
        EXPECT_EQ(waitpid(child, &status, 0), child);
        EXPECT_TRUE(WIFEXITED(status));
        ended.parentStatus = WEXITSTATUS(status);
        if (waitpid(-1, &status, 0) > 0) ended.daemonStatus = status;
        ended.report = readFile(path("report"));
        ended.out = readFile(path("out"));
        ended.err = readFile(path("err"));
        EXPECT_EQ(ended.report.find("a check failed"), std::string::npos) << ended.out;
        return ended;
    }

    /// The signal that ended the daemon, 0 when it exited.
    static int endingSignal(const Ended& ended) {
        if (!ended.daemonStatus || !WIFSIGNALED(*ended.daemonStatus)) return 0;
        return WTERMSIG(*ended.daemonStatus);
    }
    static int exitStatus(const Ended& ended) {
        if (!ended.daemonStatus || !WIFEXITED(*ended.daemonStatus)) return -1;
        return WEXITSTATUS(*ended.daemonStatus);
    }
    static bool holds(const Ended& ended, const std::string& part) {
        return ended.report.find(part) != std::string::npos;
    }

    /// Called by the daemon for each of its lines.
    std::function<void(const LogLine&)> atLine = [](const LogLine&) {};
    /// Called in the started process before anything else.
    std::function<void()> atFork = [] {};

    void inPause(const VirtualClock::Action& action) {
        atLine = [this, action](const LogLine& line) {
            if (line.text.find("DaemonControl::run - sleep ") == 0 ||
                line.text.find("DaemonControl::run - retry ") == 0) {
                clock.duringPause(1, action);
            }
        };
    }

private:
    [[noreturn]] void runChild(const Arguments& arguments) const {
        startedProcess = getpid();
        atFork();
        reportFile = openForWriting("report");
        dup2(openForWriting("out"), STDOUT_FILENO);
        dup2(openForWriting("err"), STDERR_FILENO);
        std::atexit(reportExit);
        log.onLine([this](const LogLine& line) {
            report("<" + std::to_string(line.priority) + ">" + line.text);
            atLine(line);
        });
        std::vector<std::string> texts{"pelorus"};
        texts.insert(texts.end(), arguments.begin(), arguments.end());
        std::vector<char*> argv;
        for (auto& text : texts) argv.push_back(text.data());
        argv.push_back(nullptr);
        runPelorus(static_cast<int>(texts.size()), argv.data());
    }
    [[nodiscard]] int openForWriting(const std::string& name) const {
        return open(path(name).c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_APPEND, 0600);
    }
};

TEST_F(StartupTest, TheDaemonDetachesItself) {
    const Ended ended = start({"-u"});
    EXPECT_EQ(ended.parentStatus, 0);
    EXPECT_EQ(exitStatus(ended), 0);
    const std::string pid = readFile(path("pid"));
    const std::string banner =
        "<5>=======================================================================\n"
        "<5>main - pelorus daemon starting up, Version: [1.7.0-54], PID: [" +
        pid + "], SID: [" + pid + "] \n<6>Getting path for dynamic config file.\n";
    EXPECT_EQ(ended.report.substr(0, banner.size()), banner);
    EXPECT_TRUE(holds(ended, "exit: umask 77, folder /, streams 000\n")) << ended.report;
    EXPECT_TRUE(holds(ended, std::string{"opened "} + kPidFile + " safely\n")) << ended.report;
    EXPECT_FALSE(holds(ended, "openlog"));
    EXPECT_FALSE(holds(ended, "level"));
    struct stat status {};
    ASSERT_EQ(stat(path("pid").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(StartupTest, APlantedPidFileLinkIsNotFollowed) {
    const std::string target = writeFile("precious", "kept");
    ASSERT_EQ(symlink(target.c_str(), path("pid").c_str()), 0);
    EXPECT_EQ(exitStatus(start({"-u"})), 0);
    EXPECT_EQ(readFile(target), "kept");
}

struct LogRow {
    const char* name;
    Arguments arguments;
    const char* calls;  // in the order of the report
    const char* line;
};
void PrintTo(const LogRow& row, std::ostream* out) {
    *out << row.name;
}
class StartupLog : public StartupTest, public ::testing::WithParamInterface<LogRow> {};

TEST_P(StartupLog, IsOpenedOnRequest) {
    const Ended ended = start(GetParam().arguments);
    EXPECT_TRUE(holds(ended, GetParam().calls)) << ended.report;
    EXPECT_EQ(ended.report.find(GetParam().line), 0U) << ended.report;
}

INSTANTIATE_TEST_SUITE_P(Rows,
                         StartupLog,
                         ::testing::Values(LogRow{"WithSeverity",
                                                  {"-u", "-l", "6"},
                                                  "openlog Pelorus 0 128\nlevel 127\n",
                                                  "<1>main - syslog severity level set to 6.\n"},
                                           LogRow{"ToConsole",
                                                  {"-lc", "0", "-u"},
                                                  "openlog Pelorus 2 128\nlevel 1\n",
                                                  "<1>main - syslog severity level set to 0.\n"},
                                           LogRow{"WithoutSeverity",
                                                  {"-u", "-l"},
                                                  "openlog Pelorus 0 128\nlevel 63\n",
                                                  "<1>main - syslog severity level set to 5.\n"}),
                         RowName{});

TEST_F(StartupTest, ArgumentsThatEndItStartNothing) {
    const Ended version = start({"-l", "6", "-v"});
    EXPECT_EQ(version.parentStatus, 0);
    EXPECT_EQ(version.out, "Version: 1.7.0-54\n");
    const Ended unknown = start({"-l", "6", "-x"});
    EXPECT_EQ(unknown.parentStatus, 1);
    EXPECT_EQ(unknown.err.find("Invalid argument: -x, usage: "), 0U);
    for (const Ended* ended : {&version, &unknown}) {
        EXPECT_FALSE(ended->daemonStatus.has_value());
        EXPECT_EQ(ended->report, "");
    }
}

TEST_F(StartupTest, AFailedForkEndsIt) {
    atFork = [this] { process.failFork(); };
    const Ended ended = start({"-u"});
    EXPECT_EQ(ended.parentStatus, 1);
    EXPECT_EQ(ended.report, "");
}

TEST_F(StartupTest, WithoutASessionOrTheRootFolderItEnds) {
    process.failSetsid();
    Ended ended = start({"-u"});
    EXPECT_EQ(ended.parentStatus, 0);
    EXPECT_EQ(exitStatus(ended), 1);
    process.reset();
    process.failChdir();
    ended = start({"-u"});
    EXPECT_EQ(exitStatus(ended), 1);
    EXPECT_FALSE(holds(ended, "main - "));
}

TEST_F(StartupTest, AMissingConfigurationEndsIt) {
    setenv("TAVIK_STATIC_CONFIG", path("gone").c_str(), 1);
    const Ended ended = start({});
    EXPECT_EQ(ended.parentStatus, 0);
    EXPECT_EQ(exitStatus(ended), 1);
    EXPECT_TRUE(holds(
        ended, "<3>main - config file failed to load.\nexit: umask 77, folder /, streams 000\n"))
        << ended.report;
    EXPECT_FALSE(holds(ended, "DaemonControl"));
}

TEST_F(StartupTest, TheConfigurationHasAFixedPlaceUnlessToldOtherwise) {
    files.redirect("/var/www/rest-api/config/globalconfig.ini", path("static.ini"));
    unsetenv("TAVIK_STATIC_CONFIG");
    EXPECT_EQ(exitStatus(start({"-u"})), 0);
}

struct SwitchRow {
    const char* name;
    const char* setting;
    Arguments arguments;
    bool enabled;
};
void PrintTo(const SwitchRow& row, std::ostream* out) {
    *out << row.name;
}
class StartupSwitch : public StartupTest, public ::testing::WithParamInterface<SwitchRow> {};

TEST_P(StartupSwitch, DecidesWhetherCyclesRun) {
    Settings all = settings();
    all["ENABLEREMOTEACCESS"] = GetParam().setting;
    givenFiles(all);
    process.killForReal();
    inPause([this] { clock.raiseSignal(SIGQUIT); });
    const Ended ended = start(GetParam().arguments);
    EXPECT_EQ(endingSignal(ended), GetParam().enabled ? SIGQUIT : 0) << ended.report;
    EXPECT_EQ(holds(ended, "DaemonControl::enableRemoteAcces "), GetParam().enabled);
    EXPECT_EQ(holds(ended, "ConnectionManager::createConnection()"), GetParam().enabled);
    EXPECT_TRUE(holds(ended, "<6>DaemonControl::run - Remote access disabled.\n"));
}

INSTANTIATE_TEST_SUITE_P(Rows,
                         StartupSwitch,
                         ::testing::Values(SwitchRow{"Enabled", "1", {}, true},
                                           SwitchRow{"EnabledButUnmap", "1", {"-u"}, false},
                                           SwitchRow{"OnlyOneEnables", "true", {}, false},
                                           SwitchRow{"OneAndMore", "10", {}, false},
                                           SwitchRow{"Unset", "", {}, false}),
                         RowName{});

TEST_F(StartupTest, TunablesReachTheirOwners) {
    process.killForReal();
    inPause([this] { clock.raiseSignal(SIGINT); });
    const Ended ended = start({"-f", "300", "-d", "55", "-t", "77"});
    EXPECT_EQ(endingSignal(ended), SIGINT);
    EXPECT_TRUE(holds(ended, "<6>DaemonControl::run - nslookup check interval 55\n"));
    EXPECT_TRUE(holds(ended, "<6>DaemonControl::run - UPnP lifetime 77, NAT-PMP lifetime 77\n"));
    EXPECT_TRUE(holds(ended, "<6>DaemonControl::run - sleep 300 secs.\n"));
}

// Enabling comes after it and must not undo it.
TEST_F(StartupTest, ASignalDuringTheStartIsKept) {
    process.killForReal();
    atLine = [](const LogLine& line) {
        if (line.text.find("main - pelorus daemon starting up") == 0) raise(SIGTERM);
    };
    const Ended ended = start({});
    EXPECT_EQ(endingSignal(ended), SIGTERM);
    EXPECT_FALSE(holds(ended, "ConnectionManager::createConnection()")) << ended.report;
    EXPECT_TRUE(holds(ended, "<6>DaemonControl::run - Remote access disabled.\n"));
}

}  // namespace
}  // namespace pelorus::support
