#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "connection/connection_manager.h"
#include "connection/mapping_names.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kHttpStartPort = 9091;
constexpr int kHttpExtendedPort = 9092;
constexpr int kHttpsStartPort = 9444;
constexpr int kHttpsExtendedPort = 9445;
constexpr int kDefaultInternalHttpPort = 80;
constexpr int kDefaultInternalHttpsPort = 443;

void reportAnalytics(const char* status) {
    TavikClient::getInstance()->sendAnalytics(status, PORTFORWARDED, SUBTYPE_AUTOMATIC);
}

int readPort(const char* key, int defaultPort) {
    int port = defaultPort;
    return scanInt(setting(key).c_str(), port) ? port : defaultPort;
}

}  // namespace

// What the stages of one attempt share.
struct ConnectionManager::DirectAttempt {
    bool bTryPortMap = false;       // the gateway can be used
    bool checkSleep = true;         // no port test while the disk sleeps
    int testResult = SKIP_TEST;     // of the last port test
    bool analyticsSent = false;     // "connecting" was reported
    bool defaultPortsOnly = false;  // no other external port may be tried
    int internalHttpPort = 0;
    int internalHttpsPort = 0;
    time_t now = 0;
    ConnectionType result = FAILED;  // when a stage ends the attempt

    void readInternalPorts() {
        internalHttpPort = readPort("INTERNAL_HTTP_PORT", kDefaultInternalHttpPort);
        internalHttpsPort = readPort("INTERNAL_HTTPS_PORT", kDefaultInternalHttpsPort);
    }
    bool endWith(ConnectionType type) {
        result = type;
        return true;
    }
};

ConnectionType ConnectionManager::createDirectConnection() {
    DirectAttempt attempt;
    clearMappedFlags();
    if (checkGateway(attempt)) return attempt.result;

    attempt.readInternalPorts();
    if (setting("MANUAL_PORT_FORWARD") == "TRUE") {
        return manualPortForward(attempt.internalHttpPort, attempt.internalHttpsPort,
                                 router().getLocalIp());
    }
    readStatusFile(attempt);
    if (!attempt.bTryPortMap) {
        logInfo(
            "ConnectionManager::createDirectConnection - failed to get connection to local router due to UPnP not working. Elapsed time %ld, portTestInterval %ld, allocatedHttpPort %d, bTryPortMap %d.\n",
            static_cast<long>(time(nullptr) - lastPortTestTime), portTestInterval,
            allocatedHttpPort, attempt.bTryPortMap);
        return giveUpMapping(attempt);
    }
    dropOutdatedMappings(attempt);
    decideSleepCheck(attempt);
    attempt.now = time(nullptr);
    logInfo(
        "ConnectionManager::createDirectConnection - Elapsed time %ld, portTestInterval %ld, allocatedHttpPort %d, allocatedHttpsPort %d.\n",
        static_cast<long>(attempt.now - lastPortTestTime), portTestInterval, allocatedHttpPort,
        allocatedHttpsPort);
    if (retestMappedPorts(attempt)) return attempt.result;
    if (!searchIsDue(attempt)) return connectionType;
    if (searchPorts(attempt)) return attempt.result;
    return httpPortMapped && httpsPortMapped ? publishMapping(attempt) : giveUpMapping(attempt);
}

// True, with the result, when the attempt ends here.
bool ConnectionManager::checkGateway(DirectAttempt& attempt) {
    if (deviceType == kMakersRouter) {
        if (router().initIpAddrBrenvik() > 0) {
            attempt.bTryPortMap = true;
            return false;
        }
        TavikClient::getInstance()->updateLocalCommStatus("failed");
        connectionType = FAILED;
        TavikClient::getInstance()->clearPortTestSuccess();
        return false;
    }
    router().discover();
    if (router().isInitialized()) {
        logInfo(
            "ConnectionManager::createDirectConnection - Router is initialized and is not a Brenvik. bTryPortMap set true.\n");
        attempt.bTryPortMap = true;
        return false;
    }
    if (allocatedHttpPort != 0 && !lastManualPortForward) return testPortsWithoutGateway(attempt);
    logInfo(
        "ConnectionManager::createDirectConnection - Don't test port since either pRouter->isInitialized %d, or allocatedHttpPort %d is 0, or lastManualPortForward %d is true.\n",
        router().isInitialized(), allocatedHttpPort, lastManualPortForward);
    return false;
}

// The gateway no longer answers, but ports forwarded earlier may still be open: as long as the
// test does not say otherwise, the device stays reachable through them.
bool ConnectionManager::testPortsWithoutGateway(DirectAttempt& attempt) {
    logInfo(
        "ConnectionManager::createDirectConnection - UPnP discovery failed, running port test to see if ports are still open.\n");
    std::string requestedIp;
    attempt.testResult = testHttpPort(requestedIp, allocatedHttpPort, false, false);
    if (attempt.testResult != SKIP_TEST) lastPortTestTime = time(nullptr);
    if (attempt.testResult != FAIL_TEST) {
        logInfo(
            "ConnectionManager::createDirectConnection - Ports are still open, remaining in Port Forwarded Mode.\n");
        return attempt.endWith(PORTFORWARDED);
    }
    logInfo("ConnectionManager::createDirectConnection - Port test returned FAIL_TEST.\n");
    return false;
}

int ConnectionManager::testHttpPort(std::string& requestedIp,
                                    int port,
                                    bool checkSleep,
                                    bool skipDoubleNatCheck) {
    std::string response;
    const int result =
        TavikClient::getInstance()->testPort(requestedIp, port, HTTP, true, checkSleep,
                                             &doubleNatDetected, skipDoubleNatCheck, response);
    if (result == PASS_TEST) setResponseExternalIP(response);
    return result;
}

void ConnectionManager::readStatusFile(DirectAttempt& attempt) {
    attempt.defaultPortsOnly = setting("DEFAULT_PORTS_ONLY") == "TRUE";
    const std::string status = setting("COMMUNICATION_STATUS");
    logInfo("ConnectionManager::createDirectConnection - Current Status in file system: [%s].\n",
            scrubSecrets(status).c_str());
    if (status == "portforwarded") {
        connectionType = PORTFORWARDED;
    } else if (status == "relayed") {
        connectionType = RELAYED;
    } else if (status == "connecting") {
        connectionType = CONNECTING;
        attempt.checkSleep = false;
    } else if (status == "failed") {
        connectionType = FAILED;
    }
    logInfo(
        "ConnectionManager::createDirectConnection - Pelorus Status in Memory: [%d]. (0:NONE, 1:portforwarded, 2:relayed, 3:connecting, 4:failed/disabled).\n\n",
        connectionType);
}

// Mappings made for another address, or on a port that is no longer allowed, are removed. The
// first attempt comes here too, with external port 0: a UPnP gateway refuses that, a NAT-PMP one
// removes whatever an earlier run left for the internal port.
void ConnectionManager::dropOutdatedMappings(const DirectAttempt& attempt) {
    if (!router().hasExternalIpChanged() && !router().hasLocalIpChanged() &&
        !(attempt.defaultPortsOnly && allocatedHttpPort != kHttpStartPort)) {
        return;
    }
    logNotice(
        "ConnectionManager::createDirectConnection - Resetting HTTP allocated ports due to external or local IP change: [%d] / Default Port Only: [%d].\n",
        allocatedHttpPort, attempt.defaultPortsOnly);
    unmapAllocatedPorts(attempt);
}

void ConnectionManager::unmapAllocatedPorts(const DirectAttempt& attempt) {
    unmapDevicePort(attempt.internalHttpPort, allocatedHttpPort);
    unmapDevicePort(attempt.internalHttpsPort, allocatedHttpsPort);
    allocatedHttpPort = 0;
    allocatedHttpsPort = 0;
}

void ConnectionManager::unmapDevicePort(int internalPort, int externalPort) {
    if (deviceType == kMakersRouter) {
        router().unmapPortBrenvik(internalPort, externalPort, kTcp);
    } else {
        router().unmapPort(internalPort, externalPort, kTcp);
    }
}

void ConnectionManager::clearMappedFlags() {
    httpPortMapped = false;
    httpsPortMapped = false;
}

// A new address or a forced attempt is worth waking the disk for.
void ConnectionManager::decideSleepCheck(DirectAttempt& attempt) {
    attempt.checkSleep =
        !(router().hasExternalIpChanged() || router().hasLocalIpChanged() || forceConnect);
}

// True, with the result, when the ports of an earlier attempt settle this one.
bool ConnectionManager::retestMappedPorts(DirectAttempt& attempt) {
    if (allocatedHttpPort < 1 || allocatedHttpsPort < 1) return false;
    router().CheckExpiredMappings();
    if (!forceConnect && attempt.now - lastPortTestTime <= portTestInterval) {
        logInfo(
            "ConnectionManager::createDirectConnection() - Ignore Port Test due to Interval %ld.\n",
            portTestInterval);
        return attempt.endWith(PORTFORWARDED);
    }
    logInfo(
        "ConnectionManager::createDirectConnection - Running port test for mapped ports in PORTFORWARDED HTTP:[%d] / HTTPS:[%d].\n",
        allocatedHttpPort, allocatedHttpsPort);
    if (forceConnect) reportAnalytics("connecting");
    std::string requestedIp = router().getExternalIp();
    attempt.testResult = testHttpPort(requestedIp, allocatedHttpPort, attempt.checkSleep, false);
    const bool failed = attempt.testResult == FAIL_TEST;
    if (forceConnect) reportAnalytics(failed ? "failed" : "portforwarded");
    if (attempt.testResult != SKIP_TEST) lastPortTestTime = attempt.now;

    if (failed && doubleNatDetected) {
        logInfo(
            "ConnectionManager::createDirectConnection() - FAIL - Port Test, Double-NAT detected, switching to RELAY \n");
        clearMappedFlags();
        return attempt.endWith(FAILED);
    }
    if (failed) return false;
    // A test that was skipped counts as passed: nothing speaks against the ports.
    logInfo(
        "ConnectionManager::createDirectConnection() - testPort success %d, current connectionType %d. Going to PORTFORWARDED.\n",
        attempt.testResult, connectionType);
    return attempt.endWith(PORTFORWARDED);
}

bool ConnectionManager::searchIsDue(const DirectAttempt& attempt) {
    if (!attempt.checkSleep || attempt.testResult == FAIL_TEST ||
        (connectionType == RELAYED && router().isInitialized()) ||
        attempt.now - lastPortTestTime > portTestInterval) {
        return true;
    }
    logInfo(
        "ConnectionManager::createDirectConnection() - Skip testing port due to interval or nothing changed IP(RELAY OR failed PF).\n");
    return false;
}

// True, with the result, when a double NAT makes the attempt hopeless.
bool ConnectionManager::searchPorts(DirectAttempt& attempt) {
    logInfo(
        "ConnectionManager::createDirectConnection: Check Sleep Mode:[%d](0:ignore, 1:check sleep), Test Result of Portforward: [%d](1:skip, 2:fail, 3:pass), connectionType %d.\n",
        attempt.checkSleep, attempt.testResult, connectionType);
    reportAnalytics("connecting");
    attempt.analyticsSent = true;
    // While relayed, each search starts a new interval.
    if (connectionType == RELAYED && attempt.checkSleep) lastPortTestTime = attempt.now;
    if (attempt.testResult == FAIL_TEST) {
        router().discover();
        decideSleepCheck(attempt);
    }
    if (connectionType == CONNECTING || prevConnectionType == FAILED) attempt.checkSleep = false;

    allocatedHttpPort = forwardPort(attempt.internalHttpPort, kHttpStartPort, kHttpExtendedPort,
                                    router().getExternalIp(), HTTP, kHttpDescription,
                                    attempt.defaultPortsOnly, attempt.checkSleep);
    logInfo("ConnectionManager::createDirectConnection() - HTTP allocatedHttpPort: [%d].\n",
            allocatedHttpPort);
    httpPortMapped = allocatedHttpPort != 0;
    if (doubleNatDetected) {
        clearMappedFlags();
        reportAnalytics("failed");
        return attempt.endWith(FAILED);
    }
    allocatedHttpsPort =
        httpPortMapped ? forwardPort(attempt.internalHttpsPort, kHttpsStartPort, kHttpsExtendedPort,
                                     router().getExternalIp(), HTTPS, kHttpsDescription,
                                     attempt.defaultPortsOnly, attempt.checkSleep)
                       : 0;
    logInfo("ConnectionManager::createDirectConnection() - HTTPS allocatedHttpsPort: [%d].\n",
            allocatedHttpsPort);
    httpsPortMapped = allocatedHttpsPort != 0;
    return false;
}

ConnectionType ConnectionManager::publishMapping(const DirectAttempt& attempt) {
    logInfo(
        "ConnectionManager::createDirectConnection() - success - internal Http Port: [%d] is mapped to external Port: [%d].\n",
        attempt.internalHttpPort, allocatedHttpPort);
    logInfo(
        "ConnectionManager::createDirectConnection() - success - internal Https Port: [%d] is mapped to external Port: [%d].\n",
        attempt.internalHttpsPort, allocatedHttpsPort);
    auto* client = TavikClient::getInstance();
    if (!client->updateServerMapping(router().getExternalIp(), allocatedHttpPort,
                                     allocatedHttpsPort, router().getLocalIp(),
                                     attempt.internalHttpPort, attempt.internalHttpsPort)) {
        // Nothing is deleted: ports and mappings stay, and the next attempt tests them again.
        logError(
            "ConnectionManager::createDirectConnection() - failed to update mapping info, attempting to delete server mapping.\n");
        reportAnalytics("failed");
        clearMappedFlags();
        logInfo(
            "ConnectionManager::createDirectConnection() - Failed trying automatic port test. Resume or try RELAY mode.\n");
        return FAILED;
    }
    if (!VPNManager::getInstance()->closeVPNConnection()) {
        logError("ConnectionManager::createDirectConnection() - failed to stop VPN process.\n");
    }
    reportAnalytics("portforwarded");
    client->updateLocalCommStatus("portforwarded");
    setForceConnect(false);
    lastManualPortForward = false;
    return PORTFORWARDED;
}

ConnectionType ConnectionManager::giveUpMapping(const DirectAttempt& attempt) {
    clearMappedFlags();
    unmapAllocatedPorts(attempt);
    if (attempt.analyticsSent) reportAnalytics("failed");
    logInfo(
        "ConnectionManager::createDirectConnection() - Failed trying automatic port test. Resume or try RELAY mode.\n");
    return FAILED;
}

}  // namespace pelorus
