#include "router/lease_tracking.h"

#include <limits>

#include "support/fixture.h"

namespace pelorus {
namespace {

constexpr long kMost = std::numeric_limits<long>::max();
constexpr long kLeast = std::numeric_limits<long>::min();

struct Instant {
    const char* name;
    long start;
    long duration;
    time_t now;
    bool pastHalfway;
    bool expired;
};

class IntervalAt : public support::PelorusTest, public ::testing::WithParamInterface<Instant> {};

TEST_P(IntervalAt, IsJudgedByTheClock) {
    const Instant& row = GetParam();
    TimeIntervalTrack interval;
    interval.setParams(row.start, row.duration);
    clock.set(row.now);
    EXPECT_EQ(interval.pastHalfway(), row.pastHalfway);
    EXPECT_EQ(interval.hasExpired(), row.expired);
}

INSTANTIATE_TEST_SUITE_P(
    ,
    IntervalAt,
    ::testing::Values(Instant{"ExactlyHalfIsNotPastIt", 1000, 604800, 303400, false, false},
                      Instant{"OneSecondBeyondHalfIsPastIt", 1000, 604800, 303401, true, false},
                      Instant{"HalfOfOneSecondIsNone", 1000, 1, 1001, true, false},
                      Instant{"HalfOfAnOddDurationIsRoundedDown", 1000, 5, 1003, true, false},
                      Instant{"HalfOfMinusOneIsMinusOne", 1000, -1, 1000, true, true},
                      Instant{"MinusThreeIsRoundedDownToMinusTwo", 1000, -3, 998, false, true},
                      Instant{"TheEndItselfIsNotExpired", 1000, 60, 1060, true, false},
                      Instant{"OneSecondAfterTheEndIsExpired", 1000, 60, 1061, true, true},
                      Instant{"AnUnsetIntervalIsLongOver", 0, 0, 1, true, true},
                      Instant{"AnEndlessDurationNeverEnds", kMost, kMost, 5000, false, false},
                      Instant{"TheShortestDurationIsOver", -10, kLeast, 5000, true, true}),
    [](const auto& row) { return row.param.name; });

class LeaseTrackingTest : public support::PelorusTest {};

TEST_F(LeaseTrackingTest, StartingKeepsTheDurationAndADurationKeepsTheStart) {
    TimeIntervalTrack interval;
    interval.setParams(7, 100);
    interval.SetIntervalDuration(-50);
    EXPECT_EQ(interval.GetIntervalStartTime(), 7);
    clock.advance(10);
    interval.StartTheInterval();
    long start = 0;
    long duration = 0;
    interval.getParams(start, duration);
    EXPECT_EQ(start, clock.now());
    EXPECT_EQ(duration, -50);
}

TEST_F(LeaseTrackingTest, AMappingsLeaseStartsWhenItIsRecorded) {
    PMTracker tracker;
    EXPECT_TRUE(tracker.pastHalfway());
    clock.advance(5);
    tracker.setParams(8080, 9091, 4294967295U);
    int internal = 0;
    int external = 0;
    unsigned lifetime = 0;
    TimeIntervalTrack interval;
    tracker.getParams(internal, external, lifetime, interval);
    EXPECT_EQ(internal, 8080);
    EXPECT_EQ(external, 9091);
    EXPECT_EQ(lifetime, 4294967295U);
    EXPECT_EQ(interval.GetIntervalStartTime(), clock.now());
    EXPECT_EQ(interval.GetIntervalDuration(), 4294967295L);
    EXPECT_FALSE(tracker.pastHalfway());
}

TEST_F(LeaseTrackingTest, AForgottenMappingIsPastItsHalfFromTheNextSecondOn) {
    PMTracker tracker;
    tracker.setParams(0, 0, 0);
    EXPECT_FALSE(tracker.pastHalfway());
    clock.advance(1);
    EXPECT_TRUE(tracker.pastHalfway());
}

}  // namespace
}  // namespace pelorus
