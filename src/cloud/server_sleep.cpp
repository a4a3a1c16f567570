#include <algorithm>
#include <cerrno>

#include "cloud/sleep_answer.h"
#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/masks.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr const char* kRemoteStatusPath = "/api/1.0/rest/remote_access_status/%s";
constexpr int kShortestPause = 120;  // seconds between two cycles

}  // namespace

int TavikClient::pollServerForSleepTime() {
    if (serverPolled) {
        logInfo(
            "TavikClient::pollServerForSleepTime - central server already polled. Sleep time is %d secs.\n",
            serverSleepTime);
        return serverSleepTime;
    }
    const std::string id = getDeviceID();
    if (id.empty()) {
        logError(
            "TavikClient::pollServerForSleepTime - failed to get Device ID from DynamicConfig. Therefore using sleep time %d secs.\n",
            serverSleepTime);
        return serverSleepTime;
    }
    const MaskedUrl url =
        fillMaskedTemplate("the remote access status path", getRestUrl(kRemoteStatusPath, HTTP),
                           {SecretArgument{id, STRIPPED_DEVID_VAL}});
    logInfo("TavikClient::pollServerForSleepTime - remote status url: %s.\n", url.logged.c_str());
    try {
        if (const auto answer = fetchCentral(url)) {
            logInfo("TavikClient::pollServerForSleepTime - httpGet got %s, %d bytes.\n",
                    scrubSecrets(answer->text).c_str(), answer->size);
            applySleepAnswer(readSleepAnswer(answer->text));
        } else {
            logError(
                "TavikClient::pollServerForSleepTime - httpGet for %s, failed to get response from central server. Therefore using sleep time %d secs.\n",
                url.logged.c_str(), serverSleepTime);
        }
    } catch (...) {
        const int error = errno;
        logError(
            "TavikClient::pollServerForSleepTime - caught exception error %d. Therefore using sleep time %d secs.\n",
            error, serverSleepTime);
    }
    serverPolled = true;
    return serverSleepTime;
}

void TavikClient::applySleepAnswer(const SleepAnswer& answer) {
    // 0 since the cycle began: after an answer that is not understood the device proceeds.
    serverSleepTime = answer.seconds.value_or(serverSleepTime);
    switch (answer.kind) {
        case SleepAnswer::WAIT:
            logInfo("TavikClient::pollServerForSleepTime - sleep time from server is %d secs.\n",
                    serverSleepTime);
            break;
        case SleepAnswer::PROCEED:
            logInfo(
                "TavikClient::pollServerForSleepTime - central server gave permission to proceed. Sleep time is %d secs.\n",
                serverSleepTime);
            break;
        case SleepAnswer::BAD_TIME:
            logInfo(
                "TavikClient::pollServerForSleepTime - received garbage sleep time from central server. Therefore using sleep time %d secs.\n",
                serverSleepTime);
            break;
        case SleepAnswer::NO_TIME:
            logInfo(
                "TavikClient::pollServerForSleepTime - malformed wait_time from central server. Therefore using sleep time %d secs.\n",
                serverSleepTime);
            break;
        case SleepAnswer::NO_ACTION:
            logInfo(
                "TavikClient::pollServerForSleepTime - missing action from central server. Therefore using sleep time %d secs.\n",
                serverSleepTime);
            break;
    }
}

bool TavikClient::serverRequestedSleep() {
    return pollServerForSleepTime() > 0;
}

int TavikClient::getServerSleepTime() const {
    return std::max(serverSleepTime, kShortestPause);
}

void TavikClient::resetServerSleepTime() {
    serverPolled = false;
    serverSleepTime = 0;
}

}  // namespace pelorus
