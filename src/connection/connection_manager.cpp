#include "connection/connection_manager.h"

#include <algorithm>
#include <utility>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "connection/direct_attempt.h"
#include "connection/dns_check.h"
#include "connection/forward_search.h"
#include "connection/manual_attempt.h"
#include "connection/port_forwarding.h"

namespace pelorus {

namespace {

constexpr std::int64_t kShortestPortTestInterval = 240;                     // seconds
constexpr std::int64_t kLongestPortTestInterval = 960;                      // seconds
constexpr std::int64_t kPortTestIntervalStep = 120;                         // seconds
constexpr std::int64_t kDefaultDnsCheckInterval = std::int64_t{24} * 3600;  // seconds
constexpr int kUnchangedCyclesPerStep = 3;

}  // namespace

ClearDNSCheck::~ClearDNSCheck() {
    if (pManager == nullptr) return;
    pManager->setForceDNSCheck(false);
    pManager->setPrevDNSCheckTime(time(nullptr));
}

ConnectionManager::ConnectionManager()
    : deviceType(leadingInt(setting("DEVICETYPE"))),
      portTestInterval(kShortestPortTestInterval),
      dnsCheckInterval(kDefaultDnsCheckInterval),
      prevDNSCheckTime(time(nullptr)) {
}

ConnectionManager* ConnectionManager::getInstance() {
    static ConnectionManager instance;
    return &instance;
}

Router& ConnectionManager::router() {
    if (!pRouter) pRouter = std::make_unique<Router>();
    return *pRouter;
}

void ConnectionManager::checkConnection(ConnectionType current) {
    if (checkDNS(current)) return;
    TavikClient::getInstance()->sendAnalytics("failed", current, SUBTYPE_NONE);
    TavikClient::getInstance()->updateLocalCommStatus("failed");
    logInfo(
        "ConnectionManager::checkConnection - nslookup failed or does not match local value, kill existing connections.\n");
    killConnection(PORTFORWARDED);
    killConnection(RELAYED);
    setForceConnect(true);
}

ConnectionType ConnectionManager::createConnection() {
    prevConnectionType = connectionType;
    logInfo(
        "--------------------------------------------------------------------------------------\n");
    logInfo(
        "ConnectionManager::createConnection() - checking status & attempting direct connection. Current connection type %d.\n",
        prevConnectionType);
    if (setting("DEVICEID").empty() || setting("DEVICEAUTH").empty()) {
        logInfo(
            "ConnectionManager::createConnection() - Deviceid and DeviceAuth is empty. Idle Process.\n");
        return FAILED;
    }
    connectionType = createDirectConnection();
    if (connectionType == FAILED) {
        logInfo(
            "ConnectionManager::createConnection() - port-forwarding failed, [attempting relay connection].\n");
        connectionType = createRelayConnection();
    }
    logInfo("ConnectionManager::createConnection() - port test response remote external IP [%s]\n",
            scrubSecrets(responseExternalIP).c_str());
    if (connectionType == PORTFORWARDED || connectionType == RELAYED) noteConnectionType();
    return connectionType;
}

// Counts the cycles in which a working connection kept its type.
void ConnectionManager::noteConnectionType() {
    if (connectionType != prevConnectionType) {
        setForceDNSCheck(true);
        connTypeUnchangedCount = 0;
        portTestInterval = kShortestPortTestInterval;
        // The line says that the last port test time was set; it is only printed.
        logInfo(
            "ConnectionManager::createConnection() - connection type changed to %d, port test interval reset to %jd, last port test time set to %jd, connTypeUnchangedCount %d, forceDNSCheck=true.\n",
            connectionType, portTestInterval, static_cast<std::int64_t>(lastPortTestTime),
            connTypeUnchangedCount);
        return;
    }
    logInfo(
        "ConnectionManager::createConnection() - connection type %d un-changed. connTypeUnchangedCount %d, forceDNSCheck=false\n",
        connectionType, connTypeUnchangedCount);
    if (++connTypeUnchangedCount <= kUnchangedCyclesPerStep) return;
    connTypeUnchangedCount = 0;
    increasePortTestInterval();
    logInfo(
        "ConnectionManager::createConnection() - connection type un-changed, increased port test interval to %jd.\n",
        portTestInterval);
}

void ConnectionManager::increasePortTestInterval() {
    portTestInterval = std::min(portTestInterval + kPortTestIntervalStep, kLongestPortTestInterval);
}

void ConnectionManager::setForceConnect(bool force) {
    forceConnect = force;
    logInfo("ConnectionManager::setForceConnect = %d\n", forceConnect ? 1 : 0);
}

void ConnectionManager::setReqPortMappingLifetime(unsigned upnp, unsigned natpmp) {
    router().setReqPortMappingLifetime(upnp, natpmp);
}

void ConnectionManager::getReqPortMappingLifetime(unsigned& upnp, unsigned& natpmp) const {
    upnp = Router::INVALID_LEASE_DURATION;
    natpmp = Router::INVALID_LEASE_DURATION;
    if (!pRouter) {
        logWarning("ConnectionManager::getReqPortMappingLifetime - UPnP lifetimes not set yet\n");
        return;
    }
    pRouter->getReqPortMappingLifetime(upnp, natpmp);
}

ConnectionType ConnectionManager::createDirectConnection() {
    return DirectAttempt{*this}.run();
}

int ConnectionManager::forwardPort(int internalPort,
                                   int startPort,
                                   int extendedStartPort,
                                   const std::string& externalIp,
                                   HttpType type,
                                   const std::string& description,
                                   bool defaultPortsOnly,
                                   bool checkSleep) {
    return ForwardSearch{*this,
                         {internalPort, startPort, extendedStartPort, externalIp, type, description,
                          defaultPortsOnly, checkSleep}}
        .run();
}

ConnectionType ConnectionManager::manualPortForward(int internalHttpPort,
                                                    int internalHttpsPort,
                                                    std::string localIp) {
    return ManualAttempt{*this, internalHttpPort, internalHttpsPort, std::move(localIp)}.run();
}

bool ConnectionManager::checkDNS(ConnectionType type) {
    return DnsCheck{*this, type}.run();
}

std::string ConnectionManager::convertEnumConnectionType(ConnectionType type) {
    switch (type) {
        case NONE:
            return "disabled";
        case PORTFORWARDED:
            return "portforwarded";
        case RELAYED:
            return "relayed";
        case CONNECTING:
            return "connecting";
        case FAILED:
            break;
    }
    return "failed";
}

void ConnectionManager::clearMappedFlags() {
    httpPortMapped = false;
    httpsPortMapped = false;
}

void ConnectionManager::forgetPorts() {
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

int ConnectionManager::testHttpPort(std::string& requestedIp,
                                    int externalPort,
                                    bool checkSleep,
                                    bool skipDoubleNatCheck) {
    std::string response;
    const int result =
        TavikClient::getInstance()->testPort(requestedIp, externalPort, HTTP, true, checkSleep,
                                             &doubleNatDetected, skipDoubleNatCheck, response);
    if (result == PASS_TEST) setResponseExternalIP(response);
    return result;
}

}  // namespace pelorus
