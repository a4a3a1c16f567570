#include <cstdint>
#include <limits>

#include "router/lease_tracking.h"
#include "router/timer.h"
#include "support/fixture.h"

namespace pelorus {
namespace {

using TimeKeepingTest = support::PelorusTest;

TEST_F(TimeKeepingTest, AnIntervalIsJudgedByTheClock) {
    const auto row = [&](std::int64_t start, std::int64_t duration, time_t now, bool pastHalfway,
                         bool expired) {
        TimeIntervalTrack interval;
        interval.setParams(start, duration);
        clock.set(now);
        EXPECT_EQ(interval.pastHalfway(), pastHalfway) << start << " + " << duration;
        EXPECT_EQ(interval.hasExpired(), expired) << start << " + " << duration;
    };
    using Limits = std::numeric_limits<std::int64_t>;
    row(1000, 604800, 303400, false, false);
    row(1000, 604800, 303401, true, false);
    row(1000, 5, 1003, true, false);  // half of an odd duration is rounded down
    row(1000, -1, 1000, true, true);  // also below zero
    row(1000, 60, 1060, true, false);
    row(1000, 60, 1061, true, true);
    row(0, 0, 1, true, true);
    row(Limits::max(), Limits::max(), 5000, false, false);
    row(-10, Limits::min(), 5000, true, true);
}

TEST_F(TimeKeepingTest, ALeaseStartsWhenItIsRecorded) {
    PMTracker tracker;
    EXPECT_TRUE(tracker.pastHalfway());
    tracker.setParams(8080, 9091, 4294967295U);
    EXPECT_FALSE(tracker.pastHalfway());
    int internalPort = 0, externalPort = 0;
    unsigned lifetime = 0;
    TimeIntervalTrack interval;
    tracker.getParams(internalPort, externalPort, lifetime, interval);
    EXPECT_TRUE(internalPort == 8080 && externalPort == 9091 && lifetime == 4294967295U);
    std::int64_t start = 0, duration = 0;
    interval.getParams(start, duration);
    EXPECT_TRUE(start == clock.now() && duration == 4294967295);
}

TEST_F(TimeKeepingTest, ATimerMeasuresUntilItIsStopped) {
    Timer timer;
    clock.set(10);
    static_cast<void>(clock.wait(900000, nullptr));
    timer.start();
    static_cast<void>(clock.wait(3700000, nullptr));
    EXPECT_EQ(timer.getElapsedTimeInSec() + timer.getElapsedTime(), 3 + 3);
    EXPECT_EQ(timer.getElapsedTimeInMilliSec(), 3700);
    timer.stop();
    clock.advance(30);
    EXPECT_EQ(timer.getElapsedTimeInMicroSec(), 3700000);
    EXPECT_EQ(log.countPart("end.sec[14] end.usec[600000] start.sec[10] start.usec[900000]"), 1);
}

}  // namespace
}  // namespace pelorus
