#include "relay/vpn_manager.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "common/files.h"
#include "common/log.h"
#include "common/shell.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "relay/client_output.h"

namespace pelorus {

namespace {

constexpr int kMaxStarts = 4;
constexpr int kChecksPerStart = 7;
constexpr unsigned kStartCheckDelay = 10;  // seconds
constexpr int kMaxStopPasses = 5;
constexpr int kGracefulStopPasses = 3;
constexpr unsigned kStopDelay = 3;  // seconds
constexpr int kMostPids = 16;

constexpr mode_t kCredentialsMode = 0600;

constexpr std::size_t kPathSize = 1024;        // bytes, terminator included
constexpr std::size_t kOutputLineSize = 1024;  // bytes
constexpr std::size_t kPidLineSize = 81;       // bytes: 80 characters and the terminator
constexpr std::size_t kStopPidLineSize = 128;  // bytes
constexpr std::size_t kLinkTargetSize = 512;   // bytes

// 0, or the errno of a failure.
int removeFile(const std::string& path) {
    return unlink(path.c_str()) == 0 ? 0 : errno;
}

// Changes the working directory until the end of the scope.
class WorkingDirectory {
public:
    explicit WorkingDirectory(const std::string& path) {
        if (getcwd(saved.data(), saved.size()) == nullptr) saved = {"/"};
        change(path.c_str());
    }
    ~WorkingDirectory() { change(saved.data()); }
    WorkingDirectory(const WorkingDirectory&) = delete;
    WorkingDirectory& operator=(const WorkingDirectory&) = delete;

private:
    // A missing directory is not logged; the client then fails to come up.
    static bool change(const char* path) { return chdir(path) == 0; }

    std::array<char, kPathSize> saved{};
};

bool isNumber(const std::string& text) {
    return !text.empty() && text.find_first_not_of("0123456789") == std::string::npos;
}

// Sends one signal through the shell. False, with the cause logged, when that failed.
bool killProcess(const std::string& pid, const char* signal) {
    const int result = runShell(std::string{"kill "} + signal + " " + pid);
    if (result == 0) return true;
    logError(
        "VPNManager::closeVPNConnection() - failed to stop openVPN process with PID: %s, result %d\n",
        pid.c_str(), result);
    return false;
}

bool stopProcess(const std::string& pid, int pass) {
    if (pass <= kGracefulStopPasses) {
        logInfo("VPNManager::closeVPNConnection() - attempting to stop process with PID: %s \n",
                pid.c_str());
        return killProcess(pid, "-15");
    }
    logError(
        "VPNManager::closeVPNConnection() - failed to gracefully stop openVPN, terminating with SIGKILL\n");
    logError("VPNManager::closeVPNConnection() - attempting to SIGKILL process with PID: %s \n",
             pid.c_str());
    return killProcess(pid, "-9");
}

}  // namespace

VPNManager* VPNManager::getInstance() {
    static VPNManager instance;
    return &instance;
}

bool VPNManager::openVPNConnection() {
    const WorkingDirectory inConfigPath{setting("OPENVPN_CONFIG_PATH")};
    logInfo("VPNManager::openVPNConnection() - checking if openVPN is running...\n");
    if (isVPNRunning()) {
        logInfo("VPNManager::openVPNConnection() - openVPN is already running\n");
        return true;
    }
    if (!writeCredentials()) return false;
    runShell(setting("UPDATE_CONF_WITH_SERVER_CMD"));
    logNotice(
        "VPNManager::openVPNConnection() - httpGet openvpn client relay servers and other settings.\n");
    return startClient();
}

bool VPNManager::writeCredentials() {
    logInfo("VPNManager::openVPNConnection() - creating auth.txt \n");
    const std::string deviceId = setting("DEVICEID");
    const std::string deviceAuth = setting("DEVICEAUTH");
    if (deviceId.empty() || deviceAuth.empty()) {
        logError(
            "VPNManager::openVPNConnection() - failed to get DEVICEID and/or DEVICEAUTH settings from config file!\n");
        return false;
    }
    const FileHandle file = createFile(setting("OPENVPN_AUTH_FILE"), kCredentialsMode);
    if (!file) {
        logError("VPNManager::openVPNConnection() - failed to open VPN Auth file for write!\n");
        return false;
    }
    static_cast<void>(std::fprintf(file.get(), "%s\n%s\n", deviceId.c_str(), deviceAuth.c_str()));
    return true;
}

bool VPNManager::startClient() {
    for (int start = 0; start < kMaxStarts; ++start) {
        runShell(setting("STARTCMD"));
        const StartState state = waitUntilUp();
        if (state == StartState::UP) return true;
        if (state == StartState::UNREADABLE) return false;
        // After the last start, too: a client left running would count as "relayed" in the next
        // cycle although its tunnel never came up.
        closeVPNConnection();
    }
    logError(
        "VPNManager::openVPNConnection() - Failed to establish VPN connection, retries exceeded\n");
    return false;
}

namespace {

bool holdsSuccessText(std::FILE* output, const std::string& successText) {
    std::array<char, kOutputLineSize> line{};
    while (std::fgets(line.data(), line.size(), output) != nullptr) {
        if (contains(line.data(), successText)) return true;
    }
    return false;
}

}  // namespace

VPNManager::StartState VPNManager::waitUntilUp() {
    for (int check = 0; check < kChecksPerStart; ++check) {
        sleep(kStartCheckDelay);
        const FileHandle output = openForeignFile(setting("STARTCMD_OUTFILE"), Part::TAIL);
        if (!output) {
            logError("VPNManager::openVPNConnection() - failed to open openVPN stdout file!\n");
            return StartState::UNREADABLE;
        }
        if (holdsSuccessText(output.get(), setting("LOG_SUCCESS_TEXT"))) {
            logInfo("VPNManager::openVPNConnection() - openVPN has started successfully\n");
            return StartState::UP;
        }
        logInfo(
            "VPNManager::openVPNConnection() - openVPN initialization did not complete, waiting...\n");
    }
    return StartState::NOT_YET;
}

bool VPNManager::isVPNRunning() {
    const std::string pidFile = setting("OPENVPN_PID_FILE");
    std::array<char, kPidLineSize> line{};
    {
        const FileHandle file = openForeignFile(pidFile);
        // A planted FIFO goes the way of an empty file: the client would wait for its reader.
        if (!file && errno != EINVAL) return false;
        if (!file || std::fgets(line.data(), line.size(), file.get()) == nullptr) {
            line.front() = '\0';
        }
    }
    std::string pid;
    if (line.front() == '\0') {
        logWarning("VPNManager::isVPNRunning() - openVPN pid file %s is empty\n", pidFile.c_str());
    } else if (pidIsOpenVPNProcess(line.data(), pid)) {
        return true;
    }
    logWarning("VPNManager::isVPNRunning() - unlink stale openVPN pid file %s\n", pidFile.c_str());
    if (const int error = removeFile(pidFile); error != 0) {
        logWarning(
            "VPNManager::isVPNRunning() - failed to unlink stale openVPN pid file %s, errno %d.\n",
            pidFile.c_str(), error);
    }
    return false;
}

bool VPNManager::pidIsOpenVPNProcess(char* line, std::string& pid) {
    pid = line;
    trim(pid);
    const std::string exePath = "/proc/" + pid + "/exe";
    // The path of the pid file is configured: it may name any file, the one with the credentials
    // included.
    const std::string shownPid = scrubSecrets(pid);
    const std::string shownPath = "/proc/" + shownPid + "/exe";
    logInfo("VPNManager::pidIsOpenVPNProcess() - openvpn proc_pid_exe path %s\n",
            shownPath.c_str());
    struct stat status {};
    if (stat(exePath.c_str(), &status) != 0) {
        const int error = errno;
        logWarning("VPNManager::pidIsOpenVPNProcess() - stat %s failed, errno %d\n",
                   shownPath.c_str(), error);
        return false;
    }
    std::array<char, kLinkTargetSize> target{};
    if (readlink(exePath.c_str(), target.data(), target.size() - 1) < 0) {
        const int error = errno;
        logWarning("VPNManager::pidIsOpenVPNProcess() - readlink %s failed, errno %d\n",
                   shownPath.c_str(), error);
        return false;
    }
    const std::string shownTarget = scrubSecrets(target.data());
    logInfo("VPNManager::pidIsOpenVPNProcess() - readlink %s succeeded, symlink %s\n",
            shownPath.c_str(), shownTarget.c_str());

    const std::string pidFile = setting("OPENVPN_PID_FILE");
    // The text becomes part of a shell command, so only a number is a pid: /proc also resolves
    // "123/task/123".
    if (isNumber(pid) && strcasestr(target.data(), "openvpn") != nullptr) {
        logInfo("VPNManager::pidIsOpenVPNProcess() - pid %s in %s matches %s symlink %s\n",
                shownPid.c_str(), pidFile.c_str(), shownPath.c_str(), shownTarget.c_str());
        return true;
    }
    logWarning("VPNManager::pidIsOpenVPNProcess() - pid %s in %s does not match %s symlink %s\n",
               shownPid.c_str(), pidFile.c_str(), shownPath.c_str(), shownTarget.c_str());
    return false;
}

bool VPNManager::closeVPNConnection() {
    if (!isVPNRunning()) {
        logError(
            "VPNManager::closeVPNConnection() - openVPN process is not running, so return true.\n");
        return true;
    }
    for (int pass = 1; pass <= kMaxStopPasses && isVPNRunning(); ++pass) {
        if (!stopOnce(pass)) break;
    }
    if (!isVPNRunning()) return true;
    logError("VPNManager::closeVPNConnection() - failed to stop openVPN process\n");
    return false;
}

// False when the pid file cannot be read: another pass would be pointless.
bool VPNManager::stopOnce(int pass) {
    const std::string pidFile = setting("OPENVPN_PID_FILE");
    logInfo("VPNManager::closeVPNConnection() - openVPN process is running\n");
    bool allStopped = true;
    {
        const FileHandle file = openForeignFile(pidFile);
        if (!file) {
            logError("VPNManager::closeVPNConnection() - failed to open PID output file\n");
            return false;
        }
        std::array<char, kStopPidLineSize> line{};
        // Each line costs a command: a planted file of many must not hold the daemon.
        for (int count = 0; count < kMostPids; ++count) {
            if (std::fgets(line.data(), line.size(), file.get()) == nullptr) break;
            std::string pid;
            if (line.front() == '\0' || !pidIsOpenVPNProcess(line.data(), pid)) continue;
            allStopped = stopProcess(pid, pass) && allStopped;
        }
        sleep(kStopDelay);
    }
    if (!allStopped) return true;
    // Without the file the client counts as stopped, even while it is still exiting.
    if (const int error = removeFile(pidFile); error != 0) {
        logError(
            "VPNManager::closeVPNConnection() - failed to unlink openVPN pid file %s, errno %d.\n",
            pidFile.c_str(), error);
    }
    return true;
}

bool VPNManager::cleanupVPNConnection() {
    const std::string pidFile = setting("OPENVPN_PID_FILE");
    struct stat status {};
    if (stat(pidFile.c_str(), &status) != 0) return true;
    const int error = removeFile(pidFile);
    if (error == 0) return true;
    logError(
        "VPNManager::cleanupVPNConnection() - failed to unlink openVPN pid file %s, errno %d.\n",
        pidFile.c_str(), error);
    return false;
}

bool VPNManager::fetchOpenVPN_IPAddr(std::string& ip) {
    const FileHandle output = openForeignFile(setting("STARTCMD_OUTFILE"), Part::TAIL);
    if (!output) {
        logError("VPNManager::fetchOpenVPN_IPAddr() - failed to open openVPN stdout file!\n");
        return false;
    }
    std::array<char, kOutputLineSize> line{};
    while (std::fgets(line.data(), line.size(), output.get()) != nullptr) {
        const auto peer = readRelayPeer(line.data());
        if (!peer) continue;
        if (peer->address) {
            ip = *peer->address;
            logInfo("VPNManager::fetchOpenVPN_IPAddr - found openVPN AF_INET IP address %s.\n",
                    ip.c_str());
        } else {
            logError(
                "VPNManager::fetchOpenVPN_IPAddr - failed to fetch openVPN AF_INET IP address from line %s.\n",
                scrubSecrets(line.data()).c_str());
        }
    }
    return !ip.empty();
}

void VPNManager::trim(std::string& text) {
    text.erase(text.find_last_not_of(" \n\t\r") + 1);
    text.erase(0, text.find_first_not_of(" \t"));
}

}  // namespace pelorus
