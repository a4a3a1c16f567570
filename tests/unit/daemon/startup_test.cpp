#include "daemon/startup.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <functional>

#include "daemon_fixture.h"

namespace pelorus {
namespace {

using support::LogLine;

// Where the daemon writes its log lines, and its state at its exit.
int reportFile = -1;
pid_t startedProcess = 0;

void report(const std::string& text) {
    if (write(reportFile, text.data(), text.size()) < 0) std::abort();
}

void reportExit() {
    if (getpid() == startedProcess) return;
    report("exit: umask " + std::to_string(umask(0)) + ", folder " +
           std::filesystem::current_path().string() +
           (dup(0) < 0 && dup(1) < 0 && dup(2) < 0 ? ", streams closed\n" : ", streams open\n"));
    for (const auto& call : support::LogCapture::get().setup) report(call + "\n");
    if (::testing::Test::HasFailure()) report("a check failed\n");
}

class StartupTest : public DaemonTest {
protected:
    StartupTest() {
        files.redirect("/tmp/tavik_cm_pid", path("pid"));
        setenv("TAVIK_STATIC_CONFIG", path("static.ini").c_str(), 1);
        process.killForReal = true;
        atLine = [this](const LogLine& line) {
            if (endsCycle(line)) clock.duringPause(1, [] { raise(SIGINT); });
        };
    }

    // Runs the daemon to its end, the forks included.
    void start(const Texts& arguments) {
        prctl(PR_SET_CHILD_SUBREAPER, 1);
        const pid_t child = fork();
        if (child == 0) runChild(arguments);
        EXPECT_EQ(waitpid(child, &parentStatus, 0), child);
        daemonStatus = kNone;
        waitpid(-1, &daemonStatus, 0);
        reported = readFile(path("report"));
        EXPECT_FALSE(holds("a check failed")) << readFile(path("out"));
    }
    [[nodiscard]] bool holds(const std::string& part) const {
        return reported.find(part) != std::string::npos;
    }
    void givenSwitch(const std::string& value) const {
        const std::string file = path("static.ini");
        writeFile("static.ini", readFile(file) + "ENABLEREMOTEACCESS=" + value + "\n");
    }

    std::function<void(const LogLine&)> atLine;  // called by the daemon for each of its lines
    std::set<std::string> failing;               // see FakeProcess
    int parentStatus = 0;                        // wait status of the process that was started
    int daemonStatus = 0;                        // wait status of its child, if there was one
    static constexpr int kNone = -1;
    std::string reported;

private:
    [[noreturn]] void runChild(Texts arguments) {
        process.failing = failing;
        startedProcess = getpid();
        constexpr int kFlags = O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC;
        reportFile = open(path("report").c_str(), kFlags, 0600);
        const int out = open(path("out").c_str(), kFlags, 0600);
        dup2(out, STDOUT_FILENO);
        dup2(out, STDERR_FILENO);
        std::atexit(reportExit);
        log.onLine([this](const LogLine& line) {
            report("<" + std::to_string(line.priority) + ">" + line.text);
            atLine(line);
        });
        arguments.insert(arguments.begin(), "pelorus");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        runPelorus(static_cast<int>(argv.size()), argv.data());
    }
};

TEST_F(StartupTest, TheDaemonDetachesItselfAndReadsTheUsualConfiguration) {
    unsetenv("TAVIK_STATIC_CONFIG");
    files.redirect("/var/www/rest-api/config/globalconfig.ini", path("static.ini"));
    start({"-u"});
    EXPECT_EQ(parentStatus, 0);
    EXPECT_EQ(daemonStatus, 0);
    const std::string pid = readFile(path("pid"));
    const std::string banner =
        "<5>=======================================================================\n"
        "<5>main - pelorus daemon starting up, Version: [1.7.0-54], PID: [" +
        pid + "], SID: [" + pid + "] \n<6>Getting path for dynamic config file.\n";
    EXPECT_EQ(reported.substr(0, banner.size()), banner);
    EXPECT_TRUE(holds("exit: umask 63, folder /, streams closed\n")) << reported;
    EXPECT_FALSE(holds("openlog") || holds("level"));
    EXPECT_EQ(std::filesystem::status(path("pid")).permissions(), std::filesystem::perms{0600});
}

TEST_F(StartupTest, APlantedPidFileIsNeitherFollowedNorWaitedFor) {
    const std::string target = writeFile("precious", "kept");
    std::filesystem::create_symlink(target, path("pid"));
    start({"-u"});
    EXPECT_EQ(daemonStatus, 0);
    EXPECT_EQ(readFile(target), "kept");

    std::filesystem::remove(path("pid"));
    ASSERT_EQ(mkfifo(path("pid").c_str(), 0600), 0);
    atLine = [](const LogLine&) { alarm(5); };
    start({"-u"});
    EXPECT_EQ(daemonStatus, 0);
}

TEST_F(StartupTest, TheLogIsOpenedOnRequestAndNotWhenTheArgumentsEndIt) {
    start({"-lc", "0", "-u"});
    EXPECT_EQ(reported.find("<1>main - syslog severity level set to 0.\n"), 0U);
    EXPECT_TRUE(holds("level 1\nopenlog Pelorus 2 128\n")) << reported;
    start({"-u", "-l", "6"});
    EXPECT_TRUE(holds("level 127\nopenlog Pelorus 0 128\n")) << reported;
    for (const auto& [argument, status] : {std::pair{"-v", 0}, std::pair{"-x", 1}}) {
        start({"-l", "6", argument});
        EXPECT_EQ(parentStatus, W_EXITCODE(status, 0));
        EXPECT_EQ(daemonStatus, kNone);
        EXPECT_EQ(reported, "");
    }
}

TEST_F(StartupTest, AFailureOnTheWayEndsIt) {
    failing = {"fork"};
    start({"-u"});
    EXPECT_EQ(parentStatus, W_EXITCODE(1, 0));
    EXPECT_EQ(daemonStatus, kNone);
    for (const char* call : {"setsid", "chdir"}) {
        failing = {call};
        start({"-u"});
        EXPECT_EQ(parentStatus, 0);
        EXPECT_EQ(daemonStatus, W_EXITCODE(1, 0)) << call;
        EXPECT_FALSE(holds("main - "));
    }
    failing.clear();
    setenv("TAVIK_STATIC_CONFIG", path("gone").c_str(), 1);
    start({"-u"});
    EXPECT_EQ(daemonStatus, W_EXITCODE(1, 0));
    EXPECT_TRUE(holds("<3>main - config file failed to load.\nexit: ")) << reported;
}

TEST_F(StartupTest, OnlyOneAndNoUnmapMakesCyclesRun) {
    const std::vector<std::pair<std::string, Texts>> off{
        {"", {}}, {"10", {}}, {"true", {}}, {"1", {"-u"}}};
    for (const auto& [value, arguments] : off) {
        givenSwitch(value);
        start(arguments);
        EXPECT_EQ(daemonStatus, 0) << value;
        EXPECT_FALSE(holds("ConnectionManager::createConnection()")) << value;
        EXPECT_TRUE(holds("<6>DaemonControl::run - Remote access disabled.\n"));
    }
}

TEST_F(StartupTest, TunablesReachTheirOwners) {
    givenSwitch(
        "1\nMANUAL_PORT_FORWARD=TRUE\nMANUAL_EXTERNAL_HTTP_PORT=9091\nMANUAL_EXTERNAL_HTTPS_PORT=9444");
    start({"-f", "300", "-d", "55", "-t", "77", "-p", "88"});
    EXPECT_EQ(daemonStatus, SIGINT);
    EXPECT_TRUE(holds("<6>DaemonControl::run - nslookup check interval 55\n"));
    EXPECT_TRUE(holds("<6>DaemonControl::run - UPnP lifetime 77, NAT-PMP lifetime 77\n"));
    EXPECT_TRUE(holds("Interval duration: 88\n"));
    EXPECT_TRUE(holds("<6>DaemonControl::run - sleep 300 secs.\n"));
}

// Enabling comes after it and must not undo it.
TEST_F(StartupTest, ASignalDuringTheStartIsKept) {
    givenSwitch("1");
    atLine = [](const LogLine& line) {
        if (line.text.find("main - pelorus daemon starting up") == 0) raise(SIGTERM);
    };
    start({});
    EXPECT_EQ(daemonStatus, SIGTERM);
    EXPECT_FALSE(holds("ConnectionManager::createConnection()")) << reported;
    EXPECT_TRUE(holds("<6>DaemonControl::run - Remote access disabled.\n"));
}

}  // namespace
}  // namespace pelorus
