#include "router/timer.h"

#include "support/fixture.h"

namespace pelorus {
namespace {

class TimerTest : public support::PelorusTest {};

TEST_F(TimerTest, MeasuresUntilItIsStopped) {
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
