
#include <cstdint>
#include <limits>

#include "router/lease_tracking.h"
#include "router/timer.h"
#include "support/fixture.h"

namespace pelorus {
namespace {

using Limits = std::numeric_limits<std::int64_t>;

class TimeKeepingTest : public support::PelorusTest {};

TEST_F(TimeKeepingTest, AnIntervalIsJudgedByTheClock) {
    struct Instant {
        std::int64_t start, duration;
        time_t now;
        bool pastHalfway, expired;
    };
    // clang-format off
    for (const Instant& at : {
             Instant{1000, 604800, 303400, false, false}, {1000, 604800, 303401, true, false},
             {1000, 5, 1003, true, false},   // half of an odd duration is rounded down
             {1000, -1, 1000, true, true},   // also below zero
             {1000, 60, 1060, true, false}, {1000, 60, 1061, true, true}, {0, 0, 1, true, true},
             {Limits::max(), Limits::max(), 5000, false, false}, {-10, Limits::min(), 5000, true, true}}) {
        // clang-format on
        TimeIntervalTrack interval;
        interval.setParams(at.start, at.duration);
        clock.set(at.now);
        EXPECT_EQ(interval.pastHalfway(), at.pastHalfway) << at.start << " + " << at.duration;
        EXPECT_EQ(interval.hasExpired(), at.expired) << at.start << " + " << at.duration;
    }
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
    clock.advance(2);
    EXPECT_EQ(timer.getElapsedTimeInSec(), 2);
    static_cast<void>(clock.wait(1700000, nullptr));
    EXPECT_EQ(timer.getElapsedTimeInMilliSec(), 3700);
    timer.stop();
    clock.advance(30);
    log.clear();
    EXPECT_EQ(timer.getElapsedTimeInMicroSec(), 3700000);
    EXPECT_EQ(timer.getElapsedTime(), 3);
    EXPECT_EQ(
        log.lines().front().text,
        "Timer::getElapsedTimeInMicroSec - end.sec[14] end.usec[600000] start.sec[10] start.usec[900000]\n");
}

}  // namespace
}  // namespace pelorus
