// How the device is made reachable, decided once per cycle.
#ifndef PELORUS_CONNECTION_CONNECTION_MANAGER_H
#define PELORUS_CONNECTION_CONNECTION_MANAGER_H

#include <cstdint>
#include <ctime>
#include <memory>
#include <string>
#include <vector>

#include "common/connection_types.h"
#include "router/router.h"

namespace pelorus {

/// Chooses between a direct connection through forwarded ports and a relayed one, proves it,
/// publishes it, keeps it up and tears it down. Holds what lasts from one cycle to the next; each
/// attempt is an object of its own (DirectAttempt, ForwardSearch, ManualAttempt, DnsCheck).
class ConnectionManager {
public:
    static constexpr int MAX_CHECK_DNS_TRIES = 3;
    static constexpr int CHECK_DNS_WAIT = 10;  ///< seconds

    static ConnectionManager* getInstance();
    ConnectionManager(const ConnectionManager&) = delete;
    ConnectionManager& operator=(const ConnectionManager&) = delete;

    // --- the cycle ---------------------------------------------------------------------------

    /// Checks that the device's public names lead to it, when that is due. When they do not,
    /// reports "failed", tears both kinds of connection down and makes the next createConnection()
    /// test at once. @p current is the result of the last createConnection().
    void checkConnection(ConnectionType current);

    /// One attempt: direct, else relayed. Without device credentials it does nothing and returns
    /// FAILED. CONNECTING means: wait for the next port test.
    ConnectionType createConnection();

    /// Tears one kind of connection down: PORTFORWARDED removes the gateway mappings and the
    /// server record, RELAYED stops the tunnel. Other types do nothing.
    void killConnection(ConnectionType type);

    // --- settings ------------------------------------------------------------------------------

    /// Minimum time between two checks of the public names, seconds.
    [[nodiscard]] std::int64_t getDNSCheckInterval() const { return dnsCheckInterval; }
    void setDNSCheckInterval(std::int64_t seconds) { dnsCheckInterval = seconds; }

    /// Leases to ask for, seconds. Until the gateway object exists both read as
    /// Router::INVALID_LEASE_DURATION.
    void setReqPortMappingLifetime(unsigned upnp, unsigned natpmp);
    void getReqPortMappingLifetime(unsigned& upnp, unsigned& natpmp) const;

    /// Checks the public names at the next opportunity, whatever the interval.
    void setForceDNSCheck(bool force) { forceDNSCheck = force; }
    /// Tests the port in the next attempt, whatever the interval and the disk state.
    void setForceConnect(bool force);
    /// Records the address the server saw in a passed port test.
    void setResponseExternalIP(const std::string& ip) { responseExternalIP = ip; }
    /// Time of the last check of the public names, seconds since the epoch.
    void setPrevDNSCheckTime(std::int64_t time) { prevDNSCheckTime = time; }
    /// Adds two minutes to the time between port tests, up to sixteen minutes.
    void increasePortTestInterval();

    // --- the parts of a cycle, each usable on its own --------------------------------------------

    /// Makes or keeps a direct connection. Returns PORTFORWARDED, FAILED, or the previous
    /// connection type when nothing was due.
    ConnectionType createDirectConnection();

    /// Finds, maps and (HTTP only) tests an external port for @p internalPort: @p startPort first,
    /// then 99 ports from @p extendedStartPort unless @p defaultPortsOnly. Returns the port, or 0.
    /// A double NAT found on a pre-defined port of the maker's router returns 4, which looks like
    /// a port: callers check the double-NAT flag before they use the result.
    int forwardPort(int internalPort,
                    int startPort,
                    int extendedStartPort,
                    const std::string& externalIp,
                    HttpType type,
                    const std::string& description,
                    bool defaultPortsOnly,
                    bool checkSleep);

    /// Proves and publishes ports that the user forwarded by hand. Returns PORTFORWARDED, FAILED,
    /// or the previous connection type when no test was due or it was skipped.
    ConnectionType manualPortForward(int internalHttpPort,
                                     int internalHttpsPort,
                                     std::string localIp);

    /// Makes or keeps the relayed connection: RELAYED, FAILED, or PORTFORWARDED when both ports
    /// are mapped after all.
    ConnectionType createRelayConnection();

    /// Whether the device's public names resolve to it. True also when no check was due or there
    /// is nothing to compare with. May block for 30 seconds plus the lookups.
    bool checkDNS(ConnectionType type);

    /// Builds the device's names. Returns 1, or 0 when @p hostname or @p deviceId is missing.
    int buildDeviceDomainName(char* hostname,
                              const std::string& deviceId,
                              std::string& fourLevel,
                              std::string& threeLevel,
                              std::string& threeLevelHashed);

    /// The address the names must resolve to: the gateway's or the relay's. Returns 1 when it is
    /// known, else 0.
    int fetchLocalDeviceDomainIPAddr(ConnectionType type, std::string& ip);

    /// The status word of @p type.
    [[nodiscard]] static std::string convertEnumConnectionType(ConnectionType type);

private:
    // The attempts work on the lasting state below.
    friend class DirectAttempt;
    friend class DnsCheck;
    friend class ForwardSearch;
    friend class ManualAttempt;

    ConnectionManager();
    ~ConnectionManager() = default;

    Router& router();
    void noteConnectionType();
    void clearMappedFlags();
    void forgetPorts();
    void unmapDevicePort(int internalPort, int externalPort);
    int testHttpPort(std::string& requestedIp,
                     int externalPort,
                     bool checkSleep,
                     bool skipDoubleNatCheck);

    ConnectionType startRelay();
    void removeMappings();
    void withdrawMappingRecord();

    std::unique_ptr<Router> pRouter;
    int allocatedHttpPort = 0;   // external; 0: none
    int allocatedHttpsPort = 0;  // external; 0: none
    int connTypeUnchangedCount = 0;
    int deviceType = 0;
    bool doubleNatDetected = false;  // by the last port test
    time_t lastPortTestTime = 0;     // 0: none yet
    std::int64_t portTestInterval;   // seconds
    bool httpPortMapped = false;     // in the current attempt
    bool httpsPortMapped = false;    // in the current attempt
    bool lastManualPortForward = false;
    ConnectionType connectionType = FAILED;
    ConnectionType prevConnectionType = FAILED;  // when the cycle began
    std::vector<int> badPorts;                   // external ports a search passes over
    std::int64_t dnsCheckInterval;               // seconds
    std::int64_t prevDNSCheckTime;               // seconds since the epoch
    bool forceDNSCheck = false;
    bool forceConnect = false;
    std::string responseExternalIP;
};

/// Records on every return path that a check of the public names was made.
class ClearDNSCheck {
public:
    explicit ClearDNSCheck(ConnectionManager* manager) : pManager(manager) {}
    ~ClearDNSCheck();
    ClearDNSCheck(const ClearDNSCheck&) = delete;
    ClearDNSCheck& operator=(const ClearDNSCheck&) = delete;

private:
    ConnectionManager* pManager;
};

}  // namespace pelorus

#endif
