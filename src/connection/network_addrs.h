// The addresses under which manually forwarded ports were last published.
#ifndef PELORUS_CONNECTION_NETWORK_ADDRS_H
#define PELORUS_CONNECTION_NETWORK_ADDRS_H

#include <memory>
#include <optional>
#include <string>

#include "router/lease_tracking.h"
#include "router/router.h"

namespace pelorus {

/// Remembers the published addresses and tells whether they have changed since. When no gateway
/// answers, the external address comes from the central server, at most once per interval.
class NetworkAddrs {
public:
    static constexpr int kDefaultInterval = 720;  ///< seconds

    static NetworkAddrs* getInstance();
    NetworkAddrs(const NetworkAddrs&) = delete;
    NetworkAddrs& operator=(const NetworkAddrs&) = delete;

    /// Clears both addresses and change flags; the interval keeps running.
    void init();
    /// Minimum time between two queries to the server, seconds.
    void SetIntervalDuration(int seconds);
    /// Records what was published, clears the change flags and restarts the interval.
    void setNetworkAddrs(const std::string& externalIp, const std::string& localIp);

    /// Finds the current addresses and compares them with the recorded ones, which do not change.
    /// Returns 1 when that was done; 0, with the change flags untouched, when nothing is recorded
    /// yet, the interval has not passed or the server gave no address.
    int discoverNetworkAddrs();

    [[nodiscard]] bool haveNetworkAddrsChanged() const;
    [[nodiscard]] bool hasExternalIPChanged() const { return externalIPChanged; }
    [[nodiscard]] bool hasInternalIPChanged() const { return internalIPChanged; }
    void clearIPChanged();

    /// The recorded addresses; empty when there are none.
    [[nodiscard]] const std::string& getExternalIp() const { return externalIP; }
    [[nodiscard]] const std::string& getLocalIp() const { return localIP; }

    /// The external address as the server sees it. Returns 1 and sets @p out, or 0. Waits,
    /// without a limit, as long as the server keeps asking for a pause; only a termination signal
    /// ends that.
    int getMyIP(std::string& out);

private:
    NetworkAddrs();
    ~NetworkAddrs() = default;

    std::optional<std::string> findExternalIp();

    std::string externalIP;
    std::string localIP;
    std::unique_ptr<Router> pRouter;
    bool externalIPChanged = false;
    bool internalIPChanged = false;
    TimeIntervalTrack interval;
};

}  // namespace pelorus

#endif
