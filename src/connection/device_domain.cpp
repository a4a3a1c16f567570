// The device's public names and the address they must resolve to.
#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/masks.h"
#include "config/global_config.h"
#include "config/scrub.h"
#include "connection/connection_manager.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr const char* kServiceDomain = ".kavra.example";

// The service's domain with its leading dot: the configured server's, or the default.
std::string serviceDomain() {
    const std::string server = setting("SERVER_BASE_URL");
    const std::size_t dot = server.find('.');
    std::string domain = kServiceDomain;
    if (server.empty()) {
        logError("ConnectionManager::buildDeviceDomainName - SERVER_BASE_URL is empty\n");
    } else if (dot == std::string::npos) {
        logError(
            "ConnectionManager::buildDeviceDomainName - SERVER_BASE_URL contains an invalid kavra domain %s\n",
            scrubSecrets(server).c_str());
    } else {
        logInfo(
            "ConnectionManager::buildDeviceDomainName - SERVER_BASE_URL contains a valid kavra domain %s\n",
            scrubSecrets(server).c_str());
        domain = server.substr(dot);
    }
    logInfo("ConnectionManager::buildDeviceDomainName - kavra domain = %s\n",
            scrubSecrets(domain).c_str());
    return domain;
}

// The gateway's address or, when the gateway does not tell it, the one the server saw in the last
// passed port test; empty when neither is known.
std::string directAddress(Router& router, const std::string& seenByServer) {
    std::string ip;
    router.discover();
    if (router.isInitialized()) {
        ip = router.getExternalIp();
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, router discovery successfully obtained external IP\n");
    } else {
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, router discovery failed to obtain external IP\n");
    }
    if (ip.empty()) {
        ip = seenByServer;
        if (ip.empty()) {
            logInfo(
                "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, most recent remote external IP in test port response is empty\n");
        } else {
            logInfo(
                "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, use most recent remote external IP in test port response = %s\n",
                scrubSecrets(ip).c_str());
        }
    }
    logInfo(
        "ConnectionManager::fetchLocalDeviceDomainIPAddr - auto/manual portforward external router IP = %s\n",
        scrubSecrets(ip).c_str());
    return ip;
}

// The relay's address; empty when the client's output does not tell it.
std::string relayAddress() {
    std::string ip;
    if (VPNManager::getInstance()->fetchOpenVPN_IPAddr(ip)) {
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for relayed mode, successfully retrieved openVPN server external IP\n");
    } else {
        logError(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for relayed mode, failed to retrieve openVPN server external IP\n");
    }
    logInfo("ConnectionManager::fetchLocalDeviceDomainIPAddr - relayed mode external IP = %s\n",
            ip.c_str());
    return ip;
}

}  // namespace

int ConnectionManager::buildDeviceDomainName(char* hostname,
                                             const std::string& deviceId,
                                             std::string& fourLevel,
                                             std::string& threeLevel,
                                             std::string& threeLevelHashed) {
    threeLevelHashed = setting("SUBDOMAIN");
    const std::string host = hostname == nullptr ? "" : hostname;
    const std::string shownHost = hostname == nullptr ? "NULL" : scrubSecrets(host);
    if (host.empty() || deviceId.empty()) {
        logError(
            "ConnectionManager::buildDeviceDomainName - NAS hostname and/or deviceID are empty.  Hostname=%s, deviceID=%s\n",
            shownHost.c_str(), STRIPPED_DEVID_VAL);
        return 0;
    }
    const std::string domain = serviceDomain();
    const std::string label = "device" + deviceId + domain;
    fourLevel = host + "." + label;
    threeLevel = host + "-" + label;
    const std::string shownLabel =
        std::string{"device"} + STRIPPED_DEVID_VAL + scrubSecrets(domain);
    logInfo(
        "ConnectionManager::buildDeviceDomainName - 4-level domain name %s, 3-level domain name %s, 3-level hashed domain name %s\n",
        (shownHost + "." + shownLabel).c_str(), (shownHost + "-" + shownLabel).c_str(),
        STRIPPED_SUBDOMAIN_VAL);
    return 1;
}

int ConnectionManager::fetchLocalDeviceDomainIPAddr(ConnectionType type, std::string& ip) {
    if (type == PORTFORWARDED) {
        ip = directAddress(router(), responseExternalIP);
    } else if (type == RELAYED) {
        ip = relayAddress();
    } else {
        logError(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - connection type %d not supported\n",
            type);
        return 0;
    }
    return ip.empty() ? 0 : 1;
}

}  // namespace pelorus
