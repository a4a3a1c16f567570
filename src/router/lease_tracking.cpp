#include "router/lease_tracking.h"

#include <cstdint>
#include <ctime>
#include <limits>

namespace pelorus {

namespace {

// A configured duration may be of any size; an instant out of range becomes the nearest limit.
std::int64_t addSaturated(std::int64_t start, std::int64_t seconds) {
    std::int64_t sum = 0;
    if (!__builtin_add_overflow(start, seconds, &sum)) return sum;
    return seconds < 0 ? std::numeric_limits<std::int64_t>::min()
                       : std::numeric_limits<std::int64_t>::max();
}

std::int64_t halfRoundedDown(std::int64_t seconds) {
    return seconds / 2 - (seconds % 2 < 0 ? 1 : 0);
}

}  // namespace

void TimeIntervalTrack::setParams(std::int64_t start, std::int64_t seconds) {
    startTime = start;
    duration = seconds;
}

void TimeIntervalTrack::getParams(std::int64_t& start, std::int64_t& seconds) const {
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
    mapping.interval.setParams(std::time(nullptr), leaseSeconds);
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

TrackedMapping GWPortsTracker::track(bool isHttps,
                                     int internalPort,
                                     int externalPort,
                                     unsigned lease) {
    PMTracker& tracker = isHttps ? https : http;
    tracker.setParams(internalPort, externalPort, lease);
    return tracker.read();
}

GWPortsTracker::Forgotten GWPortsTracker::forget(int internalPort) {
    const TrackedMapping heldHttp = http.read();
    const TrackedMapping heldHttps = https.read();
    if (internalPort != 0 && heldHttp.internalPort == internalPort) {
        http.setParams(0, 0, 0);
        return {Service::HTTP, heldHttp};
    }
    if (internalPort != 0 && heldHttps.internalPort == internalPort) {
        https.setParams(0, 0, 0);
        return {Service::HTTPS, heldHttps};
    }
    return {Service::NONE, heldHttps};
}

void GWPortsTracker::forgetAll() {
    http.setParams(0, 0, 0);
    https.setParams(0, 0, 0);
}

std::optional<TrackedMapping> GWPortsTracker::due(bool isHttps) const {
    const PMTracker& tracker = isHttps ? https : http;
    if (!tracker.pastHalfway()) return std::nullopt;
    return tracker.read();
}

}  // namespace pelorus
