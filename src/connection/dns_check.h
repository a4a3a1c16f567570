// One check of the device's public names.
#ifndef PELORUS_CONNECTION_DNS_CHECK_H
#define PELORUS_CONNECTION_DNS_CHECK_H

#include <string>

#include "common/connection_types.h"
#include "connection/connection_manager.h"

namespace pelorus {

/// Looks the device's names up and compares their addresses with each other and with the one the
/// device is reached at. See ConnectionManager::checkDNS().
class DnsCheck {
public:
    DnsCheck(ConnectionManager& owner, ConnectionType current) : manager(owner), type(current) {}

    /// False when the names lead elsewhere or nowhere.
    bool run();

private:
    bool buildNames();
    void lookUpNames();
    [[nodiscard]] bool allFound() const;
    [[nodiscard]] bool namesAgree() const;
    [[nodiscard]] bool namesLeadHere();

    ConnectionManager& manager;
    const ConnectionType type;
    std::string fourLevel;
    std::string threeLevel;
    std::string hashed;  // empty: not used
    std::string fourLevelIp;
    std::string threeLevelIp;
    std::string hashedIp;
};

}  // namespace pelorus

#endif
