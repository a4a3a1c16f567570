#include "router/lease_tracking.h"

#include <ctime>
#include <limits>

namespace pelorus {

namespace {

// Configured durations may be anything; an instant beyond the range counts as its end.
long addSaturated(long start, long seconds) {
    long sum = 0;
    if (!__builtin_add_overflow(start, seconds, &sum)) return sum;
    return seconds < 0 ? std::numeric_limits<long>::min() : std::numeric_limits<long>::max();
}

long halfRoundedDown(long seconds) {
    return seconds / 2 - (seconds % 2 < 0 ? 1 : 0);
}

}  // namespace

void TimeIntervalTrack::setParams(long start, long seconds) {
    startTime = start;
    duration = seconds;
}

void TimeIntervalTrack::getParams(long& start, long& seconds) const {
    start = startTime;
    seconds = duration;
}

void TimeIntervalTrack::StartTheInterval() {
    startTime = std::time(nullptr);
}

void TimeIntervalTrack::SetIntervalDuration(int seconds) {
    duration = seconds;
}

bool TimeIntervalTrack::pastHalfway() const {
    return std::time(nullptr) > addSaturated(startTime, halfRoundedDown(duration));
}

bool TimeIntervalTrack::hasExpired() const {
    return std::time(nullptr) > addSaturated(startTime, duration);
}

void PMTracker::setParams(int internal, int external, unsigned leaseSeconds) {
    mapping.internalPort = internal;
    mapping.externalPort = external;
    mapping.lifetime = leaseSeconds;
    mapping.interval.setParams(std::time(nullptr), static_cast<long>(leaseSeconds));
}

void PMTracker::getParams(int& internal,
                          int& external,
                          unsigned& leaseSeconds,
                          TimeIntervalTrack& leaseInterval) const {
    internal = mapping.internalPort;
    external = mapping.externalPort;
    leaseSeconds = mapping.lifetime;
    leaseInterval = mapping.interval;
}

}  // namespace pelorus
