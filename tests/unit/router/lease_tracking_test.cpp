#include "router/lease_tracking.h"

#include <cstdint>
#include <limits>

#include "support/fixture.h"

namespace pelorus {
namespace {

using Limits = std::numeric_limits<std::int64_t>;

struct Instant {
    const char* name;
    std::int64_t start;
    std::int64_t duration;
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

// clang-format off
INSTANTIATE_TEST_SUITE_P(, IntervalAt, ::testing::Values(
    Instant{"ExactlyHalfIsNotPastIt", 1000, 604800, 303400, false, false},
    Instant{"OneSecondBeyondHalfIsPastIt", 1000, 604800, 303401, true, false},
    Instant{"HalfOfAnOddDurationIsRoundedDown", 1000, 5, 1003, true, false},
    Instant{"HalfOfMinusOneIsMinusOne", 1000, -1, 1000, true, true},
    Instant{"TheEndItselfIsNotExpired", 1000, 60, 1060, true, false},
    Instant{"OneSecondAfterTheEndIsExpired", 1000, 60, 1061, true, true},
    Instant{"AnUnsetIntervalIsLongOver", 0, 0, 1, true, true},
    Instant{"AnEndlessDurationNeverEnds", Limits::max(), Limits::max(), 5000, false, false},
    Instant{"TheShortestDurationIsOver", -10, Limits::min(), 5000, true, true}),
    support::RowName{});
// clang-format on

class LeaseTrackingTest : public support::PelorusTest {};

TEST_F(LeaseTrackingTest, ALeaseStartsWhenItIsRecorded) {
    PMTracker tracker;
    EXPECT_TRUE(tracker.pastHalfway());
    tracker.setParams(8080, 9091, 4294967295U);
    int internalPort = 0;
    int externalPort = 0;
    unsigned lifetime = 0;
    TimeIntervalTrack interval;
    tracker.getParams(internalPort, externalPort, lifetime, interval);
    EXPECT_EQ(internalPort, 8080);
    EXPECT_EQ(externalPort, 9091);
    EXPECT_EQ(lifetime, 4294967295U);
    std::int64_t start = 0;
    std::int64_t duration = 0;
    interval.getParams(start, duration);
    EXPECT_EQ(start, clock.now());
    EXPECT_EQ(duration, 4294967295);
    EXPECT_FALSE(tracker.pastHalfway());
    tracker.setParams(0, 0, 0);
    EXPECT_FALSE(tracker.pastHalfway());
    clock.advance(1);
    EXPECT_TRUE(tracker.pastHalfway());
}

}  // namespace
}  // namespace pelorus
