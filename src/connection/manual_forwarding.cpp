#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "connection/connection_manager.h"
#include "connection/mapping_names.h"
#include "connection/network_addrs.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kHighestPort = 65535;

void reportAnalytics(const char* status) {
    TavikClient::getInstance()->sendAnalytics(status, PORTFORWARDED, SUBTYPE_MANUAL);
}

int readPort(const char* key) {
    int port = 0;
    return scanInt(setting(key).c_str(), port) ? port : 0;
}

bool isPort(int port) {
    return port >= 1 && port <= kHighestPort;
}

}  // namespace

// What the stages of one attempt share.
struct ConnectionManager::ManualAttempt {
    int internalHttpPort = 0;
    int internalHttpsPort = 0;
    std::string localIp;
    int testHttpPort = 0;         // external, as the user configured it
    int testHttpsPort = 0;        // external
    bool changed = false;         // ports or addresses differ from what was published
    bool forced = false;          // test now, whatever the interval
    bool portTestPassed = false;  // in this attempt
    time_t now = 0;
    std::string externalIp;  // as the server saw it
    ConnectionType result = FAILED;

    bool readPorts() {
        testHttpPort = readPort("MANUAL_EXTERNAL_HTTP_PORT");
        testHttpsPort = readPort("MANUAL_EXTERNAL_HTTPS_PORT");
        if (!isPort(testHttpPort)) {
            logError(
                "ConnectionManager::manualPortForward - bad value for manually configured HTTP Port.\n");
            return false;
        }
        if (!isPort(testHttpsPort)) {
            logError(
                "ConnectionManager::manualPortForward - bad value for manually configured HTTPS Port.\n");
            return false;
        }
        return true;
    }
    [[nodiscard]] bool mustBePublished() const { return forced || changed; }
};

ConnectionType ConnectionManager::manualPortForward(int internalHttpPort,
                                                    int internalHttpsPort,
                                                    std::string localIp) {
    ManualAttempt attempt;
    attempt.internalHttpPort = internalHttpPort;
    attempt.internalHttpsPort = internalHttpsPort;
    attempt.localIp = std::move(localIp);
    clearMappedFlags();
    if (!attempt.readPorts()) return FAILED;
    logInfo(
        "ConnectionManager::manualPortForward - allocatedHttpPort %d, manualHttpPort %d, allocatedHttpsPort %d, manualHttpsPort %d.\n",
        allocatedHttpPort, attempt.testHttpPort, allocatedHttpsPort, attempt.testHttpsPort);
    if (!lastManualPortForward) leaveAutomaticForwarding();
    noticeManualChanges(attempt);

    attempt.forced = forceConnect;
    attempt.now = time(nullptr);
    logInfo(
        "ConnectionManager::manualPortForward - Elapsed time %ld, portTestInterval %ld, manualPortForwardChange %d, lastManualPortForward %d, forceConnect %d\n",
        static_cast<long>(attempt.now - lastPortTestTime), portTestInterval, attempt.changed,
        lastManualPortForward, forceConnect);
    if (!attempt.mustBePublished() && attempt.now - lastPortTestTime <= portTestInterval) {
        logInfo(
            "ConnectionManager::manualPortForward - Not time to do port test, or manual ports not changed on NAS.\n");
        attempt.result = connectionType;
    } else if (doubleNatDetected) {
        logInfo(
            "ConnectionManager::manualPortForward - relay mode is enforced, therefore don't manual forward ports.\n");
        return FAILED;
    } else {
        testManualPorts(attempt);
    }

    if (attempt.mustBePublished() && attempt.portTestPassed) {
        publishManualPorts(attempt);
    } else if (attempt.portTestPassed) {
        attempt.result = PORTFORWARDED;
    } else {
        logInfo(
            "ConnectionManager::manualPortForward - port test was skipped, failed or no change in manually forwarded ports.\n");
    }
    return endManualAttempt(attempt);
}

// The user took over: what this daemon mapped is removed, as far as the gateway can be asked.
void ConnectionManager::leaveAutomaticForwarding() {
    if (!router().isInitialized()) router().discover();
    if (!router().isInitialized()) return;
    logInfo("ConnectionManager::manualPortForward - unmapping existing ports.\n");
    router().unmapAllPorts(kTcp, kHttpDescription);
    router().unmapAllPorts(kTcp, kHttpsDescription);
    allocatedHttpPort = 0;
    allocatedHttpsPort = 0;
}

void ConnectionManager::noticeManualChanges(ManualAttempt& attempt) const {
    auto* addresses = NetworkAddrs::getInstance();
    attempt.changed = !lastManualPortForward || attempt.testHttpPort != allocatedHttpPort ||
                      attempt.testHttpsPort != allocatedHttpsPort;
    if (!lastManualPortForward) {
        addresses->init();
        return;
    }
    if (addresses->discoverNetworkAddrs() != 1 || !addresses->haveNetworkAddrsChanged()) return;
    attempt.changed = true;
    logInfo(
        "ConnectionManager::manualPortForward - detected change to external IP [%s] or local IP [%s]\n",
        scrubSecrets(addresses->getExternalIp()).c_str(), addresses->getLocalIp().c_str());
}

void ConnectionManager::testManualPorts(ManualAttempt& attempt) {
    logInfo(
        "ConnectionManager::manualPortForward - Running port test for manually forwarded ports.\n");
    if (attempt.mustBePublished()) reportAnalytics("connecting");
    const int testResult =
        testHttpPort(attempt.externalIp, attempt.testHttpPort, !attempt.mustBePublished(), true);
    if (testResult == SKIP_TEST) {
        attempt.result = connectionType;
        return;
    }
    lastPortTestTime = attempt.now;
    if (testResult != PASS_TEST) return;
    attempt.portTestPassed = true;
    allocatedHttpPort = attempt.testHttpPort;
    allocatedHttpsPort = attempt.testHttpsPort;
}

void ConnectionManager::publishManualPorts(ManualAttempt& attempt) {
    logInfo(
        "ConnectionManager::manualPortForward - success - internal Http Port: [%d] is mapped to external Port: [%d].\n",
        attempt.internalHttpPort, allocatedHttpPort);
    logInfo(
        "ConnectionManager::manualPortForward - success - internal Https Port: [%d] is mapped to external Port: [%d].\n",
        attempt.internalHttpsPort, allocatedHttpsPort);
    auto* client = TavikClient::getInstance();
    if (!client->updateServerMapping(attempt.externalIp, allocatedHttpPort, allocatedHttpsPort,
                                     attempt.localIp, attempt.internalHttpPort,
                                     attempt.internalHttpsPort)) {
        logError(
            "ConnectionManager::manualPortForward - failed to update port mapping on server.\n");
        reportAnalytics("failed");
        attempt.result = FAILED;
        return;
    }
    logInfo(
        "ConnectionManager::manualPortForward - successfully updated port mapping on server.\n");
    if (VPNManager::getInstance()->closeVPNConnection()) {
        reportAnalytics("portforwarded");
        client->updateLocalCommStatus("portforwarded");
        httpPortMapped = true;
        httpsPortMapped = true;
        setForceConnect(false);
    } else {
        // The ports work and are published: a relay that stays up beside them is no failure of
        // the attempt.
        logError(
            "ConnectionManager::manualPortForward - failed to stop VPN process, relay connection cannot be closed.\n");
        reportAnalytics("failed");
    }
    NetworkAddrs::getInstance()->setNetworkAddrs(attempt.externalIp, attempt.localIp);
    lastManualPortForward = true;
    attempt.result = PORTFORWARDED;
}

ConnectionType ConnectionManager::endManualAttempt(const ManualAttempt& attempt) const {
    if (attempt.mustBePublished() && !attempt.portTestPassed) reportAnalytics("failed");
    logInfo("ConnectionManager::manualPortForward - localConnectionType %d.\n", attempt.result);
    return attempt.result;
}

}  // namespace pelorus
