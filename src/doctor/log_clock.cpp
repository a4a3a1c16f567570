#include "doctor/log_clock.h"

#include <algorithm>

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr auto kRepeated = 1h;         // at the end of summer time
constexpr auto kDisorder = 5min;       // of lines that a system logger received
constexpr auto kLost = 24h;            // a correction goes less far back
constexpr auto kSetRight = 1h;         // a smaller step ahead may be a pause between two lines
constexpr auto kLostAtMost = 24h * 7;  // else it is the clock before that was wrong
// In a log of more than a year whose stamps have none, the day before the oldest possible one counts
// as the latest. A device without a clock of its own jumps back less far until late in December.
constexpr auto kYear = 24h * 365;
constexpr auto kYearAtLeast = kYear - 24h * 6;
constexpr auto kAfterStart = 1h;

}  // namespace

Time LogClock::take(const LogLine& line, std::optional<Time> start) {
    const Time stamp = stampOf(line);
    correction.reset();
    if (!last) {
        now = stamp;
    } else if (lostSince) {
        goOnLost(stamp);
    } else if (stamp < now - kDisorder) {
        jumpBack(line);
    } else {
        const bool wasUnset =
            start && stamp - now > kUnsetClock && now >= *start && now - *start < kAfterStart;
        if (wasUnset) {
            ++jumps;
            correction = {*start, stamp, {}};
        }
        now = std::max(now, stamp);
    }
    last = stamp;
    return now;
}

// In an hour that comes twice, time goes on.
Time LogClock::stampOf(const LogLine& line) const {
    const bool isSecond = line.isTwice && last && !lostSince && line.when < now - kDisorder &&
                          line.when + kRepeated >= now - kDisorder;
    return isSecond ? line.when + kRepeated : line.when;
}

void LogClock::jumpBack(const LogLine& line) {
    const Time stamp = line.when;
    if (!line.isYearKnown && now - stamp > kYearAtLeast && now - stamp <= kYear) {
        correction = {Time::max(), stamp, kYear};
        now = stamp;
        return;
    }
    ++jumps;
    if (now - stamp > kLost) {
        lostSince = stamp;
        now += 1s;  // what the last line told stays where it is
        return;
    }
    correction = {stamp, stamp, {}};
    now = stamp;
}

// Until the clock is set, all that happens counts as of the last line before.
void LogClock::goOnLost(Time stamp) {
    if (stamp < *lostSince) lostSince = stamp;
    const bool isSet = stamp - *last > kSetRight && stamp >= now - kDisorder;
    const bool wasRight = stamp - *lostSince > kLostAtMost || stamp >= now;
    if (!isSet && !wasRight) return;
    if (isSet) {
        correction = {now, stamp, {}};
    } else {
        correction = {*lostSince, *lostSince, {}};  // the clock before that was ahead
    }
    now = stamp;
    lostSince.reset();
}

}  // namespace pelorus::doctor
