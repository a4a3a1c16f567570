// A stopwatch.
#ifndef PELORUS_ROUTER_TIMER_H
#define PELORUS_ROUTER_TIMER_H

#include <sys/time.h>

namespace pelorus {

/// Measures wall-clock time in microseconds. Reading a running timer does not stop it; every
/// reading logs the times stored before it.
class Timer {
public:
    void start();
    void stop();

    /// Time between start() and stop(), or until now while running. The coarser readings are cut,
    /// not rounded.
    [[nodiscard]] long getElapsedTimeInMicroSec();
    [[nodiscard]] long getElapsedTimeInMilliSec();
    [[nodiscard]] long getElapsedTimeInSec();
    [[nodiscard]] long getElapsedTime();

private:
    int stopped = 0;
    timeval startCount{};
    timeval endCount{};
};

}  // namespace pelorus

#endif
