#include <algorithm>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "connection/connection_manager.h"
#include "connection/mapping_names.h"

namespace pelorus {

namespace {

constexpr int kSearchCycles = 3;
constexpr int kCyclesBeforeExceeded = 2;
constexpr int kExtendedRangePorts = 99;
constexpr std::size_t kMostBadPorts = 99;
constexpr int kEnforcedRelay = FAILED;  // where a port is expected; see forwardPort()

}  // namespace

// One search, as its steps share it.
struct ConnectionManager::ForwardSearch {
    int internalPort;
    int startPort;  // NAT-PMP may grant another one, which later cycles then start from
    int extendedStartPort;
    std::string externalIp;
    HttpType type;
    const std::string& description;
    bool defaultPortsOnly;
    bool checkSleep;
    int retries = 0;
    int candidatePort = 0;
    bool mapped = false;
};

int ConnectionManager::forwardPort(int internalPort,
                                   int startPort,
                                   int extendedStartPort,
                                   const std::string& externalIp,
                                   HttpType type,
                                   const std::string& description,
                                   bool defaultPortsOnly,
                                   bool checkSleep) {
    ForwardSearch search{internalPort, startPort,   extendedStartPort, externalIp,
                         type,         description, defaultPortsOnly,  checkSleep};
    logInfo("ConnectionManager::forwardPort - forwarding internal port: %d \n", internalPort);
    if (!checkSleep || badPorts.size() > kMostBadPorts) {
        logInfo("ConnectionManager::forwardPort - ** Cleared bad port vector. **\n");
        badPorts.clear();
    }
    int result = 0;
    if (deviceType == kMakersRouter && tryPredefinedPorts(search, result)) return result;
    while (!search.mapped && search.retries++ < kSearchCycles) {
        search.candidatePort = 0;
        mapCandidate(search);
        if (!search.mapped) {
            badPorts.push_back(search.candidatePort);
            continue;
        }
        if (type == HTTPS) return search.candidatePort;
        if (testCandidate(search, result)) return result;
        if (!search.mapped) badPorts.push_back(search.candidatePort);
    }
    return 0;
}

// Ports that the maker's router forwards to this device already. True, with the result, when one
// of them serves or a double NAT makes every port useless; nothing is mapped or unmapped.
bool ConnectionManager::tryPredefinedPorts(ForwardSearch& search, int& result) {
    const auto entries = router().getPortListBrenvik(kTcp);
    if (entries.empty()) return false;
    logInfo(
        "ConnectionManager::forwardPort - BEGIN Port Test pre-defined list - [%d] by Brenvik router.\n",
        static_cast<int>(entries.size()));
    for (const auto& entry : entries) {
        for (int port = entry.firstExternal; port <= entry.lastExternal; ++port) {
            if (entry.internalPort == search.internalPort) {
                search.mapped =
                    search.type == HTTPS ||
                    testHttpPort(search.externalIp, port, search.checkSleep, false) == PASS_TEST;
            }
            if (doubleNatDetected) {
                logInfo("ConnectionManager::forwardPort - return with Enforced Relay.\n");
                result = kEnforcedRelay;
                return true;
            }
            if (search.mapped) {
                result = port;
                return true;
            }
        }
    }
    logInfo("ConnectionManager::forwardPort - END Port Test pre-defined list by Brenvik router.\n");
    return false;
}

// Maps the start port, or else the first port of the extended range that the gateway grants.
void ConnectionManager::mapCandidate(ForwardSearch& search) {
    if (!isBadPort(search.startPort)) {
        if (deviceType == kMakersRouter) {
            logInfo(
                "ConnectionManager::forwardPort - trying to check up port number and mapping port : e-[%d] i-[%d]\n",
                search.startPort, search.internalPort);
        }
        search.mapped = mapDevicePort(search, search.startPort);
        if (search.mapped) search.candidatePort = search.startPort;
    }
    if (!search.mapped && !search.defaultPortsOnly) mapInExtendedRange(search);
}

void ConnectionManager::mapInExtendedRange(ForwardSearch& search) {
    for (int k = 0; k < kExtendedRangePorts && !search.mapped; ++k) {
        search.candidatePort = search.extendedStartPort + k;
        if (isBadPort(search.candidatePort)) continue;
        // What an earlier attempt left goes first. Both removals name this search's own internal
        // port, whichever service the external port belonged to.
        if (!httpPortMapped) unmapDevicePort(search.internalPort, allocatedHttpPort);
        if (!httpsPortMapped) unmapDevicePort(search.internalPort, allocatedHttpsPort);
        if (deviceType == kMakersRouter) {
            logInfo("ConnectionManager::forwardPort - extended port range : e-[%d] i-[%d].\n",
                    search.candidatePort, search.internalPort);
        }
        search.mapped = mapDevicePort(search, search.candidatePort);
    }
}

bool ConnectionManager::mapDevicePort(const ForwardSearch& search, int& externalPort) {
    if (deviceType == kMakersRouter) {
        return router().mapPortBrenvik(search.internalPort, externalPort, kTcp,
                                       search.description) != 0;
    }
    return router().mapPort(search.internalPort, externalPort, kTcp, search.description,
                            search.type == HTTPS);
}

// True, with the result, when the search ends here; otherwise the candidate failed its test.
bool ConnectionManager::testCandidate(ForwardSearch& search, int& result) {
    const int testResult =
        testHttpPort(search.externalIp, search.candidatePort, search.checkSleep, false);
    if (testResult == SKIP_TEST) {
        logInfo("ConnectionManager::forwardPort - HTTP port mapped %d but SKIPPED port test\n",
                search.candidatePort);
    } else {
        lastPortTestTime = time(nullptr);
    }
    search.mapped = testResult == PASS_TEST;
    result = search.mapped ? search.candidatePort : 0;
    if (doubleNatDetected) {
        unmapDevicePort(search.internalPort, search.candidatePort);
        result = 0;
        return true;
    }
    if (search.mapped) return true;

    unmapDevicePort(search.internalPort, search.candidatePort);
    // Counts one ahead: "exceeded" is also said before the last cycle.
    if (search.retries + 1 > kCyclesBeforeExceeded) {
        logInfo("ConnectionManager::forwardPort - Port test failed, retries exceeded.\n");
    } else {
        logInfo("ConnectionManager::forwardPort - Port test failed, trying next port in range.\n");
    }
    if (testResult != SKIP_TEST) return false;
    logInfo(
        "ConnectionManager::forwardPort - Skipped port test, unmapped HTTP port %d, leaving forwardPort()\n",
        search.candidatePort);
    return true;
}

bool ConnectionManager::isBadPort(int port) const {
    return std::find(badPorts.begin(), badPorts.end(), port) != badPorts.end();
}

}  // namespace pelorus
