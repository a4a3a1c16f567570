#include <cstdint>
#include <cstring>
#include <ctime>
#include <optional>
#include <string>

#include "common/log.h"
#include "common/text.h"
#include "config/scrub.h"
#include "router/router.h"

namespace pelorus {

namespace {

constexpr int kReservedPorts = 10;  // ports up to this one are never mapped
constexpr int kEnumerationPasses = 2;
constexpr int kNoPort = -1;

bool isKnownProtocol(const std::string& protocol) {
    return protocol == "TCP" || protocol == "UDP";
}

int portNumber(const std::string& text) {
    return scanInt(text.c_str()).value_or(kNoPort);
}

// Whether the address can belong to another host: it is dotted and does not end in 0.
bool namesOneHost(const std::string& client) {
    const std::size_t dot = client.rfind('.');
    if (dot == std::string::npos) return false;
    return scanInt64(client.c_str() + dot + 1).value_or(0) != 0;
}

}  // namespace

bool Router::mapPort(int internalPort,
                     int& externalPort,
                     const std::string& protocol,
                     const std::string& description,
                     bool isHttps) {
    if (internalPort <= kReservedPorts || externalPort <= kReservedPorts) {
        logError("Router::mapPort() - internal and external ports must be greater than 10\n");
        return false;
    }
    if (!initialized) {
        logError(
            "Router::mapPort() - must call Router:: discover() to load port map before calling this function \n");
        return false;
    }
    if (!isKnownProtocol(protocol)) {
        logError("Router::mapPort() - protocol must be either 'TCP' or 'UDP' \n");
        return false;
    }
    if (isNatPMPGateway()) {
        const auto granted =
            mapThroughNatpmp(internalPort, externalPort, protocol, description, isHttps);
        externalPort = granted.value_or(externalPort);
        return granted.has_value();
    }
    if (heldByAnother(internalPort, externalPort, protocol)) return false;
    if (!addMapping(internalPort, externalPort, protocol, description)) return false;
    trackMapping(internalPort, externalPort, isHttps);
    return true;
}

// The port that the gateway granted.
std::optional<int> Router::mapThroughNatpmp(int internalPort,
                                            int externalPort,
                                            const std::string& protocol,
                                            const std::string& description,
                                            bool isHttps) {
    if (!pNatpmp->mapPort(internalPort, externalPort, protocol, description, isHttps)) {
        logInfo(
            "Router::mapPort() - fail - failed to map external port: %d, to internal port: %d\n",
            externalPort, internalPort);
        return std::nullopt;
    }
    logInfo(
        "Router::mapPort() - success - external port: %d has been mapped to internal port: %d  \n",
        externalPort, internalPort);
    return externalPort;
}

// Asks the gateway who has the external port. An entry counts whatever the status of the answer,
// and one that leads to another port of this device counts as taken.
bool Router::heldByAnother(int internalPort, int externalPort, const std::string& protocol) const {
    const IgdEntry entry = igd().entry(externalPort, protocol);
    if (entry.status == 0) {
        logInfo(
            "Router::mapPort() - UPNP_GetSpecificPortMappingEntry returned status[%d], intClient[%s], intPort[%s], desc[%s], enabled[%s], leaseDuration[%s]\n",
            entry.status, scrubSecrets(entry.internalClient).c_str(), entry.internalPort.c_str(),
            scrubSecrets(entry.description).c_str(), entry.enabled.c_str(),
            scrubSecrets(entry.lease).c_str());
    } else {
        logInfo("Router::mapPort() - UPNP_GetSpecificPortMappingEntry returned status[%d]\n",
                entry.status);
    }
    if (entry.internalClient.empty()) return false;
    const std::string& client = entry.internalClient;
    if (portNumber(entry.internalPort) == internalPort && client == localIp) {
        logInfo("Router::mapPort() - internal port: %d is already mapped to external port: %d\n",
                internalPort, externalPort);
        return false;
    }
    if (!namesOneHost(client)) return false;
    logInfo("Router::mapPort() - internal port: %d is already mapped to another IP: %s\n",
            internalPort, scrubSecrets(client).c_str());
    return true;
}

bool Router::addMapping(int internalPort,
                        int externalPort,
                        const std::string& protocol,
                        const std::string& description) const {
    logDebug("Router::mapPort() - lifetime %s\n", "0");
    // Without a lease the gateway keeps the mapping for good; the lease is this side's own.
    const int status = igd().add(externalPort, internalPort, localIp, description, protocol);
    if (status != 0) {
        logInfo(
            "Router::mapPort() - fail - failed to map external port: %d, to internal port: %d, status: %d\n",
            externalPort, internalPort, status);
        return false;
    }
    logInfo(
        "Router::mapPort() - success - external port: %d has been mapped to internal port: %d  \n",
        externalPort, internalPort);
    return true;
}

void Router::trackMapping(int internalPort, int externalPort, bool isHttps) {
    const char* const label = isHttps ? "HTTPS" : "HTTP";
    const unsigned lease = gwPorts.reqLifetime;
    const TrackedMapping tracked = gwPorts.track(isHttps, internalPort, externalPort, lease);
    logInfo(
        "Router::mapPort  set %s PMTracker params. internal_port %d, external_port %d, lifetime %u\n",
        label, internalPort, externalPort, lease);
    logInfo(
        "Router::mapPort - get after setting %s PMTracker params.   internalPort[%d], mappedExternalPort[%d], lifetime[%u]\n",
        label, tracked.internalPort, tracked.externalPort, tracked.lifetime);
}

bool Router::unmapPort(int internalPort, int externalPort, const std::string& protocol) {
    if (!initialized) {
        logInfo("Router::unmapPort() - router discovery failed or was not done \n");
        return false;
    }
    if (!isKnownProtocol(protocol)) {
        logError("Router::unmapPort() - protocol must be either 'TCP' or 'UDP' \n");
        return false;
    }
    const bool natpmp = isNatPMPGateway();
    const bool removed = natpmp ? pNatpmp->unmapPort(internalPort, externalPort, protocol)
                                : igd().remove(externalPort, protocol) == 0;
    if (!removed) {
        logInfo("Router::unmapPort() - fail - failed to unmap external port: %d\n", externalPort);
        return false;
    }
    logInfo("Router::unmapPort() - success - external port: %d has been unmapped\n", externalPort);
    if (!natpmp) forgetMapping(internalPort);
    return true;
}

void Router::forgetMapping(int internalPort) {
    const auto [service, mapping] = gwPorts.forget(internalPort);
    switch (service) {
        case GWPortsTracker::Service::HTTP:
            logInfo(
                "Router::unmapPort()  destroyed HTTP port mapping. internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, mapping.externalPort, mapping.lifetime);
            break;
        case GWPortsTracker::Service::HTTPS:
            logInfo(
                "Router::unmapPort()  destroyed HTTPS port mapping. internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, mapping.externalPort, mapping.lifetime);
            break;
        case GWPortsTracker::Service::NONE:
            logInfo(
                "Router::unmapPort()  internal ports mismatch when destroying port mapping. tracked_internal_port %d, req_internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, internalPort, mapping.externalPort, mapping.lifetime);
            break;
    }
}

bool Router::unmapAllPorts(const std::string& protocol, const std::string& description) {
    if (!initialized) {
        logError(
            "Router::unmapAllPorts() - must call Router:: discover() to load port map before calling this function \n");
        return false;
    }
    if (!isKnownProtocol(protocol)) {
        logError("Router::unmapAllPorts() - protocol must be either 'TCP' or 'UDP' \n");
        return false;
    }
    const bool natpmp = isNatPMPGateway();
    const bool removed = natpmp ? pNatpmp->unmapAllPorts(protocol, description)
                                : removeOwnMappings(protocol, description);
    if (!removed) {
        logInfo("Router::unmapAllPorts() - fail\n");
        return false;
    }
    logInfo("Router::unmapAllPorts() - success\n");
    if (!natpmp) {
        gwPorts.forgetAll();
        logInfo("Router::unmapAllPorts()  destroyed all mappings.\n");
    }
    return true;
}

// A removal moves the next entry into its place, which the first pass does not look at again; the
// second pass finds those. The end of the gateway's table counts as a failure, so the result is
// false on every gateway whose table ends.
bool Router::removeOwnMappings(const std::string& protocol, const std::string& description) {
    bool removed = false;
    const auto removeOwn = [&](const IgdEntry& entry) {
        if (localIp != entry.internalClient || protocol != entry.protocol ||
            description != entry.description) {
            return true;
        }
        const int port = portNumber(entry.externalPort);
        logInfo("Router::unmapAllPorts() - un-mapping port: %d for IP: %s \n", port,
                entry.internalClient.c_str());
        unmapPort(0, port, protocol);
        removed = true;
        return true;
    };
    for (int pass = 0; pass < kEnumerationPasses; ++pass) {
        if (!igd().forEach(removeOwn)) removed = false;
    }
    return removed;
}

int Router::getMappedInternalPort(int externalPort, const std::string& protocol) {
    if (!initialized) {
        logError(
            "Router::getMappedInternalPort - must call Router:: discover() to load port map before calling this function \n");
        return 0;
    }
    if (!isKnownProtocol(protocol)) {
        logError("Router::getMappedInternalPort - protocol must be either 'TCP' or 'UDP' \n");
        return 0;
    }
    int internalPort = kNoPort;
    const auto findPort = [&](const IgdEntry& entry) {
        if (localIp != entry.internalClient || protocol != entry.protocol ||
            portNumber(entry.externalPort) != externalPort) {
            return true;
        }
        internalPort = portNumber(entry.internalPort);
        return false;
    };
    for (int pass = 0; pass < kEnumerationPasses && internalPort == kNoPort; ++pass) {
        static_cast<void>(igd().forEach(findPort));
    }
    return internalPort;
}

bool Router::isPortMapped(int externalPort, const std::string& protocol) {
    return getMappedInternalPort(externalPort, protocol) != kNoPort;
}

void Router::renewPortMapping(const char* which) {
    const bool isHttps = std::strcmp(which, "HTTPS") == 0;
    std::optional<TrackedMapping> due = gwPorts.due(isHttps);
    if (!due) return;
    logInfo("Router::renewPortMapping - pastHalfway() returned TRUE\n");
    // An idle tracker has port 0, which mapPort refuses.
    const bool renewed = mapPort(due->internalPort, due->externalPort, "TCP", "", isHttps);
    const std::int64_t now = std::time(nullptr);
    logInfo(
        "Router::renewPortMapping - Renew port mapping PORTFORWARDED %s: mapPort returncode[%d], internalPort[%d], new externalPort[%d], now[%jd], previous start[%jd], previous lifetime[%jd], new lifetime[%u].\n",
        which, static_cast<int>(renewed), due->internalPort, due->externalPort, now,
        due->interval.GetIntervalStartTime(), due->interval.GetIntervalDuration(),
        gwPorts.reqLifetime);
}

void Router::CheckExpiredMappings() {
    if (isNatPMPGateway()) {
        pNatpmp->CheckExpiredMappings();
        return;
    }
    renewPortMapping("HTTP");
    renewPortMapping("HTTPS");
}

}  // namespace pelorus
