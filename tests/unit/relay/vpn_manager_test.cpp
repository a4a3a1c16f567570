#include "relay/vpn_manager.h"

#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <filesystem>

#include "config/global_config.h"
#include "relay/client_output.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;
using Lines = std::vector<std::string>;

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
    void TearDown() override {
        if (client > 0 && kill(client, SIGKILL) == 0) waitpid(client, nullptr, 0);
        PelorusTest::TearDown();
    }

    // Starts a process whose executable has the given name; returns its pid.
    std::string startClient(const std::string& name = "openvpn") {
        std::string program = path(name);
        std::string seconds = "600";
        fs::copy_file("/bin/sleep", program);
        char* const arguments[] = {program.data(), seconds.data(), nullptr};
        EXPECT_EQ(posix_spawn(&client, program.c_str(), nullptr, nullptr, arguments, nullptr), 0);
        std::string pid = std::to_string(client);
        writeFile("client.pid", " \t" + pid + " \t\r\n");
        return pid;
    }
    [[nodiscard]] bool pidFileExists() const { return fs::exists(path("client.pid")); }
    int logged(const std::string& part) const { return log.countPart("VPNConnection() - " + part); }

    VPNManager& manager = *VPNManager::getInstance();
    pid_t client = 0;
};

TEST_F(VpnManagerTest, StartsTheClientInItsFolderWithFreshCredentials) {
    fs::create_hard_link(writeFile("precious", "kept"), path("auth.txt"));
    fs::permissions(path("auth.txt"), fs::perms{0666});
    writeFile("client.out", "connecting\n");
    clock.duringPause(3, [this] {
        writeFile("client.out", std::string(70, ' ') + "Initialization Sequence Completed\n");
    });
    const fs::path before = fs::current_path();
    const auto inFolder = [&](const std::string&) { EXPECT_EQ(fs::current_path(), folder); };
    commands.answer("start-client", FakeCommands::Answer{"", 0, false, inFolder});
    EXPECT_TRUE(manager.openVPNConnection());
    EXPECT_EQ(fs::current_path(), before);
    EXPECT_EQ(readFile(path("auth.txt")), std::string{kDeviceId} + "\n" + kDeviceAuth + "\n");
    EXPECT_EQ(fs::status(path("auth.txt")).permissions(), fs::perms{0600});
    EXPECT_EQ(readFile(path("precious")), "kept");
    EXPECT_EQ(commands.lines(), (Lines{"fetch-relays", "start-client"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{10, 10, 10}));
}

TEST_F(VpnManagerTest, GivesUpAfterFourStartsOfSevenChecksAndStopsTheClient) {
    const std::string start = "start-client";
    writeFile("client.out", "AUTH_FAILED\n");
    EXPECT_FALSE(manager.openVPNConnection());
    EXPECT_EQ(commands.lines(), (Lines{"fetch-relays", start, start, start, start}));
    EXPECT_EQ(clock.pauses(), std::vector<long>(28, 10));
    EXPECT_EQ(logged("openVPN process is not running, so return true.\n"), 4);
}

TEST_F(VpnManagerTest, AFailureEndsTheStartAtOnce) {
    const std::string none = "failed to get DEVICEID and/or DEVICEAUTH settings from config file!";
    const std::pair<const char*, std::string> rows[]{
        {"STARTCMD_OUTFILE", "failed to open openVPN stdout file!"},
        {"OPENVPN_AUTH_FILE", "failed to open VPN Auth file for write!"},
        {"DEVICEID", none},
        {"DEVICEAUTH", none}};
    for (const auto& [key, message] : rows) {
        const std::string before = setting(key);
        setConfig(key, "");
        EXPECT_FALSE(manager.openVPNConnection());
        EXPECT_EQ(log.texts().back(), "VPNManager::openVPNConnection() - " + message + "\n");
        setConfig(key, before);
    }
    EXPECT_EQ(commands.lines(), (Lines{"fetch-relays", "start-client"})) << "of the first row";
    mkfifo(path("client.out").c_str(), 0666);  // planted to block
    EXPECT_FALSE(manager.openVPNConnection());
    std::string ip;
    EXPECT_FALSE(manager.fetchOpenVPN_IPAddr(ip));
}

TEST_F(VpnManagerTest, RemovesAPidFileThatNamesNoClient) {
    const std::string pid = startClient();
    const std::string task = pid + "/task/" + pid;
    writeFile("exe", "");
    const std::pair<std::string, std::string> rows[]{
        {"", "is empty"},
        {"self\n", "pid self in " + path("client.pid") + " does not match /proc/self/exe symlink"},
        {"%s%n\x01\x02/../..\n", "failed, errno 2"},
        {"device-7350142\nauth-91c2f0aa\n", "stat /proc/*ID_REMOVED*/exe failed"},
        {".." + folder, "readlink /proc/.." + folder + "/exe failed, errno 22"},
        {std::string(90, '9'), "stat /proc/" + std::string(80, '9') + "/exe failed"},
        {task, "does not match /proc/" + task + "/exe symlink "}};
    for (const auto& [content, warning] : rows) {
        log.clear();
        writeFile("client.pid", content);
        EXPECT_FALSE(manager.isVPNRunning());
        EXPECT_FALSE(pidFileExists());
        EXPECT_EQ(log.countPart(warning), 1) << log.dump();
    }
    mkfifo(path("client.pid").c_str(), 0666);  // planted to block
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_FALSE(pidFileExists());
    fs::create_symlink(writeFile("shadow", "root:hash\n"), path("client.pid"));
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(log.countPart("root:hash"), 0);
    EXPECT_FALSE(fs::is_symlink(path("client.pid")));
    EXPECT_EQ(commands.lines(), Lines{});
}

TEST_F(VpnManagerTest, LeavesARunningClientAloneUntilItIsToBeStopped) {
    const std::string pid = startClient("My-OpenVPN-2.6");
    EXPECT_TRUE(manager.openVPNConnection());
    commands.answer("kill", "", 1);
    EXPECT_FALSE(manager.closeVPNConnection());
    EXPECT_TRUE(pidFileExists());
    EXPECT_EQ(logged("failed to stop openVPN process with PID: " + pid + ", result "), 5);
    commands.answer("kill", "");
    commands.answerOnce("kill", {"", 1, false, {}});
    EXPECT_TRUE(manager.closeVPNConnection());
    const std::string gently = "kill -15 " + pid;
    const std::string hard = "kill -9 " + pid;
    EXPECT_EQ(commands.lines(), (Lines{gently, gently, gently, hard, hard, gently, gently}));
    EXPECT_EQ(clock.pauses(), std::vector<long>(7, 3));
    EXPECT_FALSE(pidFileExists());
}

TEST_F(VpnManagerTest, OnlyTheFirstLinesOfAPidFileCount) {
    const std::string pid = startClient();
    std::string many;
    for (int line = 0; line < 1000; ++line) many += pid + "\n";
    writeFile("client.pid", many);
    commands.answer("kill", "", 1);
    EXPECT_FALSE(manager.closeVPNConnection());
    EXPECT_EQ(commands.lines().size(), 16U * 5) << "a command for each line would take hours";
}

TEST_F(VpnManagerTest, EndsThePassesWhenThePidFileGoes) {
    startClient();
    log.onLine([this](const LogLine& line) {
        if (line.text.find("process is running") == line.text.npos) return;
        fs::remove(path("client.pid"));
        mkfifo(path("client.pid").c_str(), 0666);  // planted to block
    });
    EXPECT_TRUE(manager.closeVPNConnection());
    EXPECT_EQ(logged("failed to open PID output file\n"), 1);
}

TEST_F(VpnManagerTest, CleanupRemovesThePidFileAndLeavesTheClient) {
    startClient();
    for (int time = 0; time < 2; ++time) {
        EXPECT_TRUE(manager.cleanupVPNConnection());
        EXPECT_FALSE(pidFileExists());
    }
    EXPECT_EQ(commands.lines(), Lines{});
    fs::create_directory(path("client.pid"));
    EXPECT_FALSE(manager.cleanupVPNConnection());
    EXPECT_FALSE(manager.isVPNRunning());
    const std::string failure = "pid file " + path("client.pid") + ", errno 21.\n";
    EXPECT_EQ(log.countPart("failed to unlink openVPN " + failure), 1);
    EXPECT_EQ(log.countPart("failed to unlink stale openVPN " + failure), 1);
}

TEST_F(VpnManagerTest, TheLastReadableRelayAddressWins) {
    const std::string peer = std::string(470, ' ') + "Peer Connection Initiated with [AF_INET]";
    std::string ip;
    EXPECT_FALSE(manager.fetchOpenVPN_IPAddr(ip));
    writeFile("client.out", peer + "device-7350142%s\n");
    EXPECT_FALSE(manager.fetchOpenVPN_IPAddr(ip));
    writeFile("client.out", "x\n" + peer + "44.1.1.1:1194\n" + peer + "44.1.1.2\n" + peer + "z\n");
    EXPECT_TRUE(manager.fetchOpenVPN_IPAddr(ip));
    EXPECT_EQ(ip, "44.1.1.2");
    writeFile("client.out", std::string(3'000'000, 'x') + "\n" + peer + "44.1.1.3\n");
    EXPECT_TRUE(manager.fetchOpenVPN_IPAddr(ip));
    EXPECT_EQ(ip, "44.1.1.3");
    EXPECT_EQ(log.countPart("failed to fetch openVPN AF_INET IP address from line"), 2);
}

TEST(RelayPeerTest, AnAddressIsFourNumbersNotBelowZero) {
    const std::string peer = "at 12:00 Peer Connection Initiated with [AF_INET]";
    EXPECT_EQ(readRelayPeer((peer + " 44.300.007. 0").c_str())->address, "44.300.7.0");
    for (const char* const bad :
         {"44.-1.0.2", "44X.1.1.1", "4294967297.1.1.1", "44.128.0", "44.128.0:1", ""}) {
        const auto read = readRelayPeer((peer + bad).c_str());
        EXPECT_TRUE(read && !read->address) << bad;
    }
    EXPECT_FALSE(readRelayPeer("Peer Connection Initiated with [AF_INET6]::1"));
}

}  // namespace
}  // namespace pelorus::support
