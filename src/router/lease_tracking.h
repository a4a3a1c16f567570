// Time keeping for port mappings: intervals, and the lease of each mapped service.
#ifndef PELORUS_ROUTER_LEASE_TRACKING_H
#define PELORUS_ROUTER_LEASE_TRACKING_H

namespace pelorus {

/// A start time (seconds since the epoch) and a duration (seconds). Starts as (0, 0), which is
/// both past its half and expired.
class TimeIntervalTrack {
public:
    void setParams(long start, long seconds);
    void getParams(long& start, long& seconds) const;

    /// Starts the interval now; the duration stays.
    void StartTheInterval();
    /// Changes the duration (seconds); the start stays.
    void SetIntervalDuration(int seconds);
    [[nodiscard]] long GetIntervalDuration() const { return duration; }
    [[nodiscard]] long GetIntervalStartTime() const { return startTime; }

    /// True once more than half of the duration, rounded down, has passed.
    [[nodiscard]] bool pastHalfway() const;
    /// True once more than the duration has passed.
    [[nodiscard]] bool hasExpired() const;

private:
    long startTime = 0;
    long duration = 0;
};

/// What a PMTracker holds.
struct TrackedMapping {
    int internalPort = 0;
    int externalPort = 0;
    unsigned lifetime = 0;  ///< seconds
    TimeIntervalTrack interval;
};

/// One port mapping and its lease. All zero means that nothing is tracked; such a tracker is past
/// its half, so a renewal of it is attempted and has to be refused by the mapping call.
class PMTracker {
public:
    /// Records a mapping and starts its lease (@p leaseSeconds) now. (0, 0, 0) forgets it.
    void setParams(int internal, int external, unsigned leaseSeconds);
    void getParams(int& internal,
                   int& external,
                   unsigned& leaseSeconds,
                   TimeIntervalTrack& leaseInterval) const;
    /// The same four in one piece.
    [[nodiscard]] TrackedMapping read() const { return mapping; }

    /// True once more than half of the lease has passed: the mapping is due for renewal.
    [[nodiscard]] bool pastHalfway() const { return mapping.interval.pastHalfway(); }

private:
    TrackedMapping mapping;
};

/// The lease to ask for, and the mappings of the device's two services.
struct GWPortsTracker {
    static constexpr unsigned kDefaultLifetime = 172800;  ///< seconds, two days

    unsigned reqLifetime = kDefaultLifetime;
    PMTracker http;
    PMTracker https;
};

}  // namespace pelorus

#endif
