#include "relay/vpn_manager.h"

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <memory>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

// A process whose executable has the given name; gone with the object.
class Process {
public:
    explicit Process(const std::string& executable) {
        std::filesystem::copy_file("/bin/sleep", executable);
        pid = fork();
        if (pid == 0) {
            execl(executable.c_str(), executable.c_str(), "600", nullptr);
            _exit(127);
        }
        // Until the exec, /proc still shows the test's own executable.
        const std::string link = "/proc/" + pidText() + "/exe";
        while (waitpid(pid, nullptr, WNOHANG) == 0 &&
               std::filesystem::read_symlink(link) != executable) {
        }
    }
    ~Process() {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    [[nodiscard]] std::string pidText() const { return std::to_string(pid); }

private:
    pid_t pid = -1;
};

class VpnManagerTest : public PelorusTest {
protected:
    VpnManagerTest() {
        givenConfig({{"OPENVPN_CONFIG_PATH", folder},
                     {"OPENVPN_AUTH_FILE", path("auth.txt")},
                     {"UPDATE_CONF_WITH_SERVER_CMD", "fetch-relays"},
                     {"STARTCMD", "start-client"},
                     {"STARTCMD_OUTFILE", path("client.out")},
                     {"LOG_SUCCESS_TEXT", "Initialization Sequence Completed"},
                     {"OPENVPN_PID_FILE", path("client.pid")}});
    }

    Process& startClient(const std::string& name = "openvpn") {
        client = std::make_unique<Process>(path(name));
        writeFile("client.pid", client->pidText() + "\n");
        return *client;
    }
    bool pidFileExists() const { return access(path("client.pid").c_str(), F_OK) == 0; }

    // The tunnel comes up at the given check.
    void comesUpAtPause(int pause) {
        writeFile("client.out", "connecting\n");
        clock.duringPause(pause, [this] {
            writeFile("client.out", "connecting\nNov 21 Initialization Sequence Completed\n");
        });
    }

    VPNManager& manager = *VPNManager::getInstance();
    std::unique_ptr<Process> client;
};

TEST_F(VpnManagerTest, StartsTheClientWithFreshCredentials) {
    writeFile("auth.txt", "an older and longer content\nof three\nlines\n");
    comesUpAtPause(3);
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_EQ(readFile(path("auth.txt")), std::string{kDeviceId} + "\n" + kDeviceAuth + "\n");
    EXPECT_EQ(commands.lines(), (std::vector<std::string>{"fetch-relays", "start-client"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{10, 10, 10}));
    expectLogIs({
        {LOG_INFO, "VPNManager::openVPNConnection() - checking if openVPN is running...\n"},
        {LOG_INFO, "VPNManager::openVPNConnection() - creating auth.txt \n"},
        {LOG_NOTICE,
         "VPNManager::openVPNConnection() - httpGet openvpn client relay servers and other settings.\n"},
        {LOG_INFO,
         "VPNManager::openVPNConnection() - openVPN initialization did not complete, waiting...\n"},
        {LOG_INFO,
         "VPNManager::openVPNConnection() - openVPN initialization did not complete, waiting...\n"},
        {LOG_INFO, "VPNManager::openVPNConnection() - openVPN has started successfully\n"},
    });
}

TEST_F(VpnManagerTest, WorksInTheConfiguredFolderAndComesBack) {
    const auto before = std::filesystem::current_path();
    std::filesystem::path within;
    comesUpAtPause(1);
    FakeCommands::Answer start;
    start.action = [&](const std::string&) { within = std::filesystem::current_path(); };
    commands.answer("start-client", start);
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_EQ(within, folder);
    EXPECT_EQ(std::filesystem::current_path(), before);
}

TEST_F(VpnManagerTest, GivesUpAfterFourStartsOfSevenChecks) {
    writeFile("client.out", "AUTH_FAILED\n");
    EXPECT_FALSE(manager.openVPNConnection());
    EXPECT_EQ(commands.count("fetch-relays"), 1);
    EXPECT_EQ(commands.count("start-client"), 4);
    EXPECT_EQ(clock.pauses(), std::vector<long>(28, 10));
    // Between the starts it tries to stop what it started.
    EXPECT_EQ(
        log.count(
            LOG_ERR,
            "VPNManager::closeVPNConnection() - openVPN process is not running, so return true.\n"),
        4);
    expectLogged(
        LOG_ERR,
        "VPNManager::openVPNConnection() - Failed to establish VPN connection, retries exceeded\n");
}

TEST_F(VpnManagerTest, RunningClientIsLeftAlone) {
    startClient();
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_TRUE(commands.lines().empty());
    EXPECT_EQ(access(path("auth.txt").c_str(), F_OK), -1);
    expectLogged(LOG_INFO, "VPNManager::openVPNConnection() - openVPN is already running\n");
}

struct StartFailure {
    const char* name;
    const char* key;
    const char* value;
    const char* message;
    std::vector<std::string> commandsRun;
};

class VpnStartFailure : public VpnManagerTest, public testing::WithParamInterface<StartFailure> {};

TEST_P(VpnStartFailure, EndsTheStartAtOnce) {
    setConfig(GetParam().key, GetParam().value);
    EXPECT_FALSE(manager.openVPNConnection());
    expectLogged(LOG_ERR, GetParam().message);
    EXPECT_EQ(commands.lines(), GetParam().commandsRun);
}

INSTANTIATE_TEST_SUITE_P(
    Failures,
    VpnStartFailure,
    testing::Values(
        StartFailure{
            "NoDeviceId",
            "DEVICEID",
            "",
            "VPNManager::openVPNConnection() - failed to get DEVICEID and/or DEVICEAUTH settings from config file!\n",
            {}},
        StartFailure{
            "NoDeviceAuth",
            "DEVICEAUTH",
            "",
            "VPNManager::openVPNConnection() - failed to get DEVICEID and/or DEVICEAUTH settings from config file!\n",
            {}},
        StartFailure{"CredentialsFileCannotBeWritten",
                     "OPENVPN_AUTH_FILE",
                     "/nowhere/auth.txt",
                     "VPNManager::openVPNConnection() - failed to open VPN Auth file for write!\n",
                     {}},
        StartFailure{"OutputFileIsMissing",
                     "STARTCMD_OUTFILE",
                     "/nowhere/client.out",
                     "VPNManager::openVPNConnection() - failed to open openVPN stdout file!\n",
                     {"fetch-relays", "start-client"}}),
    [](const auto& row) { return row.param.name; });

TEST_F(VpnManagerTest, RecognisesTheClientWhateverTheCaseOfItsName) {
    startClient("My-OpenVPN-2.6");
    EXPECT_TRUE(manager.isVPNRunning());
    EXPECT_TRUE(pidFileExists());
}

struct StalePidFile {
    const char* name;
    const char* content;
    const char* warning;
};

class VpnStalePidFile : public VpnManagerTest, public testing::WithParamInterface<StalePidFile> {};

TEST_P(VpnStalePidFile, IsRemovedAndMeansNotRunning) {
    writeFile("client.pid", GetParam().content);
    EXPECT_FALSE(manager.isVPNRunning());
    EXPECT_FALSE(pidFileExists());
    EXPECT_EQ(log.countPart(GetParam().warning), 1) << log.dump();
    expectLogged(LOG_WARNING, "VPNManager::isVPNRunning() - unlink stale openVPN pid file " +
                                  path("client.pid") + "\n");
}

INSTANTIATE_TEST_SUITE_P(
    Contents,
    VpnStalePidFile,
    testing::Values(
        StalePidFile{"Empty", "", "is empty"},
        StalePidFile{"OfThisVeryProcess", "self\n", "does not match /proc/self/exe symlink"},
        StalePidFile{"OfNoProcess", "999999999\n", "stat /proc/999999999/exe failed, errno 2"},
        StalePidFile{"Rubbish", "%s%n\x01\x02/../..\n", "failed, errno 2"},
        StalePidFile{"TheCredentials", "device-7350142\nauth-91c2f0aa\n",
                     "stat /proc/*ID_REMOVED*/exe failed"}),
    [](const auto& row) { return row.param.name; });

TEST_F(VpnManagerTest, PidFileOfAnotherProgramIsRemovedAndTheProgramSpared) {
    const std::string pid = startClient("sleeper").pidText();
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_FALSE(pidFileExists());
    EXPECT_TRUE(commands.lines().empty());
    expectLogged(LOG_WARNING, "VPNManager::pidIsOpenVPNProcess() - pid " + pid + " in " +
                                  path("client.pid") + " does not match /proc/" + pid +
                                  "/exe symlink " + path("sleeper") + "\n");
}

// A path below /proc can be made to lead to a program of that name without being a pid; the text
// must not reach the shell.
TEST_F(VpnManagerTest, OnlyANumberIsAPid) {
    Process& running = startClient();
    std::string line = running.pidText() + "/task/" + running.pidText();
    std::string pid;
    EXPECT_FALSE(manager.pidIsOpenVPNProcess(line.data(), pid));
}

TEST_F(VpnManagerTest, StopsWithSigtermAndForgetsTheClient) {
    const std::string pid = startClient().pidText();
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(commands.lines(), (std::vector<std::string>{"kill -15 " + pid}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{3}));
    EXPECT_FALSE(pidFileExists());
    expectLogged(
        LOG_INFO,
        "VPNManager::closeVPNConnection() - attempting to stop process with PID: " + pid + " \n");
}

TEST_F(VpnManagerTest, FailingKillIsRepeatedAndTurnsToSigkill) {
    const std::string pid = startClient().pidText();
    commands.answer("kill", "", 1);
    EXPECT_FALSE(manager.closeVPNConnection());
    const std::string gently = "kill -15 " + pid;
    const std::string hard = "kill -9 " + pid;
    EXPECT_EQ(commands.lines(), (std::vector<std::string>{gently, gently, gently, hard, hard}));
    EXPECT_EQ(clock.pauses(), std::vector<long>(5, 3));
    EXPECT_TRUE(pidFileExists());
    EXPECT_EQ(log.countPart("failed to stop openVPN process with PID: " + pid + ", result "), 5);
    EXPECT_EQ(
        log.count(
            LOG_ERR,
            "VPNManager::closeVPNConnection() - failed to gracefully stop openVPN, terminating with SIGKILL\n"),
        2);
    EXPECT_EQ(
        log.count(LOG_ERR,
                  "VPNManager::closeVPNConnection() - attempting to SIGKILL process with PID: " +
                      pid + " \n"),
        2);
    expectLogged(LOG_ERR, "VPNManager::closeVPNConnection() - failed to stop openVPN process\n");
}

TEST_F(VpnManagerTest, KillThatSucceedsAtLastEndsThePasses) {
    startClient();
    for (int pass = 1; pass <= 3; ++pass) commands.answerOnce("kill -15", {"", 1, false, {}});
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(commands.count("kill -9"), 1);
    EXPECT_FALSE(pidFileExists());
}

TEST_F(VpnManagerTest, NothingIsStoppedWhereNothingRuns) {
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_TRUE(commands.lines().empty());
    EXPECT_TRUE(clock.pauses().empty());
    expectLogIs(
        {{LOG_ERR,
          "VPNManager::closeVPNConnection() - openVPN process is not running, so return true.\n"}});
}

TEST_F(VpnManagerTest, CleanupRemovesThePidFileAndLeavesTheClient) {
    startClient();
    EXPECT_TRUE(manager.cleanupVPNConnection());
    EXPECT_FALSE(pidFileExists());
    EXPECT_TRUE(commands.lines().empty());
    EXPECT_TRUE(manager.cleanupVPNConnection());

    std::filesystem::create_directory(path("client.pid"));  // cannot be unlinked
    EXPECT_FALSE(manager.cleanupVPNConnection());
    EXPECT_EQ(
        log.countPart("VPNManager::cleanupVPNConnection() - failed to unlink openVPN pid file"), 1);
}

struct RelayOutput {
    const char* name;
    const char* content;
    const char* address;  // empty: none found
    int failures;
};

class VpnRelayAddress : public VpnManagerTest, public testing::WithParamInterface<RelayOutput> {};

TEST_P(VpnRelayAddress, IsReadFromTheClientsOutput) {
    writeFile("client.out", GetParam().content);
    std::string ip;
    EXPECT_EQ(manager.fetchOpenVPN_IPAddr(ip), *GetParam().address != '\0');
    EXPECT_EQ(ip, GetParam().address);
    EXPECT_EQ(log.countPart("failed to fetch openVPN AF_INET IP address from line"),
              GetParam().failures);
}

INSTANTIATE_TEST_SUITE_P(
    Outputs,
    VpnRelayAddress,
    testing::Values(
        RelayOutput{"OnePeer",
                    "x\nNov [relay] Peer Connection Initiated with [AF_INET]44.128.0.1:1194\n",
                    "44.128.0.1", 0},
        RelayOutput{
            "LastPeerWins",
            "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\nPeer Connection Initiated with [AF_INET]44.128.0.2:1194\n",
            "44.128.0.2", 0},
        RelayOutput{
            "LaterRubbishKeepsTheEarlierAddress",
            "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\nPeer Connection Initiated with [AF_INET]device-7350142%s\n",
            "44.128.0.1", 1},
        RelayOutput{"NegativeNumber", "Peer Connection Initiated with [AF_INET]44.-1.0.2\n", "", 1},
        RelayOutput{"NumberThatFitsNoInteger",
                    "Peer Connection Initiated with [AF_INET]4294967297.1.1.1\n", "", 1},
        RelayOutput{"ThreeNumbers", "Peer Connection Initiated with [AF_INET]44.128.0\n", "", 1},
        RelayOutput{"OtherFamily", "Peer Connection Initiated with [AF_INET6]::1\n", "", 0},
        RelayOutput{"Empty", "", "", 0}),
    [](const auto& row) { return row.param.name; });

TEST_F(VpnManagerTest, TrimsBlanksAndLineEnds) {
    const std::vector<std::pair<std::string, std::string>> rows{
        {" \t42 \t\r\n", "42"}, {"\n42", "\n42"}, {" \t\r\n ", ""}, {"", ""}, {"4 2", "4 2"}};
    for (const auto& [text, wanted] : rows) {
        std::string trimmed = text;
        manager.trim(trimmed);
        EXPECT_EQ(trimmed, wanted);
    }
}

}  // namespace
}  // namespace pelorus::support
