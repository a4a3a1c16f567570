// One attempt at a direct connection through automatically forwarded ports.
#ifndef PELORUS_CONNECTION_DIRECT_ATTEMPT_H
#define PELORUS_CONNECTION_DIRECT_ATTEMPT_H

#include <ctime>
#include <optional>

#include "common/connection_types.h"
#include "connection/connection_manager.h"

namespace pelorus {

/// Keeps ports that still work, or else searches for new ones and publishes them. Hands over to
/// manual forwarding when the user chose that. See ConnectionManager::createDirectConnection().
class DirectAttempt {
public:
    explicit DirectAttempt(ConnectionManager& owner) : manager(owner) {}

    ConnectionType run();

private:
    // A stage that returns a connection type may end the attempt with it.
    std::optional<ConnectionType> checkGateway();
    std::optional<ConnectionType> testPortsWithoutGateway();
    void readInternalPorts();
    void readStatusFile();
    void dropOutdatedMappings();
    void decideSleepCheck();
    std::optional<ConnectionType> retestMappedPorts();
    bool searchIsDue();
    std::optional<ConnectionType> searchPorts();
    int forwardHttpPort();
    int forwardHttpsPort();
    ConnectionType publishMapping();
    ConnectionType giveUpMapping();
    ConnectionType endInFailure();
    void unmapAllocatedPorts();

    ConnectionManager& manager;
    bool bTryPortMap = false;       // the gateway can be used
    bool checkSleep = true;         // no port test while the disk sleeps
    int testResult = SKIP_TEST;     // of the last port test
    bool analyticsSent = false;     // "connecting" was reported
    bool defaultPortsOnly = false;  // no other external port may be tried
    int internalHttpPort = 0;
    int internalHttpsPort = 0;
    std::int64_t now = 0;
};

}  // namespace pelorus

#endif
