#include <qvlog.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>

#include "cloud/tavik_client.h"
#include "common/handles.h"
#include "common/log.h"
#include "common/masks.h"
#include "common/signal_block.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

std::map<std::string, std::string> Status2LogState;
std::map<std::string, std::string> Status2LogType;
const std::array<const char*, 5> ConnType2LogType{"disabled", "portforwarded", "relayed",
                                                  "disabled", "disabled"};

// Defined here because it only fills the tables above. A failure has no type of its own:
// sendAnalytics takes that of the connection that failed.
TavikClient::TavikClient() {
    Status2LogState["disabled"] = "connecting";
    Status2LogState["connecting"] = "connecting";
    Status2LogState["portforwarded"] = "connected";
    Status2LogState["relayed"] = "connected";
    Status2LogState["failed"] = "failed";

    Status2LogType["disabled"] = "disabled";
    Status2LogType["connecting"] = "disabled";
    Status2LogType["portforwarded"] = "portforwarded";
    Status2LogType["relayed"] = "relayed";
    Status2LogType["failed"] = "disabled";
}

namespace {

constexpr const char* kInternalPortKey = "INTERNAL_HTTP_PORT";
constexpr const char* kLocalStatusKey = "LOCAL_SETCOMMSTATUSURL";
constexpr const char* kLocalAddressKey = "LOCAL_SETLOCALIPURL";
constexpr const char* kRemoteStatusKey = "REMOTE_SETCOMMSTATUSURL";

// The two sides capitalise it differently.
constexpr const char* kLocalSuccess = "success";
constexpr const char* kCentralSuccess = "Success";

constexpr unsigned kLocalUpdatePause = 1;  // seconds the local back end is given to write
// A new time stamp makes GlobalConfig read what the back end has written.
constexpr const char* kTouchDynamicConfig = "touch /tmp/dynamicconfig.ini";

constexpr const char* kDiskStateCommand = "hdparm -C /dev/sda";
constexpr const char* kDiskAsleep = "standby";
constexpr const char* kIdleMinutesFile = "/tmp/minutes_since_disk_access";
constexpr int kMostIdleMinutes = 1;
constexpr std::size_t kShortLineSize = 80;  // bytes, terminator included

// Values of the event log library.
constexpr int kEventLevel = 3;
constexpr int kTextValue = 3;

int internalPort() {
    return leadingInt(setting(kInternalPortKey));
}

void judgeLocalStatusAnswer(const std::string& url, const std::string& answer) {
    if (!contains(answer, kLocalSuccess)) {
        logError(
            "TavikClient::updateLocalCommStatus - failure response received from localhost for url: [%s]\n",
            scrubSecrets(url).c_str());
        logError("Response: [%s].\n", scrubSecrets(answer).c_str());
        return;
    }
    logInfo("TavikClient::updateLocalCommStatus - Successful update status.\n\n");
}

bool tellBackEndLocalIp(const std::string& localIp) {
    const std::string url =
        fillTemplate(kLocalAddressKey, setting(kLocalAddressKey), {internalPort(), localIp});
    logInfo("TavikClient::updateRemoteCommStatus - local config using url:  %s\n",
            scrubSecrets(url).c_str());
    if (fetchLocal(url)) return true;
    logError(
        "TavikClient::updateRemoteCommStatus - failed to get response from local server for url:  %s\n",
        scrubSecrets(url).c_str());
    return false;
}

void emitEvent(const char* state, const char* type) {
    // The library may hold the log's lock, and the termination handler logs, too.
    const SignalBlock noTermination{SIGINT, SIGTERM, SIGQUIT};
    __qvlog_kvp(kEventLevel, "cloudConnectivity", "state", kTextValue, state, "type", kTextValue,
                type, __QVLOG_END);
}

bool reportsStandby(std::FILE* output) {
    std::array<char, kShortLineSize> line{};
    while (std::fgets(line.data(), line.size(), output) != nullptr) {
        if (contains(line.data(), kDiskAsleep)) return true;
    }
    return false;
}

int firstNumber(std::FILE* file) {
    std::array<char, kShortLineSize> line{};
    return std::fgets(line.data(), line.size(), file) == nullptr ? 0 : leadingInt(line.data());
}

// 1 when the disk has been idle for so long that it may be asleep, or its idle time is
// unknown; 0 otherwise.
int checkIdleMinutes() {
    const FileHandle file = openFile(kIdleMinutesFile, "re");
    if (!file) {
        logError(
            "TavikClient::checkHddStandByMode - failed to get open Ostrel sleep count file.\n");
        return 1;
    }
    logInfo("TavikClient::checkHddStandByMode - checking sleep count.\n");
    if (firstNumber(file.get()) > kMostIdleMinutes) {
        logInfo("TavikClient::checkHddStandByMode - sleep count > 1, port testing SKIP.\n");
        return 1;
    }
    return 0;
}

std::string logStateOf(const std::string& status) {
    const auto found = Status2LogState.find(status);
    if (found == Status2LogState.end()) {
        logInfo("TavikClient::sendAnalytics - Status2LogState[%s] = NOT_FOUND\n", status.c_str());
        return "failed";
    }
    logInfo("TavikClient::sendAnalytics - Status2LogState[%s] = %s\n", status.c_str(),
            found->second.c_str());
    return found->second;
}

std::string logTypeOf(const std::string& status) {
    const auto found = Status2LogType.find(status);
    if (found == Status2LogType.end()) {
        logInfo("TavikClient::sendAnalytics - Status2LogType[%s] = NOT_FOUND\n", status.c_str());
        return "disabled";
    }
    logInfo("TavikClient::sendAnalytics - Status2LogType[%s] = %s\n", status.c_str(),
            found->second.c_str());
    return found->second;
}

}  // namespace

void TavikClient::updateLocalCommStatus(const std::string& status) try {
    if (!lastLocalCommStatus.empty() && lastLocalCommStatus == status) return;
    // Stored first: a failed update is not repeated before the status changes.
    lastLocalCommStatus = status;
    const std::string url =
        fillTemplate(kLocalStatusKey, setting(kLocalStatusKey), {internalPort(), status});
    logInfo("TavikClient::updateLocalCommStatus - URL : [%s].\n", scrubSecrets(url).c_str());
    logInfo("TavikClient::updateLocalCommStatus - Update COMMUNICATION status : [%s].\n",
            status.c_str());
    const auto answer = fetchLocal(url);
    sleep(kLocalUpdatePause);
    if (!answer) {
        logError(
            "TavikClient::updateLocalCommStatus - failed to get response from localhost for url:  [%s]\n",
            scrubSecrets(url).c_str());
        return;
    }
    if (std::system(kTouchDynamicConfig) != -1) {
        logInfo("TavikClient::updateLocalCommStatus - enforced touch to /tmp/dynamicconfig.ini.\n");
    }
    judgeLocalStatusAnswer(url, answer->text);
} catch (...) {
    logError("** TavikClient::updateLocalCommStatus - Throw exception error. **\n");
}

bool TavikClient::updateRemoteCommStatus(const std::string& localIp) try {
    if (getDeviceID().empty()) {
        logError(
            "TavikClient::updateRemoteCommStatus - failed to get Device ID from DynamicConfig\n");
        return false;
    }
    if (getDeviceAuth().empty()) {
        logError(
            "TavikClient::updateRemoteCommStatus - failed to get Device Auth Code from DynamicConfig\n");
        return false;
    }
    return tellServerLocalIp(localIp) && tellBackEndLocalIp(localIp);
} catch (...) {
    logError("** TavikClient::updateRemoteCommStatus - Throw exception error. **\n");
    return false;
}

// True when the server answered; its answer is only logged.
bool TavikClient::tellServerLocalIp(const std::string& localIp) {
    const MaskedUrl url =
        fillMaskedTemplate(kRemoteStatusKey, getRestUrl(setting(kRemoteStatusKey), HTTPS),
                           {SecretArgument{getDeviceID(), STRIPPED_DEVID_VAL},
                            SecretArgument{getDeviceAuth(), STRIPPED_DEVAUTH_VAL}, localIp});
    logInfo("TavikClient::updateRemoteCommStatus - updating central server using url:  %s\n",
            url.logged.c_str());
    const auto answer = fetchCentral(url);
    if (!answer) {
        logError(
            "TavikClient::updateRemoteCommStatus - httpGet failed to get response from central server for url %s.\n",
            url.logged.c_str());
        return false;
    }
    const std::string logged = scrubSecrets(answer->text);
    logNotice(
        "TavikClient::updateRemoteCommStatus - httpGet got %s. %d bytes from central server.\n",
        logged.c_str(), answer->size);
    if (!contains(answer->text, kCentralSuccess)) {
        logError(
            "TavikClient::updateRemoteCommStatus - failure response received from central server for url:  %s\n",
            url.logged.c_str());
        logError("TavikClient::updateRemoteCommStatus - Response: [%s].\n", logged.c_str());
    }
    return true;
}

void TavikClient::sendAnalytics(const std::string& status,
                                ConnectionType type,
                                ConnectionSubType subType) try {
    logInfo(
        "TavikClient::sendAnalytics - COMMUNICATION status:[%s]  connectionType:[%d]  connectionSubType:[%d]\n",
        status.c_str(), static_cast<int>(type), static_cast<int>(subType));
    const std::string logState = logStateOf(status);
    std::string logType = logTypeOf(status);
    // A failure or an attempt is reported under the kind of connection that failed or is tried.
    const auto kind = static_cast<std::size_t>(type);
    if ((status == "failed" || status == "connecting") && kind < ConnType2LogType.size()) {
        logType = ConnType2LogType[kind];
    }
    logInfo("TavikClient::sendAnalytics - logState:[%s]  logType:[%s]\n", logState.c_str(),
            logType.c_str());
    emitEvent(logState.c_str(), logType.c_str());
    lastConnectionSubType = subType;
} catch (...) {
    logError("** TavikClient::sendAnalytics - Throw exception error. **\n");
}

int TavikClient::checkHddStandByMode() try {
    PipeHandle output{popen(kDiskStateCommand, "re")};
    if (!output) {
        logError(
            "TavikClient::checkHddStandByMode - port test not performed - unable to check drive status, popen() returned NULL.\n");
        return 1;
    }
    if (reportsStandby(output.get())) {
        logInfo(
            "TavikClient::checkHddStandByMode - drive is in standby, port test is suspended, port testing SKIP.\n");
        return 1;
    }
    output.reset();
    if (leadingInt(setting("DEVICETYPE")) == kMakersRouter) return 0;
    return checkIdleMinutes();
} catch (...) {
    logError("** TavikClient::checkHddStandByMode - Throw exception error. **\n");
    return 1;
}

}  // namespace pelorus
