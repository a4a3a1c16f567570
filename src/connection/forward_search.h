// One search for an external port.
#ifndef PELORUS_CONNECTION_FORWARD_SEARCH_H
#define PELORUS_CONNECTION_FORWARD_SEARCH_H

#include <optional>
#include <string>
#include <utility>

#include "common/connection_types.h"
#include "connection/connection_manager.h"

namespace pelorus {

/// What a port is searched for, and where.
struct PortRequest {
    int internalPort;
    int startPort;          ///< tried first
    int extendedStartPort;  ///< first port of the range tried next
    std::string externalIp;
    HttpType type;
    std::string description;  ///< of the mapping
    bool defaultPortsOnly;    ///< only the start port
    bool checkSleep;          ///< no port test while the disk sleeps
};

/// Maps one candidate after another until one passes its port test. See
/// ConnectionManager::forwardPort().
class ForwardSearch {
public:
    ForwardSearch(ConnectionManager& owner, PortRequest wanted)
        : manager(owner), request(std::move(wanted)) {}

    /// The external port, or 0.
    int run();

private:
    void clearBadPorts();
    std::optional<int> tryPredefinedPorts();
    bool mapCandidate();
    bool mapStartPort();
    bool mapInExtendedRange();
    bool mapExternalPort();
    void unmapEarlierPorts();
    std::optional<int> testCandidate(int cycle);
    int testPort();
    [[nodiscard]] bool isBadPort(int port) const;

    ConnectionManager& manager;
    PortRequest request;
    int externalPort = 0;  // the candidate
};

}  // namespace pelorus

#endif
