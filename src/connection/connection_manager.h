// How the device is made reachable, decided once per cycle.
#ifndef PELORUS_CONNECTION_CONNECTION_MANAGER_H
#define PELORUS_CONNECTION_CONNECTION_MANAGER_H

#include <ctime>
#include <memory>
#include <string>
#include <vector>

#include "common/connection_types.h"
#include "router/router.h"

namespace pelorus {

/// Chooses between a direct connection through forwarded ports and a relayed one, proves it,
/// publishes it, keeps it up and tears it down. The members are implemented by subject, one
/// source each.
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

    /// Least time between two checks of the public names, seconds.
    [[nodiscard]] long getDNSCheckInterval() const { return dnsCheckInterval; }
    void setDNSCheckInterval(long seconds) { dnsCheckInterval = seconds; }

    /// Leases to ask for, seconds. Until the gateway object exists both read as
    /// Router::INVALID_LEASE_DURATION.
    void setReqPortMappingLifetime(unsigned upnp, unsigned natpmp);
    void getReqPortMappingLifetime(unsigned& upnp, unsigned& natpmp) const;

    /// Checks the public names at the next chance, whatever the interval.
    void setForceDNSCheck(bool force) { forceDNSCheck = force; }
    /// Tests the port in the next attempt, whatever the interval and the disk.
    void setForceConnect(bool force);
    /// Records the address the server saw in a passed port test.
    void setResponseExternalIP(const std::string& ip) { responseExternalIP = ip; }
    /// Time of the last check of the public names, seconds since the epoch.
    void setPrevDNSCheckTime(long time) { prevDNSCheckTime = time; }
    /// Stretches the time between port tests by two minutes, up to sixteen.
    void increasePortTestInterval();

    // --- the stages of an attempt, each usable on its own -----------------------------------------

    /// Makes or keeps a direct connection. PORTFORWARDED, FAILED, or the connection type of
    /// before when nothing was due.
    ConnectionType createDirectConnection();

    /// Finds, maps and (HTTP only) tests an external port for @p internalPort: @p startPort first,
    /// then 99 ports from @p extendedStartPort unless @p defaultPortsOnly. Returns the port, or 0.
    /// A double NAT found on a pre-defined port of the maker's router returns 4, which callers
    /// take for a port until they look at the double-NAT flag.
    int forwardPort(int internalPort,
                    int startPort,
                    int extendedStartPort,
                    const std::string& externalIp,
                    HttpType type,
                    const std::string& description,
                    bool defaultPortsOnly,
                    bool checkSleep);

    /// Proves and publishes ports that the user forwarded by hand. PORTFORWARDED, FAILED, or the
    /// connection type of before.
    ConnectionType manualPortForward(int internalHttpPort,
                                     int internalHttpsPort,
                                     std::string localIp);

    /// Makes or keeps the relayed connection: RELAYED, FAILED, or PORTFORWARDED when both ports
    /// are mapped after all.
    ConnectionType createRelayConnection();

    /// Whether the device's public names resolve to it. True also when no check was due or there
    /// is nothing to compare with. May block for 30 seconds and the lookups.
    bool checkDNS(ConnectionType type);

    /// Builds the device's names. 1, or 0 when @p hostname or @p deviceId is missing.
    int buildDeviceDomainName(char* hostname,
                              const std::string& deviceId,
                              std::string& fourLevel,
                              std::string& threeLevel,
                              std::string& threeLevelHashed);

    /// The address the names must resolve to: the gateway's or the relay's. 1 when it is known.
    int fetchLocalDeviceDomainIPAddr(ConnectionType type, std::string& ip);

    /// The status word of @p type.
    [[nodiscard]] static std::string convertEnumConnectionType(ConnectionType type);

private:
    struct DirectAttempt;
    struct ForwardSearch;
    struct ManualAttempt;
    struct DeviceNames;

    ConnectionManager();
    ~ConnectionManager() = default;

    Router& router();
    void noteConnectionType();
    void clearMappedFlags();
    void unmapDevicePort(int internalPort, int externalPort);
    int testHttpPort(std::string& requestedIp, int port, bool checkSleep, bool skipDoubleNatCheck);

    // Stages of createDirectConnection().
    bool checkGateway(DirectAttempt& attempt);
    bool testPortsWithoutGateway(DirectAttempt& attempt);
    void readStatusFile(DirectAttempt& attempt);
    void dropOutdatedMappings(const DirectAttempt& attempt);
    void unmapAllocatedPorts(const DirectAttempt& attempt);
    void decideSleepCheck(DirectAttempt& attempt);
    bool retestMappedPorts(DirectAttempt& attempt);
    bool searchIsDue(const DirectAttempt& attempt);
    bool searchPorts(DirectAttempt& attempt);
    ConnectionType publishMapping(const DirectAttempt& attempt);
    ConnectionType giveUpMapping(const DirectAttempt& attempt);

    // Stages of forwardPort().
    bool tryPredefinedPorts(ForwardSearch& search, int& result);
    void mapCandidate(ForwardSearch& search);
    void mapInExtendedRange(ForwardSearch& search);
    bool mapDevicePort(const ForwardSearch& search, int& externalPort);
    bool testCandidate(ForwardSearch& search, int& result);
    [[nodiscard]] bool isBadPort(int port) const;

    // Stages of manualPortForward().
    void leaveAutomaticForwarding();
    void noticeManualChanges(ManualAttempt& attempt) const;
    void testManualPorts(ManualAttempt& attempt);
    void publishManualPorts(ManualAttempt& attempt);
    [[nodiscard]] ConnectionType endManualAttempt(const ManualAttempt& attempt) const;

    // Stages of createRelayConnection() and killConnection().
    ConnectionType startRelay();
    void removeMappings();
    void withdrawMappingRecord();

    // Stages of checkDNS().
    bool buildOwnNames(DeviceNames& names);
    bool namesLeadHere(const DeviceNames& names, ConnectionType type);
    void fetchExternalIp(std::string& ip);
    void fetchRelayIp(std::string& ip);

    std::unique_ptr<Router> pRouter;
    int allocatedHttpPort = 0;   // external; 0: none
    int allocatedHttpsPort = 0;  // external; 0: none
    int connTypeUnchangedCount = 0;
    int deviceType = 0;
    bool doubleNatDetected = false;
    time_t lastPortTestTime = 0;
    long portTestInterval;  // seconds
    bool httpPortMapped = false;
    bool httpsPortMapped = false;
    bool lastManualPortForward = false;
    ConnectionType connectionType = FAILED;
    ConnectionType prevConnectionType = FAILED;
    std::vector<int> badPorts;
    long dnsCheckInterval;  // seconds
    time_t prevDNSCheckTime;
    bool forceDNSCheck = false;
    bool forceConnect = false;
    std::string responseExternalIP;
};

/// Records that a check of the public names was made, on every way out of it.
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
