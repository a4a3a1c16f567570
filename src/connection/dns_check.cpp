#include <unistd.h>

#include <array>
#include <cerrno>

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
constexpr std::size_t kHostnameSize = 512;

// The service's domain, leading dot included: the one of the configured server, or the usual one.
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

// Looks a name up unless its address is known already.
void lookUp(const std::string& name, std::string& address, const char* failure) {
    if (!address.empty()) return;
    address = TavikClient::getInstance()->nsLookup(name);
    if (address.empty()) logError("%s", failure);
}

}  // namespace

// The device's public names and what they resolve to.
struct ConnectionManager::DeviceNames {
    std::string fourLevel;
    std::string threeLevel;
    std::string hashed;  // empty: not used
    std::string fourLevelIp;
    std::string threeLevelIp;
    std::string hashedIp;

    void lookUpAll() {
        for (int tries = 0; tries < MAX_CHECK_DNS_TRIES; ++tries) {
            lookUp(
                fourLevel, fourLevelIp,
                "ConnectionManager::checkDNS - nslookup failed for 4-level device domain name\n");
            lookUp(
                threeLevel, threeLevelIp,
                "ConnectionManager::checkDNS - nslookup failed for 3-level device domain name\n");
            if (!hashed.empty()) {
                lookUp(
                    hashed, hashedIp,
                    "ConnectionManager::checkDNS - nslookup failed for 3-level hashed device domain name\n");
            }
            if (!fourLevelIp.empty() && !threeLevelIp.empty() &&
                (hashed.empty() || !hashedIp.empty())) {
                return;
            }
            sleep(CHECK_DNS_WAIT);
        }
    }

    [[nodiscard]] bool agree() const {
        if (fourLevelIp.empty() || threeLevelIp.empty() || fourLevelIp != threeLevelIp) {
            logError(
                "ConnectionManager::checkDNS - nslookup 3-level and/or 4-level domain name IP addresses do not exist or do not match, 3-level [%s], 4-level [%s]\n",
                threeLevelIp.c_str(), fourLevelIp.c_str());
            return false;
        }
        if (!hashed.empty() && hashedIp != threeLevelIp) {
            logError(
                "ConnectionManager::checkDNS - nslookup 3-level hashed domain name IP address does not exist or does not match 3-level and 4-level, 3-level [%s], 4-level [%s], 3-level hashed [%s]\n",
                threeLevelIp.c_str(), fourLevelIp.c_str(), hashedIp.c_str());
            return false;
        }
        return true;
    }
};

bool ConnectionManager::checkDNS(ConnectionType type) {
    const time_t now = time(nullptr);
    const bool due = forceDNSCheck || now - prevDNSCheckTime >= dnsCheckInterval;
    if (!due || (type != PORTFORWARDED && type != RELAYED)) return true;
    const ClearDNSCheck recordCheck{this};
    logInfo(
        "--------------------------------------------------------------------------------------\n");
    logInfo(
        "ConnectionManager::checkDNS - forceDNSCheck or exceeded nslookup check interval, forceDNSCheck %d, prevTime %ld, checkInterval %ld, currentTime %ld, connectionType %d\n",
        forceDNSCheck, static_cast<long>(prevDNSCheckTime), dnsCheckInterval,
        static_cast<long>(now), type);
    DeviceNames names;
    if (!buildOwnNames(names)) return true;
    names.lookUpAll();
    return names.agree() && namesLeadHere(names, type);
}

// False when there is nothing to look up, which is no evidence against the names.
bool ConnectionManager::buildOwnNames(DeviceNames& names) {
    const std::string deviceId = setting("DEVICEID");
    if (deviceId.empty()) {
        logError("ConnectionManager::checkDNS - failed to get DEVICEID from config file!\n");
        return false;
    }
    std::array<char, kHostnameSize> hostname{};
    if (gethostname(hostname.data(), hostname.size()) != 0) {
        logError("ConnectionManager::checkDNS - failed to retrieve NAS hostname, errno = %d\n",
                 errno);
        return false;
    }
    const std::string shownHostname = scrubSecrets(hostname.data());
    logInfo("ConnectionManager::checkDNS - NAS hostname %s\n", shownHostname.c_str());
    if (buildDeviceDomainName(hostname.data(), deviceId, names.fourLevel, names.threeLevel,
                              names.hashed) == 0) {
        logError(
            "ConnectionManager::checkDNS - cannot generate device domain names, NAS hostname = %s, deviceid = %s\n",
            shownHostname.c_str(), STRIPPED_DEVID_VAL);
        return false;
    }
    return true;
}

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

bool ConnectionManager::namesLeadHere(const DeviceNames& names, ConnectionType type) {
    logInfo(
        "ConnectionManager::checkDNS - nslookup device domain name IP addresses. 3-level [%s], 4-level [%s], 3-level hashed [%s]\n",
        names.threeLevelIp.c_str(), names.fourLevelIp.c_str(), names.hashedIp.c_str());
    std::string ip;
    if (fetchLocalDeviceDomainIPAddr(type, ip) != 1) {
        logError(
            "ConnectionManager::checkDNS - failed to retrieve local value of the device domain IP address\n");
        return true;
    }
    if (names.fourLevelIp != ip) {
        logError(
            "ConnectionManager::checkDNS - DNS check failed for 4-level device domain name, DNS IP address is %s, local value of IP address is %s\n",
            names.fourLevelIp.c_str(), scrubSecrets(ip).c_str());
        return false;
    }
    logInfo(
        "ConnectionManager::checkDNS - DNS matches local value for device domain names, IP address is %s\n",
        scrubSecrets(ip).c_str());
    return true;
}

int ConnectionManager::fetchLocalDeviceDomainIPAddr(ConnectionType type, std::string& ip) {
    if (type == PORTFORWARDED) {
        fetchExternalIp(ip);
    } else if (type == RELAYED) {
        fetchRelayIp(ip);
    } else {
        logError(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - connection type %d not supported\n",
            type);
        return 0;
    }
    return ip.empty() ? 0 : 1;
}

void ConnectionManager::fetchExternalIp(std::string& ip) {
    ip.clear();
    router().discover();
    if (router().isInitialized()) {
        ip = router().getExternalIp();
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, router discovery successfully obtained external IP\n");
    } else {
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, router discovery failed to obtain external IP\n");
    }
    if (ip.empty() && !responseExternalIP.empty()) {
        ip = responseExternalIP;
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, use most recent remote external IP in test port response = %s\n",
            ip.c_str());
    } else if (ip.empty()) {
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for auto/manual portforward, most recent remote external IP in test port response is empty\n");
    }
    logInfo(
        "ConnectionManager::fetchLocalDeviceDomainIPAddr - auto/manual portforward external router IP = %s\n",
        scrubSecrets(ip).c_str());
}

void ConnectionManager::fetchRelayIp(std::string& ip) {
    ip.clear();
    if (VPNManager::getInstance()->fetchOpenVPN_IPAddr(ip)) {
        logInfo(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for relayed mode, successfully retrieved openVPN server external IP\n");
    } else {
        logError(
            "ConnectionManager::fetchLocalDeviceDomainIPAddr - for relayed mode, failed to retrieve openVPN server external IP\n");
    }
    logInfo("ConnectionManager::fetchLocalDeviceDomainIPAddr - relayed mode external IP = %s\n",
            ip.c_str());
}

}  // namespace pelorus
