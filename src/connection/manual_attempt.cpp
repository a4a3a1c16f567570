#include "connection/manual_attempt.h"

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "config/scrub.h"
#include "connection/network_addrs.h"
#include "connection/port_forwarding.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kHighestPort = 65535;

bool isPort(int port) {
    return port >= 1 && port <= kHighestPort;
}

}  // namespace

ConnectionType ManualAttempt::run() {
    manager.clearMappedFlags();
    if (!readExternalPorts()) return FAILED;
    logInfo(
        "ConnectionManager::manualPortForward - allocatedHttpPort %d, manualHttpPort %d, allocatedHttpsPort %d, manualHttpsPort %d.\n",
        manager.allocatedHttpPort, externalHttpPort, manager.allocatedHttpsPort, externalHttpsPort);
    if (!manager.lastManualPortForward) leaveAutomaticForwarding();
    detectChanges();

    forced = manager.forceConnect;
    now = time(nullptr);
    logInfo(
        "ConnectionManager::manualPortForward - Elapsed time %jd, portTestInterval %jd, manualPortForwardChange %d, lastManualPortForward %d, forceConnect %d\n",
        now - manager.lastPortTestTime, manager.portTestInterval, changed,
        manager.lastManualPortForward, manager.forceConnect);
    if (!testIsDue()) {
        result = manager.connectionType;
    } else if (manager.doubleNatDetected) {
        // No manual test runs any more, so only an automatic one can clear the flag.
        logInfo(
            "ConnectionManager::manualPortForward - relay mode is enforced, therefore don't manual forward ports.\n");
        return FAILED;
    } else {
        testPort();
    }
    conclude();
    return result;
}

bool ManualAttempt::readExternalPorts() {
    externalHttpPort = readPort("MANUAL_EXTERNAL_HTTP_PORT", 0);
    externalHttpsPort = readPort("MANUAL_EXTERNAL_HTTPS_PORT", 0);
    if (!isPort(externalHttpPort)) {
        logError(
            "ConnectionManager::manualPortForward - bad value for manually configured HTTP Port.\n");
        return false;
    }
    if (!isPort(externalHttpsPort)) {
        logError(
            "ConnectionManager::manualPortForward - bad value for manually configured HTTPS Port.\n");
        return false;
    }
    return true;
}

// The user took over: removes what this daemon mapped, provided that the gateway answers.
void ManualAttempt::leaveAutomaticForwarding() {
    Router& router = manager.router();
    if (!router.isInitialized()) router.discover();
    if (!router.isInitialized()) return;
    logInfo("ConnectionManager::manualPortForward - unmapping existing ports.\n");
    router.unmapAllPorts(kTcp, kHttpDescription);
    router.unmapAllPorts(kTcp, kHttpsDescription);
    manager.forgetPorts();
}

// Until hand-forwarded ports have been published, every attempt counts as a change.
void ManualAttempt::detectChanges() {
    auto* addresses = NetworkAddrs::getInstance();
    changed = !manager.lastManualPortForward || externalHttpPort != manager.allocatedHttpPort ||
              externalHttpsPort != manager.allocatedHttpsPort;
    if (!manager.lastManualPortForward) {
        addresses->init();
        return;
    }
    if (addresses->discoverNetworkAddrs() != 1 || !addresses->haveNetworkAddrsChanged()) return;
    changed = true;
    logInfo(
        "ConnectionManager::manualPortForward - detected change to external IP [%s] or local IP [%s]\n",
        scrubSecrets(addresses->getExternalIp()).c_str(), addresses->getLocalIp().c_str());
}

bool ManualAttempt::testIsDue() {
    if (mustBePublished() || now - manager.lastPortTestTime > manager.portTestInterval) return true;
    logInfo(
        "ConnectionManager::manualPortForward - Not time to do port test, or manual ports not changed on NAS.\n");
    return false;
}

// Tests the HTTP port only; the HTTPS one is taken on trust.
void ManualAttempt::testPort() {
    logInfo(
        "ConnectionManager::manualPortForward - Running port test for manually forwarded ports.\n");
    if (mustBePublished()) reportAnalytics("connecting", SUBTYPE_MANUAL);
    const int testResult =
        manager.testHttpPort(externalIp, externalHttpPort, !mustBePublished(), true);
    if (testResult == SKIP_TEST) {
        result = manager.connectionType;
        return;
    }
    manager.lastPortTestTime = static_cast<time_t>(now);
    if (testResult != PASS_TEST) return;
    portTestPassed = true;
    manager.allocatedHttpPort = externalHttpPort;
    manager.allocatedHttpsPort = externalHttpsPort;
}

void ManualAttempt::conclude() {
    if (mustBePublished() && portTestPassed) {
        publish();
    } else if (portTestPassed) {
        result = PORTFORWARDED;
    } else {
        logInfo(
            "ConnectionManager::manualPortForward - port test was skipped, failed or no change in manually forwarded ports.\n");
    }
    if (mustBePublished() && !portTestPassed) reportAnalytics("failed", SUBTYPE_MANUAL);
    logInfo("ConnectionManager::manualPortForward - localConnectionType %d.\n", result);
}

void ManualAttempt::publish() {
    logInfo(
        "ConnectionManager::manualPortForward - success - internal Http Port: [%d] is mapped to external Port: [%d].\n",
        internalHttpPort, manager.allocatedHttpPort);
    logInfo(
        "ConnectionManager::manualPortForward - success - internal Https Port: [%d] is mapped to external Port: [%d].\n",
        internalHttpsPort, manager.allocatedHttpsPort);
    if (!TavikClient::getInstance()->updateServerMapping(externalIp, manager.allocatedHttpPort,
                                                         manager.allocatedHttpsPort, localIp,
                                                         internalHttpPort, internalHttpsPort)) {
        logError(
            "ConnectionManager::manualPortForward - failed to update port mapping on server.\n");
        reportAnalytics("failed", SUBTYPE_MANUAL);
        result = FAILED;
        return;
    }
    logInfo(
        "ConnectionManager::manualPortForward - successfully updated port mapping on server.\n");
    stopRelay();
    NetworkAddrs::getInstance()->setNetworkAddrs(externalIp, localIp);
    manager.lastManualPortForward = true;
    result = PORTFORWARDED;
}

// The ports work and are published: a relay that cannot be stopped does not fail the attempt.
void ManualAttempt::stopRelay() {
    if (!VPNManager::getInstance()->closeVPNConnection()) {
        logError(
            "ConnectionManager::manualPortForward - failed to stop VPN process, relay connection cannot be closed.\n");
        reportAnalytics("failed", SUBTYPE_MANUAL);
        return;
    }
    reportAnalytics("portforwarded", SUBTYPE_MANUAL);
    TavikClient::getInstance()->updateLocalCommStatus("portforwarded");
    manager.httpPortMapped = true;
    manager.httpsPortMapped = true;
    manager.setForceConnect(false);
}

}  // namespace pelorus
