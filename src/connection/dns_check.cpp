#include "connection/dns_check.h"

#include <unistd.h>

#include <array>
#include <cerrno>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/masks.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr std::size_t kHostnameSize = 512;

// Looks a name up unless its address is known already.
void lookUp(const std::string& name, std::string& address, const char* failure) {
    if (!address.empty()) return;
    address = TavikClient::getInstance()->nsLookup(name);
    if (address.empty()) logError("%s", failure);
}

}  // namespace

bool DnsCheck::run() {
    const std::int64_t now = time(nullptr);
    const bool due =
        manager.forceDNSCheck || now - manager.prevDNSCheckTime >= manager.dnsCheckInterval;
    if (!due || (type != PORTFORWARDED && type != RELAYED)) return true;
    const ClearDNSCheck recordCheck{&manager};
    logInfo(
        "--------------------------------------------------------------------------------------\n");
    logInfo(
        "ConnectionManager::checkDNS - forceDNSCheck or exceeded nslookup check interval, forceDNSCheck %d, prevTime %jd, checkInterval %jd, currentTime %jd, connectionType %d\n",
        manager.forceDNSCheck, manager.prevDNSCheckTime, manager.dnsCheckInterval, now, type);
    if (!buildNames()) return true;
    lookUpNames();
    return namesAgree() && namesLeadHere();
}

// False when there is nothing to look up, which is no evidence against the names.
bool DnsCheck::buildNames() {
    const std::string deviceId = setting("DEVICEID");
    if (deviceId.empty()) {
        logError("ConnectionManager::checkDNS - failed to get DEVICEID from config file!\n");
        return false;
    }
    std::array<char, kHostnameSize> hostname{};
    // A longer name may come without its end.
    if (gethostname(hostname.data(), hostname.size() - 1) != 0) {
        const int error = errno;
        logError("ConnectionManager::checkDNS - failed to retrieve NAS hostname, errno = %d\n",
                 error);
        return false;
    }
    const std::string shownHostname = scrubSecrets(hostname.data());
    logInfo("ConnectionManager::checkDNS - NAS hostname %s\n", shownHostname.c_str());
    if (manager.buildDeviceDomainName(hostname.data(), deviceId, fourLevel, threeLevel, hashed) ==
        0) {
        logError(
            "ConnectionManager::checkDNS - cannot generate device domain names, NAS hostname = %s, deviceid = %s\n",
            shownHostname.c_str(), STRIPPED_DEVID_VAL);
        return false;
    }
    return true;
}

// Also pauses after the last try.
void DnsCheck::lookUpNames() {
    for (int tries = 0; tries < ConnectionManager::MAX_CHECK_DNS_TRIES; ++tries) {
        lookUp(fourLevel, fourLevelIp,
               "ConnectionManager::checkDNS - nslookup failed for 4-level device domain name\n");
        lookUp(threeLevel, threeLevelIp,
               "ConnectionManager::checkDNS - nslookup failed for 3-level device domain name\n");
        if (!hashed.empty()) {
            lookUp(
                hashed, hashedIp,
                "ConnectionManager::checkDNS - nslookup failed for 3-level hashed device domain name\n");
        }
        if (allFound()) return;
        sleep(ConnectionManager::CHECK_DNS_WAIT);
    }
}

bool DnsCheck::allFound() const {
    return !fourLevelIp.empty() && !threeLevelIp.empty() && (hashed.empty() || !hashedIp.empty());
}

bool DnsCheck::namesAgree() const {
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

bool DnsCheck::namesLeadHere() {
    logInfo(
        "ConnectionManager::checkDNS - nslookup device domain name IP addresses. 3-level [%s], 4-level [%s], 3-level hashed [%s]\n",
        threeLevelIp.c_str(), fourLevelIp.c_str(), hashedIp.c_str());
    std::string ip;
    if (manager.fetchLocalDeviceDomainIPAddr(type, ip) != 1) {
        logError(
            "ConnectionManager::checkDNS - failed to retrieve local value of the device domain IP address\n");
        return true;
    }
    if (fourLevelIp != ip) {
        logError(
            "ConnectionManager::checkDNS - DNS check failed for 4-level device domain name, DNS IP address is %s, local value of IP address is %s\n",
            fourLevelIp.c_str(), scrubSecrets(ip).c_str());
        return false;
    }
    logInfo(
        "ConnectionManager::checkDNS - DNS matches local value for device domain names, IP address is %s\n",
        scrubSecrets(ip).c_str());
    return true;
}

}  // namespace pelorus
