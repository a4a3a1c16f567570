#include "daemon/startup.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "daemon_fixture.h"

namespace pelorus {
namespace {

namespace fs = std::filesystem;

// Where the daemon writes its log lines, and its state at its exit.
int reportFile = -1;
pid_t startedProcess = 0;

void reportExit() {
    if (getpid() == startedProcess) return;
    const bool closed = dup(0) < 0 && dup(1) < 0 && dup(2) < 0;
    dprintf(reportFile, "exit: umask %o, folder %s, streams %s, %s\n", umask(0),
            fs::current_path().c_str(), closed ? "closed" : "open",
            prctl(PR_GET_DUMPABLE) == 0 ? "no core" : "core");
    for (const auto& call : support::LogCapture::get().setup)
        dprintf(reportFile, "%s\n", call.c_str());
    if (::testing::Test::HasFailure()) dprintf(reportFile, "a check failed\n");
}

class StartupTest : public DaemonTest {
protected:
    StartupTest() {
        support::FakeFiles::get().redirect("/tmp/tavik_cm_pid", path("pid"));
        setenv("TAVIK_STATIC_CONFIG", path("static.ini").c_str(), 1);
        process.killForReal = true;
    }

    // Runs the daemon to its end. Returns how the process that was started and its child ended.
    std::string start(Texts arguments, const std::set<std::string>& failingCalls = {}) {
        prctl(PR_SET_CHILD_SUBREAPER, 1);
        if (fork() == 0) {
            process.failing = failingCalls;
            startedProcess = getpid();
            reportFile = creat(path("report").c_str(), 0600);
            std::atexit(reportExit);
            beforeStart();
            log.onLine([this](const support::LogLine& line) {
                dprintf(reportFile, "<%d>%s", line.priority, line.text.c_str());
                if (line.text.find("main - pelorus daemon") == 0) atStart();
                if (endsCycle(line)) clock.duringPause(1, [] { raise(SIGINT); });
            });
            arguments.insert(arguments.begin(), "pelorus");
            std::vector<char*> argv;
            for (auto& argument : arguments) argv.push_back(argument.data());
            runPelorus(static_cast<int>(argv.size()), argv.data());
        }
        std::string ends;
        for (int status = 0; waitpid(-1, &status, 0) > 0;) {
            ends += WIFSIGNALED(status) ? " signal " + std::to_string(WTERMSIG(status))
                                        : " exit " + std::to_string(WEXITSTATUS(status));
        }
        reported = readFile(path("report"));
        EXPECT_FALSE(holds("a check failed"));
        return ends + (holds("ConnectionManager::createConnection()") ? " after cycles" : "");
    }
    [[nodiscard]] bool holds(const char* part) const { return support::holds(reported, part); }
    void givenSwitch(const std::string& value) const {
        const std::string before = readFile(path("static.ini"));
        writeFile("static.ini", before + "ENABLEREMOTEACCESS=" + value + "\n");
    }

    std::function<void()> beforeStart = [] {};
    std::function<void()> atStart = [] { alarm(30); };  // ends a daemon that hangs
    std::string reported;
};

TEST_F(StartupTest, TheDaemonDetachesItselfAndReadsTheUsualConfiguration) {
    unsetenv("TAVIK_STATIC_CONFIG");
    support::FakeFiles::get().redirect("/var/www/rest-api/config/globalconfig.ini",
                                       path("static.ini"));
    EXPECT_EQ(start({"-u"}), " exit 0 exit 0");
    const std::string pid = readFile(path("pid"));
    const std::string banner =
        "<5>=======================================================================\n"
        "<5>main - pelorus daemon starting up, Version: [1.7.0-54], PID: [" +
        pid + "], SID: [" + pid + "] \n<6>Getting path for dynamic config file.\n";
    EXPECT_EQ(reported.substr(0, banner.size()), banner);
    EXPECT_TRUE(holds("exit: umask 77, folder /, streams closed, no core\n")) << reported;
    EXPECT_FALSE(holds("openlog") || holds("level"));
    EXPECT_EQ(fs::status(path("pid")).permissions(), fs::perms{0600});
}

// A library's message to stderr would end up in a request otherwise.
TEST_F(StartupTest, NoConnectionTakesThePlaceOfAClosedStream) {
    beforeStart = [] {
        for (const int stream : {0, 1, 2}) close(stream);
    };
    atStart = [] {
        for (const char* stream : {"0", "1", "2"}) {
            EXPECT_EQ(fs::canonical(std::string{"/proc/self/fd/"} + stream), "/dev/null");
        }
    };
    EXPECT_EQ(start({"-u"}), " exit 0 exit 0");
}

TEST_F(StartupTest, APlantedPidFileIsNeitherFollowedNorWaitedFor) {
    const std::string target = writeFile("precious", "kept");
    const std::function<void()> plants[]{[&] { fs::create_symlink(target, path("pid")); },
                                         [&] { fs::create_hard_link(target, path("pid")); },
                                         [&] { mkfifo(path("pid").c_str(), 0600); },
                                         [] { support::FakeFiles::get().replants = 50; }};
    for (const auto& plant : plants) {
        plant();
        EXPECT_EQ(start({"-u"}), " exit 0 exit 0");
        EXPECT_EQ(readFile(target), "kept");
        ASSERT_TRUE(fs::is_regular_file(fs::symlink_status(path("pid"))));
        EXPECT_TRUE(holds(("PID: [" + readFile(path("pid")) + "]").c_str())) << reported;
        fs::remove(path("pid"));
    }
}

TEST_F(StartupTest, LogOptionsSetTheLogUnlessTheProgramEndsAtItsArguments) {
    start({"-lc", "0", "-u"});
    EXPECT_EQ(reported.find("<1>main - syslog severity level set to 0.\n"), 0U);
    EXPECT_TRUE(holds("level 1\nopenlog Pelorus 2 128\n")) << reported;
    start({"-u", "-l", "6"});
    EXPECT_TRUE(holds("level 127\nopenlog Pelorus 0 128\n")) << reported;
    EXPECT_EQ(start({"-l", "6", "-v"}) + reported, " exit 0");
    EXPECT_EQ(start({"-l", "6", "-x"}) + reported, " exit 1");
}

TEST_F(StartupTest, AFailedStepEndsTheStart) {
    EXPECT_EQ(start({"-u"}, {"fork"}) + reported, " exit 1");
    for (const char* call : {"setsid", "chdir"}) {
        EXPECT_EQ(start({"-u"}, {call}), " exit 0 exit 1") << call;
        EXPECT_FALSE(holds("main - "));
    }
    setenv("TAVIK_STATIC_CONFIG", path("gone").c_str(), 1);
    EXPECT_EQ(start({"-u"}), " exit 0 exit 1");
    EXPECT_TRUE(holds("<3>main - config file failed to load.\nexit: ")) << reported;
}

TEST_F(StartupTest, CyclesRunOnlyWhenEnabledAndWithoutTheUnmapOption) {
    const std::pair<const char*, Texts> off[]{{"", {}}, {"10", {}}, {"true", {}}, {"1", {"-u"}}};
    for (const auto& [value, arguments] : off) {
        givenSwitch(value);
        EXPECT_EQ(start(arguments), " exit 0 exit 0") << value;
        EXPECT_TRUE(holds("<6>DaemonControl::run - Remote access disabled.\n"));
    }
}

TEST_F(StartupTest, TunablesReachTheirOwners) {
    givenSwitch(
        "1\nMANUAL_PORT_FORWARD=TRUE\nMANUAL_EXTERNAL_HTTP_PORT=9091\nMANUAL_EXTERNAL_HTTPS_PORT=9444");
    EXPECT_EQ(start({"-f", "300", "-d", "55", "-t", "77", "-p", "88"}),
              " exit 0 signal 2 after cycles");
    EXPECT_TRUE(holds("<6>DaemonControl::run - nslookup check interval 55\n"));
    EXPECT_TRUE(holds("<6>DaemonControl::run - UPnP lifetime 77, NAT-PMP lifetime 77\n"));
    EXPECT_TRUE(holds("Interval duration: 88\n"));
    EXPECT_TRUE(holds("<6>DaemonControl::run - sleep 300 secs.\n"));
}

}  // namespace
}  // namespace pelorus
