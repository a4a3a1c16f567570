#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/masks.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr const char* kRemoteKey = "REMOTE_SETFORWARDURL";
constexpr const char* kLocalSetKey = "LOCAL_SETFORWARDURL";
constexpr const char* kLocalDeleteKey = "LOCAL_DELFORWARDURL";
constexpr const char* kNoAddress = "NULL";  // withdraws a record
constexpr const char* kLocalSuccess = "success";

// True when the back end answered; a refusal is only logged.
bool updateLocalRecord(const MaskedUrl& url) {
    logInfo("TavikClient::updateServerMapping - update local config url: %s\n", url.logged.c_str());
    const auto answer = fetchLocal(url.request);
    if (!answer) {
        logError(
            "TavikClient::updateServerMapping - failed to get response from localhost for url: [%s].\n",
            url.logged.c_str());
        return false;
    }
    if (!contains(answer->text, kLocalSuccess)) {
        logError(
            "TavikClient::updateServerMapping - failure response received from localhost for url: [%s].\n",
            url.logged.c_str());
        logError("Response: %s", scrubSecrets(answer->text).c_str());
    }
    return true;
}

// True only when the back end reported success.
bool deleteLocalRecord(const std::string& url) {
    const auto answer = fetchLocal(url);
    if (!answer) {
        logError(
            "TavikClient::deleteServerMapping - failed to get response from localhost for url: [%s]\n",
            scrubSecrets(url).c_str());
        return false;
    }
    if (!contains(answer->text, kLocalSuccess)) {
        logError(
            "TavikClient::deleteServerMapping - failure response received from localhost for url: [%s]\n",
            scrubSecrets(url).c_str());
        logError("Response: [%s]\n", scrubSecrets(answer->text).c_str());
        return false;
    }
    return true;
}

}  // namespace

MaskedUrl TavikClient::forwardingUrl(const std::string& externalIp,
                                     const std::string& localIp,
                                     int externalHttpPort,
                                     int externalHttpsPort) {
    return fillMaskedTemplate(
        kRemoteKey, getRestUrl(setting(kRemoteKey), HTTPS),
        {SecretArgument{getDeviceID(), STRIPPED_DEVID_VAL}, externalIp, localIp, externalHttpPort,
         externalHttpsPort, SecretArgument{getDeviceAuth(), STRIPPED_DEVAUTH_VAL}});
}

bool TavikClient::updateServerMapping(const std::string& externalIp,
                                      int externalHttpPort,
                                      int externalHttpsPort,
                                      const std::string& localIp,
                                      int internalHttpPort,
                                      int /*internalHttpsPort*/) try {
    if (getDeviceID().empty()) {
        logError(
            "TavikClient::updateServerMapping - failed to get Device ID from DynamicConfig.\n");
        return false;
    }
    if (getDeviceAuth().empty()) {
        logError(
            "TavikClient::updateServerMapping - failed to get Device Auth Code from DynamicConfig.\n");
        return false;
    }
    const MaskedUrl url = forwardingUrl(externalIp, localIp, externalHttpPort, externalHttpsPort);
    logInfo("TavikClient::updateServerMapping - set port forward url: %s\n", url.logged.c_str());
    const auto answer = fetchCentral(url);
    if (!answer) {
        logError(
            "TavikClient::updateServerMapping - httpGet failed to get response from central server for url %s.\n",
            url.logged.c_str());
        return false;
    }
    logNotice("TavikClient::updateServerMapping - httpGet got %s, %d bytes.\n",
              scrubSecrets(answer->text).c_str(), answer->size);
    // The back end expects the internal HTTP port in the last place, too, not the HTTPS one.
    return updateLocalRecord(fillMaskedTemplate(kLocalSetKey, setting(kLocalSetKey),
                                                {internalHttpPort, externalIp, externalHttpPort,
                                                 externalHttpsPort, localIp, internalHttpPort}));
} catch (...) {
    logError("** TavikClient::updateServerMapping - Throw exception error. **\n");
    return false;
}

bool TavikClient::deleteServerMapping(int internalHttpPort, const std::string& localIp) try {
    if (getDeviceID().empty()) {
        logError(
            "TavikClient::deleteServerMapping - failed to get Device ID from DynamicConfig.\n");
        return false;
    }
    if (getDeviceAuth().empty()) {
        logError(
            "TavikClient::deleteServerMapping - failed to get Device Auth Code from DynamicConfig.\n");
        return false;
    }
    const MaskedUrl url = forwardingUrl(kNoAddress, localIp, 0, 0);
    logInfo("TavikClient::deleteServerMapping - Deleting port mapping from server, url: [%s].\n",
            url.logged.c_str());
    const auto answer = fetchCentral(url);
    if (!answer) {
        logError(
            "TavikClient::deleteServerMapping - httpGet failed to get response from central server for url %s.\n",
            url.logged.c_str());
        return false;
    }
    logNotice("TavikClient::deleteServerMapping - httpGet got %s, %d bytes.\n",
              scrubSecrets(answer->text).c_str(), answer->size);
    return deleteLocalRecord(fillTemplate(kLocalDeleteKey, setting(kLocalDeleteKey),
                                          {internalHttpPort, internalHttpPort}));
} catch (...) {
    logError("** TavikClient::deleteServerMapping - Throw exception error. **\n");
    return false;
}

}  // namespace pelorus
