#include "connection/direct_attempt.h"

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "connection/port_forwarding.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kHttpStartPort = 9091;
constexpr int kHttpExtendedPort = 9092;
constexpr int kHttpsStartPort = 9444;
constexpr int kHttpsExtendedPort = 9445;
constexpr int kDefaultInternalHttpPort = 80;
constexpr int kDefaultInternalHttpsPort = 443;

}  // namespace

ConnectionType DirectAttempt::run() {
    manager.clearMappedFlags();
    if (const auto result = checkGateway()) return *result;

    readInternalPorts();
    if (setting("MANUAL_PORT_FORWARD") == "TRUE") {
        return manager.manualPortForward(internalHttpPort, internalHttpsPort,
                                         manager.router().getLocalIp());
    }
    readStatusFile();
    if (!bTryPortMap) {
        logInfo(
            "ConnectionManager::createDirectConnection - failed to get connection to local router due to UPnP not working. Elapsed time %jd, portTestInterval %jd, allocatedHttpPort %d, bTryPortMap %d.\n",
            static_cast<std::int64_t>(time(nullptr) - manager.lastPortTestTime),
            manager.portTestInterval, manager.allocatedHttpPort, bTryPortMap);
        return giveUpMapping();
    }
    dropOutdatedMappings();
    decideSleepCheck();
    now = time(nullptr);
    logInfo(
        "ConnectionManager::createDirectConnection - Elapsed time %jd, portTestInterval %jd, allocatedHttpPort %d, allocatedHttpsPort %d.\n",
        now - manager.lastPortTestTime, manager.portTestInterval, manager.allocatedHttpPort,
        manager.allocatedHttpsPort);
    if (const auto result = retestMappedPorts()) return *result;
    if (!searchIsDue()) return manager.connectionType;
    if (const auto result = searchPorts()) return *result;
    return manager.httpPortMapped && manager.httpsPortMapped ? publishMapping() : giveUpMapping();
}

std::optional<ConnectionType> DirectAttempt::checkGateway() {
    if (manager.deviceType == kMakersRouter) {
        if (manager.router().initIpAddrBrenvik() > 0) {
            bTryPortMap = true;
            return std::nullopt;
        }
        TavikClient::getInstance()->updateLocalCommStatus("failed");
        manager.connectionType = FAILED;
        TavikClient::getInstance()->clearPortTestSuccess();
        return std::nullopt;
    }
    manager.router().discover();
    if (manager.router().isInitialized()) {
        logInfo(
            "ConnectionManager::createDirectConnection - Router is initialized and is not a Brenvik. bTryPortMap set true.\n");
        bTryPortMap = true;
        return std::nullopt;
    }
    if (manager.allocatedHttpPort != 0 && !manager.lastManualPortForward) {
        return testPortsWithoutGateway();
    }
    logInfo(
        "ConnectionManager::createDirectConnection - Don't test port since either pRouter->isInitialized %d, or allocatedHttpPort %d is 0, or lastManualPortForward %d is true.\n",
        manager.router().isInitialized(), manager.allocatedHttpPort, manager.lastManualPortForward);
    return std::nullopt;
}

// The gateway no longer answers, but ports forwarded earlier may still be open: unless the test
// fails, the device counts as reachable through them. The disk is not asked.
std::optional<ConnectionType> DirectAttempt::testPortsWithoutGateway() {
    logInfo(
        "ConnectionManager::createDirectConnection - UPnP discovery failed, running port test to see if ports are still open.\n");
    std::string requestedIp;
    testResult = manager.testHttpPort(requestedIp, manager.allocatedHttpPort, false, false);
    if (testResult != SKIP_TEST) manager.lastPortTestTime = time(nullptr);
    if (testResult != FAIL_TEST) {
        logInfo(
            "ConnectionManager::createDirectConnection - Ports are still open, remaining in Port Forwarded Mode.\n");
        return PORTFORWARDED;
    }
    logInfo("ConnectionManager::createDirectConnection - Port test returned FAIL_TEST.\n");
    return std::nullopt;
}

void DirectAttempt::readInternalPorts() {
    internalHttpPort = readPort("INTERNAL_HTTP_PORT", kDefaultInternalHttpPort);
    internalHttpsPort = readPort("INTERNAL_HTTPS_PORT", kDefaultInternalHttpsPort);
}

void DirectAttempt::readStatusFile() {
    defaultPortsOnly = setting("DEFAULT_PORTS_ONLY") == "TRUE";
    const std::string status = setting("COMMUNICATION_STATUS");
    logInfo("ConnectionManager::createDirectConnection - Current Status in file system: [%s].\n",
            scrubSecrets(status).c_str());
    if (status == "portforwarded") {
        manager.connectionType = PORTFORWARDED;
    } else if (status == "relayed") {
        manager.connectionType = RELAYED;
    } else if (status == "connecting") {
        manager.connectionType = CONNECTING;
    } else if (status == "failed") {
        manager.connectionType = FAILED;
    }
    logInfo(
        "ConnectionManager::createDirectConnection - Pelorus Status in Memory: [%d]. (0:NONE, 1:portforwarded, 2:relayed, 3:connecting, 4:failed/disabled).\n\n",
        manager.connectionType);
}

// Removes mappings made for another address or on a port that is no longer allowed. The first
// attempt gets here too, with external port 0: a UPnP gateway refuses that, a NAT-PMP one removes
// whatever an earlier run left for the internal port.
void DirectAttempt::dropOutdatedMappings() {
    if (!manager.router().hasExternalIpChanged() && !manager.router().hasLocalIpChanged() &&
        !(defaultPortsOnly && manager.allocatedHttpPort != kHttpStartPort)) {
        return;
    }
    logNotice(
        "ConnectionManager::createDirectConnection - Resetting HTTP allocated ports due to external or local IP change: [%d] / Default Port Only: [%d].\n",
        manager.allocatedHttpPort, defaultPortsOnly);
    unmapAllocatedPorts();
}

void DirectAttempt::unmapAllocatedPorts() {
    manager.unmapDevicePort(internalHttpPort, manager.allocatedHttpPort);
    manager.unmapDevicePort(internalHttpsPort, manager.allocatedHttpsPort);
    manager.forgetPorts();
}

// A new address or a forced attempt is worth waking the disk for.
void DirectAttempt::decideSleepCheck() {
    checkSleep = !(manager.router().hasExternalIpChanged() ||
                   manager.router().hasLocalIpChanged() || manager.forceConnect);
}

// Ends the attempt when the ports mapped earlier still work, or when no port can.
std::optional<ConnectionType> DirectAttempt::retestMappedPorts() {
    if (manager.allocatedHttpPort < 1 || manager.allocatedHttpsPort < 1) return std::nullopt;
    manager.router().CheckExpiredMappings();
    if (!manager.forceConnect && now - manager.lastPortTestTime <= manager.portTestInterval) {
        logInfo(
            "ConnectionManager::createDirectConnection() - Ignore Port Test due to Interval %jd.\n",
            manager.portTestInterval);
        return PORTFORWARDED;
    }
    logInfo(
        "ConnectionManager::createDirectConnection - Running port test for mapped ports in PORTFORWARDED HTTP:[%d] / HTTPS:[%d].\n",
        manager.allocatedHttpPort, manager.allocatedHttpsPort);
    if (manager.forceConnect) reportAnalytics("connecting", SUBTYPE_AUTOMATIC);
    std::string requestedIp = manager.router().getExternalIp();
    testResult = manager.testHttpPort(requestedIp, manager.allocatedHttpPort, checkSleep, false);
    const bool failed = testResult == FAIL_TEST;
    if (manager.forceConnect) {
        reportAnalytics(failed ? "failed" : "portforwarded", SUBTYPE_AUTOMATIC);
    }
    if (testResult != SKIP_TEST) manager.lastPortTestTime = static_cast<time_t>(now);

    if (failed && manager.doubleNatDetected) {
        logInfo(
            "ConnectionManager::createDirectConnection() - FAIL - Port Test, Double-NAT detected, switching to RELAY \n");
        manager.clearMappedFlags();
        return FAILED;
    }
    if (failed) return std::nullopt;
    // A skipped test counts as passed: there is no evidence against the ports.
    logInfo(
        "ConnectionManager::createDirectConnection() - testPort success %d, current connectionType %d. Going to PORTFORWARDED.\n",
        testResult, manager.connectionType);
    return PORTFORWARDED;
}

bool DirectAttempt::searchIsDue() {
    if (!checkSleep || testResult == FAIL_TEST ||
        (manager.connectionType == RELAYED && manager.router().isInitialized()) ||
        now - manager.lastPortTestTime > manager.portTestInterval) {
        return true;
    }
    logInfo(
        "ConnectionManager::createDirectConnection() - Skip testing port due to interval or nothing changed IP(RELAY OR failed PF).\n");
    return false;
}

// Ends the attempt when a double NAT makes it hopeless.
std::optional<ConnectionType> DirectAttempt::searchPorts() {
    logInfo(
        "ConnectionManager::createDirectConnection: Check Sleep Mode:[%d](0:ignore, 1:check sleep), Test Result of Portforward: [%d](1:skip, 2:fail, 3:pass), connectionType %d.\n",
        checkSleep, testResult, manager.connectionType);
    reportAnalytics("connecting", SUBTYPE_AUTOMATIC);
    analyticsSent = true;
    // While relayed, each search starts a new interval.
    if (manager.connectionType == RELAYED && checkSleep)
        manager.lastPortTestTime = static_cast<time_t>(now);
    if (testResult == FAIL_TEST) {
        manager.router().discover();
        decideSleepCheck();
    }
    if (manager.connectionType == CONNECTING || manager.prevConnectionType == FAILED) {
        checkSleep = false;
    }

    manager.allocatedHttpPort = forwardHttpPort();
    logInfo("ConnectionManager::createDirectConnection() - HTTP allocatedHttpPort: [%d].\n",
            manager.allocatedHttpPort);
    manager.httpPortMapped = manager.allocatedHttpPort != 0;
    if (manager.doubleNatDetected) {
        manager.clearMappedFlags();
        reportAnalytics("failed", SUBTYPE_AUTOMATIC);
        return FAILED;
    }
    manager.allocatedHttpsPort = manager.httpPortMapped ? forwardHttpsPort() : 0;
    logInfo("ConnectionManager::createDirectConnection() - HTTPS allocatedHttpsPort: [%d].\n",
            manager.allocatedHttpsPort);
    manager.httpsPortMapped = manager.allocatedHttpsPort != 0;
    return std::nullopt;
}

int DirectAttempt::forwardHttpPort() {
    return manager.forwardPort(internalHttpPort, kHttpStartPort, kHttpExtendedPort,
                               manager.router().getExternalIp(), HTTP, kHttpDescription,
                               defaultPortsOnly, checkSleep);
}

int DirectAttempt::forwardHttpsPort() {
    return manager.forwardPort(internalHttpsPort, kHttpsStartPort, kHttpsExtendedPort,
                               manager.router().getExternalIp(), HTTPS, kHttpsDescription,
                               defaultPortsOnly, checkSleep);
}

ConnectionType DirectAttempt::publishMapping() {
    logInfo(
        "ConnectionManager::createDirectConnection() - success - internal Http Port: [%d] is mapped to external Port: [%d].\n",
        internalHttpPort, manager.allocatedHttpPort);
    logInfo(
        "ConnectionManager::createDirectConnection() - success - internal Https Port: [%d] is mapped to external Port: [%d].\n",
        internalHttpsPort, manager.allocatedHttpsPort);
    auto* client = TavikClient::getInstance();
    if (!client->updateServerMapping(manager.router().getExternalIp(), manager.allocatedHttpPort,
                                     manager.allocatedHttpsPort, manager.router().getLocalIp(),
                                     internalHttpPort, internalHttpsPort)) {
        // Nothing is deleted, whatever the line says: the next attempt tests the ports again.
        logError(
            "ConnectionManager::createDirectConnection() - failed to update mapping info, attempting to delete server mapping.\n");
        reportAnalytics("failed", SUBTYPE_AUTOMATIC);
        return endInFailure();
    }
    if (!VPNManager::getInstance()->closeVPNConnection()) {
        logError("ConnectionManager::createDirectConnection() - failed to stop VPN process.\n");
    }
    reportAnalytics("portforwarded", SUBTYPE_AUTOMATIC);
    client->updateLocalCommStatus("portforwarded");
    manager.setForceConnect(false);
    manager.lastManualPortForward = false;
    return PORTFORWARDED;
}

ConnectionType DirectAttempt::giveUpMapping() {
    unmapAllocatedPorts();
    if (analyticsSent) reportAnalytics("failed", SUBTYPE_AUTOMATIC);
    return endInFailure();
}

ConnectionType DirectAttempt::endInFailure() {
    manager.clearMappedFlags();
    logInfo(
        "ConnectionManager::createDirectConnection() - Failed trying automatic port test. Resume or try RELAY mode.\n");
    return FAILED;
}

}  // namespace pelorus
