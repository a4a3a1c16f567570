#include <algorithm>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/text.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"

namespace pelorus {

namespace {

constexpr long kShortestPortTestInterval = 240;        // seconds
constexpr long kLongestPortTestInterval = 960;         // seconds
constexpr long kPortTestIntervalStep = 120;            // seconds
constexpr long kDefaultDnsCheckInterval = 24L * 3600;  // seconds
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
            responseExternalIP.c_str());
    if (connectionType == PORTFORWARDED || connectionType == RELAYED) noteConnectionType();
    return connectionType;
}

// Counts the cycles in which a working connection stayed what it was.
void ConnectionManager::noteConnectionType() {
    if (connectionType != prevConnectionType) {
        setForceDNSCheck(true);
        connTypeUnchangedCount = 0;
        portTestInterval = kShortestPortTestInterval;
        // The line says that the last port test time was set; it is only shown.
        logInfo(
            "ConnectionManager::createConnection() - connection type changed to %d, port test interval reset to %ld, last port test time set to %ld, connTypeUnchangedCount %d, forceDNSCheck=true.\n",
            connectionType, portTestInterval, static_cast<long>(lastPortTestTime),
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
        "ConnectionManager::createConnection() - connection type un-changed, increased port test interval to %ld.\n",
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

}  // namespace pelorus
