#include "connection/network_addrs.h"

#include <cstdint>
#include <ctime>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/pause.h"
#include "common/termination.h"
#include "config/scrub.h"

namespace pelorus {

NetworkAddrs::NetworkAddrs() {
    interval.SetIntervalDuration(kDefaultInterval);
}

NetworkAddrs* NetworkAddrs::getInstance() {
    static NetworkAddrs instance;
    return &instance;
}

void NetworkAddrs::init() {
    externalIP.clear();
    localIP.clear();
    clearIPChanged();
    logInfo(
        "NetworkAddrs::init - cleared local and external IP addresses.  Interval duration: %d\n",
        static_cast<int>(interval.GetIntervalDuration()));
}

void NetworkAddrs::SetIntervalDuration(int seconds) {
    interval.SetIntervalDuration(seconds);
}

void NetworkAddrs::setNetworkAddrs(const std::string& externalIp, const std::string& localIp) {
    clearIPChanged();
    externalIP = externalIp;
    localIP = localIp;
    interval.StartTheInterval();
    logInfo(
        "NetworkAddrs::setNetworkAddrs - external IP [%s], local IP [%s], interval start time [%jd], interval duration [%d] \n",
        scrubSecrets(externalIP).c_str(), localIP.c_str(), interval.GetIntervalStartTime(),
        static_cast<int>(interval.GetIntervalDuration()));
}

int NetworkAddrs::discoverNetworkAddrs() {
    if (externalIP.empty() && localIP.empty()) {
        logInfo("NetworkAddrs::discoverNetworkAddrs - both externalIP and localIP are empty\n");
        return 0;
    }
    if (!pRouter) pRouter = std::make_unique<Router>();
    pRouter->discover();
    const std::string discoveredLocal = pRouter->getLocalIp();
    const auto discoveredExternal = findExternalIp();
    if (!discoveredExternal) return 0;

    externalIPChanged = externalIP != *discoveredExternal;
    internalIPChanged = localIP != discoveredLocal;
    logInfo(
        "NetworkAddrs::discoverNetworkAddrs - externalIPChanged [%d], external IP [%s], discovered external IP [%s], internalIPChanged [%d], internal IP [%s], discovered internal IP [%s]\n",
        externalIPChanged, scrubSecrets(externalIP).c_str(),
        scrubSecrets(*discoveredExternal).c_str(), internalIPChanged, localIP.c_str(),
        discoveredLocal.c_str());
    return 1;
}

// From the gateway, or else from the server when the interval allows a query.
std::optional<std::string> NetworkAddrs::findExternalIp() {
    if (pRouter->isInitialized()) {
        std::string discovered = pRouter->getExternalIp();
        logInfo(
            "NetworkAddrs::discoverNetworkAddrs - pRouter->isInitialized [1], discovered external IP [%s]\n",
            scrubSecrets(discovered).c_str());
        return discovered;
    }
    if (!interval.hasExpired()) {
        logInfo("NetworkAddrs::discoverNetworkAddrs - interval not expired.\n");
        return std::nullopt;
    }
    logInfo(
        "NetworkAddrs::discoverNetworkAddrs - pRouter->isInitialized [0], interval expired.  Interval start time [%jd], interval duration [%d], current time [%jd]\n",
        interval.GetIntervalStartTime(), static_cast<int>(interval.GetIntervalDuration()),
        static_cast<std::int64_t>(time(nullptr)));
    std::string discovered;
    if (getMyIP(discovered) != 1) {
        // The interval is not restarted: the next call asks again.
        logError("NetworkAddrs::discoverNetworkAddrs - getMyIP returned false\n");
        return std::nullopt;
    }
    interval.StartTheInterval();
    logInfo(
        "NetworkAddrs::discoverNetworkAddrs - discovered external IP [%s], reset interval start time [%jd]\n",
        discovered.c_str(), interval.GetIntervalStartTime());
    return discovered;
}

bool NetworkAddrs::haveNetworkAddrsChanged() const {
    return externalIPChanged || internalIPChanged;
}

void NetworkAddrs::clearIPChanged() {
    externalIPChanged = false;
    internalIPChanged = false;
}

int NetworkAddrs::getMyIP(std::string& out) {
    auto* client = TavikClient::getInstance();
    std::string ip;
    int waitSeconds = 0;
    bool found = client->getMyIP(ip, waitSeconds);
    while (!found && waitSeconds > 0 && !terminationRequested()) {
        logInfo("NetworkAddrs::getMyIP - wait %d seconds\n", waitSeconds);
        pauseUnlessTerminated(waitSeconds);
        // The server's answer is kept for the cycle and would be read again.
        client->resetServerSleepTime();
        if (terminationRequested()) break;
        waitSeconds = 0;
        found = client->getMyIP(ip, waitSeconds);
    }
    if (!found) {
        logError("NetworkAddrs::getMyIP - failed to retrieve external IP address\n");
        return 0;
    }
    out = ip;
    logInfo("NetworkAddrs::getMyIP - external IP address %s\n", out.c_str());
    return 1;
}

}  // namespace pelorus
