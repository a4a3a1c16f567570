#include "relay/vpn_manager.h"

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <memory>

#include "relay/client_output.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;
using Lines = std::vector<std::string>;

// A process whose executable has the given name; gone with the object.
class Process {
public:
    explicit Process(const std::string& executable) {
        fs::copy_file("/bin/sleep", executable);
        pid = fork();
        if (pid == 0) {
            execl(executable.c_str(), executable.c_str(), "600", nullptr);
            _exit(127);
        }
        // Until the exec, /proc still shows the test's own executable.
        const std::string link = "/proc/" + pidText() + "/exe";
        while (waitpid(pid, nullptr, WNOHANG) == 0 && fs::read_symlink(link) != executable) {
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

    // Returns the pid.
    std::string startClient(const char* name = "openvpn") {
        client = std::make_unique<Process>(path(name));
        writeFile("client.pid", " \t" + client->pidText() + " \t\r\n");
        return client->pidText();
    }
    [[nodiscard]] bool pidFileExists() const { return fs::exists(path("client.pid")); }
    int logged(const std::string& part) const { return log.countPart("VPNConnection() - " + part); }

    VPNManager& manager = *VPNManager::getInstance();
    std::unique_ptr<Process> client;
};

TEST_F(VpnManagerTest, StartsTheClientInItsFolderWithFreshCredentials) {
    writeFile("auth.txt", "an older and longer content\nof three\nlines\n");
    writeFile("client.out", "connecting\n");
    clock.duringPause(3, [this] {
        writeFile("client.out", "connecting\nNov 21 Initialization Sequence Completed\n");
    });
    const fs::path before = fs::current_path();
    const auto inFolder = [&](const std::string&) { EXPECT_EQ(fs::current_path(), folder); };
    commands.answer("start-client", FakeCommands::Answer{"", 0, false, inFolder});
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_EQ(fs::current_path(), before);
    EXPECT_EQ(readFile(path("auth.txt")), std::string{kDeviceId} + "\n" + kDeviceAuth + "\n");
    EXPECT_EQ(commands.lines(), (Lines{"fetch-relays", "start-client"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{10, 10, 10}));
    EXPECT_EQ(logged("openVPN initialization did not complete, waiting...\n"), 2);
    EXPECT_EQ(logged("openVPN has started successfully\n"), 1);
}

TEST_F(VpnManagerTest, GivesUpAfterFourStartsOfSevenChecksAndStopsTheClient) {
    writeFile("client.out", "AUTH_FAILED\n");
    EXPECT_FALSE(manager.openVPNConnection());
    EXPECT_EQ(commands.count("fetch-relays"), 1);
    EXPECT_EQ(commands.count("start-client"), 4);
    EXPECT_EQ(clock.pauses(), std::vector<long>(28, 10));
    EXPECT_EQ(logged("openVPN process is not running, so return true.\n"), 4);
    EXPECT_EQ(logged("Failed to establish VPN connection, retries exceeded\n"), 1);
}

TEST_F(VpnManagerTest, AFailureEndsTheStartAtOnce) {
    const auto row = [&](const char* key, const char* message, std::size_t lines) {
        setConfig(key, "");
        log.clear();
        EXPECT_FALSE(manager.openVPNConnection());
        EXPECT_EQ(logged(message), 1) << key;
        EXPECT_EQ(commands.lines().size(), lines);
        commands.clear();
    };
    row("STARTCMD_OUTFILE", "failed to open openVPN stdout file!\n", 2);
    row("OPENVPN_AUTH_FILE", "failed to open VPN Auth file for write!\n", 0);
    row("DEVICEAUTH", "failed to get DEVICEID and/or DEVICEAUTH settings from config file!\n", 0);
    setConfig("DEVICEAUTH", kDeviceAuth);
    row("DEVICEID", "failed to get DEVICEID and/or DEVICEAUTH settings from config file!\n", 0);
}

TEST_F(VpnManagerTest, RemovesAPidFileThatNamesNoClient) {
    const auto row = [&](const std::string& content, const std::string& warning) {
        writeFile("client.pid", content);
        EXPECT_FALSE(manager.isVPNRunning());
        EXPECT_FALSE(pidFileExists());
        EXPECT_EQ(log.countPart(warning), 1) << log.dump();
    };
    row("", "is empty");
    row("self\n", "pid self in " + path("client.pid") + " does not match /proc/self/exe symlink");
    row("%s%n\x01\x02/../..\n", "failed, errno 2");
    row("device-7350142\nauth-91c2f0aa\n", "stat /proc/*ID_REMOVED*/exe failed");
    row(std::string(90, '9'), "stat /proc/" + std::string(80, '9') + "/exe failed");
    const std::string pid = startClient();
    row(pid + "/task/" + pid, "does not match /proc/" + pid + "/task/" + pid + "/exe symlink ");
    EXPECT_EQ(log.countPart("isVPNRunning() - unlink stale openVPN pid file "), 6);
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(commands.lines(), Lines{});
}

TEST_F(VpnManagerTest, LeavesARunningClientAloneUntilItIsToBeStopped) {
    const std::string pid = startClient("My-OpenVPN-2.6");
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_EQ(logged("openVPN is already running\n"), 1);
    commands.answer("kill", "", 1);
    EXPECT_FALSE(manager.closeVPNConnection());
    const std::string gently = "kill -15 " + pid;
    const std::string hard = "kill -9 " + pid;
    EXPECT_EQ(commands.lines(), (Lines{gently, gently, gently, hard, hard}));
    EXPECT_TRUE(pidFileExists());
    EXPECT_EQ(logged("failed to stop openVPN process with PID: " + pid + ", result "), 5);
    EXPECT_EQ(logged("failed to gracefully stop openVPN, terminating with SIGKILL\n"), 2);
    EXPECT_EQ(logged("failed to stop openVPN process\n"), 1);
    commands.clear();
    commands.answer("kill", "");
    commands.answerOnce("kill", {"", 1, false, {}});
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(commands.lines(), (Lines{gently, gently}));
    EXPECT_EQ(clock.pauses(), std::vector<long>(7, 3));
    EXPECT_FALSE(pidFileExists());
}

TEST_F(VpnManagerTest, EndsThePassesWhenThePidFileGoes) {
    startClient();
    log.onLine([this](const LogLine& line) {
        if (line.text.find("openVPN process is running") != std::string::npos) {
            fs::remove(path("client.pid"));
        }
    });
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(logged("failed to open PID output file\n"), 1);
    EXPECT_EQ(logged("openVPN process is running\n"), 1);
}

TEST_F(VpnManagerTest, CleanupRemovesThePidFileAndLeavesTheClient) {
    startClient();
    EXPECT_TRUE(manager.cleanupVPNConnection());
    EXPECT_FALSE(pidFileExists());
    EXPECT_EQ(commands.lines(), Lines{});
    EXPECT_TRUE(manager.cleanupVPNConnection());

    fs::create_directory(path("client.pid"));
    EXPECT_FALSE(manager.cleanupVPNConnection());
    EXPECT_FALSE(manager.isVPNRunning());
    const std::string failure = "pid file " + path("client.pid") + ", errno 21.\n";
    EXPECT_EQ(log.countPart("failed to unlink openVPN " + failure), 1);
    EXPECT_EQ(log.countPart("failed to unlink stale openVPN " + failure), 1);
}

TEST_F(VpnManagerTest, TheLastReadableRelayAddressWins) {
    const std::string peer = std::string(100, ' ') + "Peer Connection Initiated with [AF_INET]";
    std::string ip;
    EXPECT_FALSE(manager.fetchOpenVPN_IPAddr(ip));
    writeFile("client.out", peer + "device-7350142%s\n");
    EXPECT_FALSE(manager.fetchOpenVPN_IPAddr(ip));
    writeFile("client.out", "x\n" + peer + "44.1.1.1:1194\n" + peer + "44.1.1.2\n" + peer + "z\n");
    EXPECT_TRUE(manager.fetchOpenVPN_IPAddr(ip));
    EXPECT_EQ(ip, "44.1.1.2");
    EXPECT_EQ(log.countPart("failed to open openVPN stdout file!\n"), 1);
    EXPECT_EQ(log.countPart("failed to fetch openVPN AF_INET IP address from line"), 2);
    EXPECT_EQ(readRelayPeer((peer + " 44.300.007. 0").c_str())->address, "44.300.7.0");
    for (const char* const bad : {"44.-1.0.2", "4294967297.1.1.1", "44.128.0", "44.128.0:1", ""}) {
        const auto read = readRelayPeer((peer + bad).c_str());
        EXPECT_TRUE(read && !read->address) << bad;
    }
    EXPECT_FALSE(readRelayPeer("Peer Connection Initiated with [AF_INET6]::1"));
}

}  // namespace
}  // namespace pelorus::support
