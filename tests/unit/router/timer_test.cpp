#include "router/timer.h"

#include "support/fixture.h"

namespace pelorus {
namespace {

using support::VirtualClock;

class TimerTest : public support::PelorusTest {
protected:
    /// Sets the clock to an instant with a part of a second.
    void setClock(time_t seconds, long micros) {
        clock.set(seconds);
        static_cast<void>(clock.wait(micros, nullptr));
    }
    Timer timer;
};

TEST_F(TimerTest, BorrowsASecondOnceAndCutsTheCoarserReadings) {
    setClock(10, 900000);
    timer.start();
    setClock(12, 100000);
    timer.stop();
    setClock(50, 0);
    EXPECT_EQ(timer.getElapsedTimeInMicroSec(), 1200000);
    EXPECT_EQ(timer.getElapsedTimeInMicroSec(), 1200000);
    EXPECT_EQ(timer.getElapsedTimeInMilliSec(), 1200);
    EXPECT_EQ(timer.getElapsedTimeInSec(), 1);
    EXPECT_EQ(timer.getElapsedTime(), 1);
    const std::string head = "Timer::getElapsedTimeInMicroSec - ";
    EXPECT_EQ(log.lines().front().text,
              head + "end.sec[12] end.usec[100000] start.sec[10] start.usec[900000]\n");
    EXPECT_EQ(log.lines().at(1).text,
              head + "end.sec[11] end.usec[1100000] start.sec[10] start.usec[900000]\n");
}

TEST_F(TimerTest, ARunningTimerReadsOnAndLogsTheReadingBefore) {
    timer.start();
    clock.advance(2);
    EXPECT_EQ(timer.getElapsedTimeInSec(), 2);
    clock.advance(3);
    EXPECT_EQ(timer.getElapsedTimeInSec(), 5);
    const long start = VirtualClock::kStart;
    const std::string started = " start.sec[" + std::to_string(start) + "] start.usec[0]\n";
    support::expectLogIs(
        {{LOG_INFO, "Timer::getElapsedTimeInMicroSec - end.sec[0] end.usec[0]" + started},
         {LOG_INFO, "Timer::getElapsedTimeInMicroSec - end.sec[" + std::to_string(start + 2) +
                        "] end.usec[0]" + started}});
}

TEST_F(TimerTest, StartingAgainForgetsTheStop) {
    timer.start();
    timer.stop();
    clock.advance(7);
    timer.start();
    clock.advance(1);
    EXPECT_EQ(timer.getElapsedTime(), 1);
}

}  // namespace
}  // namespace pelorus
