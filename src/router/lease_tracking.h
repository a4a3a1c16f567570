// Time keeping for port mappings: intervals, and the lease of each mapped service.
#ifndef PELORUS_ROUTER_LEASE_TRACKING_H
#define PELORUS_ROUTER_LEASE_TRACKING_H

#include <cstdint>
#include <optional>

namespace pelorus {

/// A start time (seconds since the epoch) and a duration (seconds). Initially (0, 0), which is past
/// halfway and expired.
class TimeIntervalTrack {
public:
    void setParams(std::int64_t start, std::int64_t seconds);
    void getParams(std::int64_t& start, std::int64_t& seconds) const;

    /// Starts the interval now; the duration stays.
    void StartTheInterval();
    /// Changes the duration (seconds); the start stays.
    void SetIntervalDuration(int seconds);
    [[nodiscard]] std::int64_t GetIntervalDuration() const { return duration; }
    [[nodiscard]] std::int64_t GetIntervalStartTime() const { return startTime; }

    /// True once more than half of the duration, rounded down, has passed.
    [[nodiscard]] bool pastHalfway() const;
    /// True once more than the duration has passed.
    [[nodiscard]] bool hasExpired() const;

private:
    std::int64_t startTime = 0;
    std::int64_t duration = 0;
};

/// What a PMTracker holds.
struct TrackedMapping {
    int internalPort = 0;
    int externalPort = 0;
    unsigned lifetime = 0;  ///< seconds
    TimeIntervalTrack interval;
};

/// One port mapping and its lease. All zero means that nothing is tracked. Such a tracker counts as
/// due: UPnP refuses to renew port 0, NAT-PMP sends the request.
class PMTracker {
public:
    /// Records a mapping and starts its lease (@p leaseSeconds) now. (0, 0, 0) forgets it.
    void setParams(int internal, int external, unsigned leaseSeconds);
    void getParams(int& internal,
                   int& external,
                   unsigned& leaseSeconds,
                   TimeIntervalTrack& leaseInterval) const;
    /// The same four as one value.
    [[nodiscard]] TrackedMapping read() const { return mapping; }

    /// True once more than half of the lease has passed: the mapping is due for renewal.
    [[nodiscard]] bool pastHalfway() const { return mapping.interval.pastHalfway(); }

private:
    TrackedMapping mapping;
};

/// The lease to ask for, and the mappings of the device's two services.
struct GWPortsTracker {
    static constexpr unsigned kDefaultLifetime = 172800;  ///< seconds, two days

    enum class Service {
        NONE,
        HTTP,
        HTTPS,
    };
    /// What forget() has dropped.
    struct Forgotten {
        Service service = Service::NONE;
        TrackedMapping mapping;  ///< as it was; the HTTPS one when the service is NONE
    };

    /// Records a mapping, starts its lease (seconds) and returns what is tracked now.
    TrackedMapping track(bool isHttps, int internalPort, int externalPort, unsigned lease);
    /// Forgets the mapping of @p internalPort, HTTP before HTTPS. Port 0 stands for no mapping and
    /// matches neither, idle trackers included.
    Forgotten forget(int internalPort);
    void forgetAll();
    /// The mapping of a service once more than half of its lease has passed, else nothing.
    [[nodiscard]] std::optional<TrackedMapping> due(bool isHttps) const;

    unsigned reqLifetime = kDefaultLifetime;
    PMTracker http;
    PMTracker https;
};

}  // namespace pelorus

#endif
