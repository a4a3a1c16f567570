// The addresses under which manually forwarded ports were last published.
#ifndef PELORUS_CONNECTION_NETWORK_ADDRS_H
#define PELORUS_CONNECTION_NETWORK_ADDRS_H

#include <memory>
#include <string>

#include "router/lease_tracking.h"
#include "router/router.h"

namespace pelorus {

/// Remembers the published addresses and tells whether they have changed since. Without a gateway
/// that can be asked, the external address comes from the central server, at most once per
/// interval.
class NetworkAddrs {
public:
    static constexpr int kDefaultInterval = 720;  ///< seconds

    static NetworkAddrs* getInstance();
    NetworkAddrs(const NetworkAddrs&) = delete;
    NetworkAddrs& operator=(const NetworkAddrs&) = delete;

    /// Forgets both addresses and both changes. The interval goes on.
    void init();
    /// Least time between two questions to the server, seconds.
    void SetIntervalDuration(int seconds);
    /// Records what was published, clears the changes and starts the interval.
    void setNetworkAddrs(const std::string& externalIp, const std::string& localIp);

    /// Finds the present addresses and compares them with the recorded ones, which stay as they
    /// are. 1 when that was done; 0 when nothing is recorded yet, the interval has not passed or
    /// the server gave no address, with the change flags as they were.
    int discoverNetworkAddrs();

    [[nodiscard]] bool haveNetworkAddrsChanged() const;
    [[nodiscard]] bool hasExternalIPChanged() const { return externalIPChanged; }
    [[nodiscard]] bool hasInternalIPChanged() const { return internalIPChanged; }
    void clearIPChanged();

    /// The recorded addresses; empty when there are none.
    [[nodiscard]] const std::string& getExternalIp() const { return externalIP; }
    [[nodiscard]] const std::string& getLocalIp() const { return localIP; }

    /// The external address as the server sees it. 1 and @p out on success, else 0. Waits as long
    /// as the server asks for a pause, without a bound; only a termination signal ends that.
    int getMyIP(std::string& out);

private:
    NetworkAddrs();
    ~NetworkAddrs() = default;

    bool findExternalIp(std::string& discovered);

    std::string externalIP;
    std::string localIP;
    std::unique_ptr<Router> pRouter;
    bool externalIPChanged = false;
    bool internalIPChanged = false;
    TimeIntervalTrack interval;
};

}  // namespace pelorus

#endif
