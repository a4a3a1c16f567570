#include "connection/forward_search.h"

#include <algorithm>

#include "common/log.h"
#include "common/stop_budget.h"
#include "connection/port_forwarding.h"

namespace pelorus {

namespace {

constexpr int kSearchCycles = 3;
constexpr int kCyclesBeforeExceeded = 2;
constexpr int kExtendedRangePorts = 99;
constexpr std::size_t kMostBadPorts = 99;
constexpr int kEnforcedRelay = FAILED;  // where a port is expected; see forwardPort()

}  // namespace

int ForwardSearch::run() {
    logInfo("ConnectionManager::forwardPort - forwarding internal port: %d \n",
            request.internalPort);
    clearBadPorts();
    if (manager.deviceType == kMakersRouter) {
        if (const auto result = tryPredefinedPorts()) return *result;
    }
    for (int cycle = 1; cycle <= kSearchCycles && !stopBudgetSpent(); ++cycle) {
        if (mapCandidate()) {
            if (request.type == HTTPS) return externalPort;
            if (const auto result = testCandidate(cycle)) return *result;
        }
        manager.badPorts.push_back(externalPort);
    }
    return 0;
}

// A search that may wake the disk starts over; any other one remembers until there are too many.
void ForwardSearch::clearBadPorts() {
    if (request.checkSleep && manager.badPorts.size() <= kMostBadPorts) return;
    logInfo("ConnectionManager::forwardPort - ** Cleared bad port vector. **\n");
    manager.badPorts.clear();
}

// Ports that the maker's router forwards to this device already: the first one that serves, or
// kEnforcedRelay when a double NAT makes every port useless. Nothing is mapped or unmapped.
std::optional<int> ForwardSearch::tryPredefinedPorts() {
    const auto entries = manager.router().getPortListBrenvik(kTcp);
    if (entries.empty()) return std::nullopt;
    logInfo(
        "ConnectionManager::forwardPort - BEGIN Port Test pre-defined list - [%d] by Brenvik router.\n",
        static_cast<int>(entries.size()));
    for (const auto& entry : entries) {
        for (externalPort = entry.firstExternal; externalPort <= entry.lastExternal;
             ++externalPort) {
            const bool serves = entry.internalPort == request.internalPort &&
                                (request.type == HTTPS || testPort() == PASS_TEST);
            if (manager.doubleNatDetected) {
                logInfo("ConnectionManager::forwardPort - return with Enforced Relay.\n");
                return kEnforcedRelay;
            }
            if (serves) return externalPort;
        }
    }
    logInfo("ConnectionManager::forwardPort - END Port Test pre-defined list by Brenvik router.\n");
    return std::nullopt;
}

// Maps the start port, or else the first port of the extended range that the gateway grants.
bool ForwardSearch::mapCandidate() {
    if (mapStartPort()) return true;
    externalPort = 0;  // what a search of the start port alone records as bad
    return !request.defaultPortsOnly && mapInExtendedRange();
}

bool ForwardSearch::mapStartPort() {
    if (isBadPort(request.startPort)) return false;
    if (manager.deviceType == kMakersRouter) {
        logInfo(
            "ConnectionManager::forwardPort - trying to check up port number and mapping port : e-[%d] i-[%d]\n",
            request.startPort, request.internalPort);
    }
    externalPort = request.startPort;
    const bool mapped = mapExternalPort();
    // A NAT-PMP gateway may grant another port; later cycles start from that one.
    request.startPort = externalPort;
    return mapped;
}

bool ForwardSearch::mapInExtendedRange() {
    for (int k = 0; k < kExtendedRangePorts && !stopBudgetSpent(); ++k) {
        externalPort = request.extendedStartPort + k;
        if (isBadPort(externalPort)) continue;
        unmapEarlierPorts();
        if (manager.deviceType == kMakersRouter) {
            logInfo("ConnectionManager::forwardPort - extended port range : e-[%d] i-[%d].\n",
                    externalPort, request.internalPort);
        }
        if (mapExternalPort()) return true;
    }
    return false;
}

// Maps the candidate, which becomes the port that the gateway granted.
bool ForwardSearch::mapExternalPort() {
    if (manager.deviceType == kMakersRouter) {
        return manager.router().mapPortBrenvik(request.internalPort, externalPort, kTcp,
                                               request.description) != 0;
    }
    return manager.router().mapPort(request.internalPort, externalPort, kTcp, request.description,
                                    request.type == HTTPS);
}

// Removes what an earlier attempt left. Both removals name this search's own internal port,
// whichever service the external port belonged to: UPnP goes by the external port alone, NAT-PMP
// by the internal one, which the new candidate needs free.
void ForwardSearch::unmapEarlierPorts() {
    if (!manager.httpPortMapped) {
        manager.unmapDevicePort(request.internalPort, manager.allocatedHttpPort);
    }
    if (!manager.httpsPortMapped) {
        manager.unmapDevicePort(request.internalPort, manager.allocatedHttpsPort);
    }
}

// The result when the search ends here; none when the candidate failed its test.
std::optional<int> ForwardSearch::testCandidate(int cycle) {
    const int testResult = testPort();
    if (testResult == SKIP_TEST) {
        logInfo("ConnectionManager::forwardPort - HTTP port mapped %d but SKIPPED port test\n",
                externalPort);
    } else {
        manager.lastPortTestTime = time(nullptr);
    }
    if (testResult == PASS_TEST) return externalPort;

    manager.unmapDevicePort(request.internalPort, externalPort);
    if (manager.doubleNatDetected) return 0;
    // Counts one ahead: "exceeded" is also logged before the last cycle.
    if (cycle + 1 > kCyclesBeforeExceeded) {
        logInfo("ConnectionManager::forwardPort - Port test failed, retries exceeded.\n");
    } else {
        logInfo("ConnectionManager::forwardPort - Port test failed, trying next port in range.\n");
    }
    if (testResult != SKIP_TEST) return std::nullopt;
    logInfo(
        "ConnectionManager::forwardPort - Skipped port test, unmapped HTTP port %d, leaving forwardPort()\n",
        externalPort);
    return 0;
}

int ForwardSearch::testPort() {
    return manager.testHttpPort(request.externalIp, externalPort, request.checkSleep, false);
}

bool ForwardSearch::isBadPort(int port) const {
    return std::find(manager.badPorts.begin(), manager.badPorts.end(), port) !=
           manager.badPorts.end();
}

}  // namespace pelorus
