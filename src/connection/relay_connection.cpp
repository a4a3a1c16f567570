#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/text.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"
#include "connection/port_forwarding.h"
#include "relay/vpn_manager.h"

namespace pelorus {

ConnectionType ConnectionManager::createRelayConnection() {
    if (httpPortMapped && httpsPortMapped) return PORTFORWARDED;
    auto* client = TavikClient::getInstance();
    ConnectionType result = FAILED;
    if (VPNManager::getInstance()->isVPNRunning()) {
        client->updateLocalCommStatus("relayed");
        result = RELAYED;
        logInfo("ConnectionManager::createRelayConnection() - openVPN process is running.\n");
        setForceConnect(false);
    } else if (client->serverRequestedSleep()) {
        logInfo(
            "ConnectionManager::createRelayConnection() - server requested sleep, therefore openVPN will not be started, and this relay connection creation attempt will return failure.\n");
        return FAILED;
    } else {
        result = startRelay();
    }
    if (router().hasLocalIpChanged()) {
        client->updateRemoteCommStatus(router().getLocalIp());
        logNotice(
            "ConnectionManager::createRelayConnection() - local IP address has changed! Updating server with new address.\n");
    }
    if (result == RELAYED) lastManualPortForward = false;
    return result;
}

// Withdraws the direct path from the server and starts the tunnel. The gateway keeps its mappings.
ConnectionType ConnectionManager::startRelay() {
    auto* client = TavikClient::getInstance();
    logInfo("ConnectionManager::createRelayConnection() - creating VPN connection.\n");
    client->sendAnalytics("connecting", RELAYED, SUBTYPE_NONE);
    const int internalHttpPort = leadingInt(setting("INTERNAL_HTTP_PORT"));
    if (client->deleteServerMapping(internalHttpPort, router().getLocalIp())) {
        logInfo(
            "ConnectionManager::createRelayConnection() - deleted port mappings from server.\n");
    } else {
        logError(
            "ConnectionManager:createRelayConnection() - failed to delete port mapping info.\n");
    }
    forgetPorts();
    logInfo(
        "ConnectionManager::createRelayConnection() - attempting to open VPN relay connection.\n");
    if (!VPNManager::getInstance()->openVPNConnection()) {
        client->sendAnalytics("failed", RELAYED, SUBTYPE_NONE);
        client->updateLocalCommStatus("failed");
        logError("ConnectionManager::createRelayConnection() - failed to create VPN connection.\n");
        return FAILED;
    }
    client->sendAnalytics("relayed", RELAYED, SUBTYPE_NONE);
    client->updateLocalCommStatus("relayed");
    setForceConnect(false);
    return RELAYED;
}

void ConnectionManager::killConnection(ConnectionType type) {
    if (type == PORTFORWARDED) {
        removeMappings();
    } else if (type == RELAYED) {
        VPNManager::getInstance()->closeVPNConnection();
    }
}

void ConnectionManager::removeMappings() {
    if (!pRouter) {
        if (deviceType != kMakersRouter && !router().discover()) return;
        if (router().hasLocalIpChanged()) {
            TavikClient::getInstance()->updateRemoteCommStatus(router().getLocalIp());
            logInfo(
                "ConnectionManager::killConnection() - local IP address has changed! Updating server with new address\n");
        }
    }
    if (router().isInitialized() && deviceType != kMakersRouter) {
        logInfo("ConnectionManager::killConnection() - unmapping all ports\n");
        router().unmapAllPorts(kTcp, kHttpDescription);
        router().unmapAllPorts(kTcp, kHttpsDescription);
    } else {
        // Deliberately not limited to the maker's router: on any other device the script is missing,
        // the list is empty and nothing happens.
        router().unmapAllPortBrenvik(kTcp);
    }
    forgetPorts();
    withdrawMappingRecord();
}

void ConnectionManager::withdrawMappingRecord() {
    const std::string port = setting("INTERNAL_HTTP_PORT");
    if (port.empty()) {
        logError(
            "ConnectionManager::killConnection() - failed to get internal port number from dynamicconfig.ini.\n");
        return;
    }
    if (TavikClient::getInstance()->deleteServerMapping(leadingInt(port), router().getLocalIp())) {
        logNotice(
            "ConnectionManager::killConnection() - successfully deleted port mappings on central server.\n");
    } else {
        logError("ConnectionManager::killConnection() - failed to delete port mapping info.\n");
    }
}

}  // namespace pelorus
