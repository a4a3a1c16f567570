#include <cstdint>

#include "router/lease_tracking.h"
#include "router/timer.h"
#include "support/fixture.h"

namespace pelorus {
namespace {

using TimeKeepingTest = support::PelorusTest;

TEST_F(TimeKeepingTest, AnIntervalIsJudgedByTheClock) {
    const auto row = [&](std::int64_t start, std::int64_t span, time_t now, bool half, bool over) {
        TimeIntervalTrack interval;
        interval.setParams(start, span);
        clock.set(now);
        EXPECT_EQ(interval.pastHalfway(), half) << start << " + " << span;
        EXPECT_EQ(interval.hasExpired(), over) << start << " + " << span;
    };
    row(1000, 604800, 303400, false, false);
    row(1000, 5, 1003, true, false);  // half of an odd duration is rounded down
    row(1000, -1, 1000, true, true);  // also below zero
    row(1000, 60, 1060, true, false);
    row(1000, 60, 1061, true, true);
    row(INT64_MAX, INT64_MAX, 5000, false, false);
    row(-10, INT64_MIN, 5000, true, true);
}

TEST_F(TimeKeepingTest, ALeaseStartsWhenItIsRecorded) {
    PMTracker tracker;
    EXPECT_TRUE(tracker.pastHalfway());
    tracker.setParams(8080, 9091, 4294967295U);
    EXPECT_FALSE(tracker.pastHalfway());
    TrackedMapping held;
    tracker.getParams(held.internalPort, held.externalPort, held.lifetime, held.interval);
    std::int64_t start = 0, seconds = 0;
    held.interval.getParams(start, seconds);
    EXPECT_TRUE(held.internalPort == 8080 && held.externalPort == 9091 && start == clock.now());
    EXPECT_TRUE(seconds == 4294967295 && held.lifetime == 4294967295U);
}

TEST_F(TimeKeepingTest, ATimerMeasuresUntilItIsStopped) {
    Timer timer;
    clock.micros = 10'900'000;
    timer.start();
    clock.micros += 3'700'000;
    EXPECT_EQ(timer.getElapsedTimeInSec() + timer.getElapsedTime(), 3 + 3);
    EXPECT_EQ(timer.getElapsedTimeInMilliSec(), 3700);
    timer.stop();
    clock.advance(30);
    EXPECT_EQ(timer.getElapsedTimeInMicroSec(), 3700000);
    EXPECT_EQ(log.countPart("end.sec[14] end.usec[600000] start.sec[10] start.usec[900000]"), 1);
}

}  // namespace
}  // namespace pelorus
