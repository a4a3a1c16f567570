// One attempt at a direct connection through ports the user forwarded by hand.
#ifndef PELORUS_CONNECTION_MANUAL_ATTEMPT_H
#define PELORUS_CONNECTION_MANUAL_ATTEMPT_H

#include <ctime>
#include <string>
#include <utility>

#include "common/connection_types.h"
#include "connection/connection_manager.h"

namespace pelorus {

/// Tests the user's ports when that is due and publishes them when something changed; maps
/// nothing. See ConnectionManager::manualPortForward().
class ManualAttempt {
public:
    ManualAttempt(ConnectionManager& owner, int httpPort, int httpsPort, std::string lanIp)
        : manager(owner),
          internalHttpPort(httpPort),
          internalHttpsPort(httpsPort),
          localIp(std::move(lanIp)) {}

    ConnectionType run();

private:
    bool readExternalPorts();
    void leaveAutomaticForwarding();
    void detectChanges();
    [[nodiscard]] bool mustBePublished() const { return forced || changed; }
    bool testIsDue();
    void testPort();
    void conclude();
    void publish();
    void stopRelay();

    ConnectionManager& manager;
    const int internalHttpPort;
    const int internalHttpsPort;
    const std::string localIp;
    int externalHttpPort = 0;     // as the user configured it
    int externalHttpsPort = 0;    // as the user configured it
    bool changed = false;         // ports or addresses differ from what was published
    bool forced = false;          // test now, whatever the interval
    bool portTestPassed = false;  // in this attempt
    std::int64_t now = 0;
    std::string externalIp;  // as the server saw it
    ConnectionType result = FAILED;
};

}  // namespace pelorus

#endif
