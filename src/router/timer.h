// A stopwatch.
#ifndef PELORUS_ROUTER_TIMER_H
#define PELORUS_ROUTER_TIMER_H

#include <sys/time.h>

#include <cstdint>

namespace pelorus {

/// Measures wall-clock time in microseconds. Reading a running timer does not stop it. Each reading
/// logs the times as they were stored before it.
class Timer {
public:
    void start();
    void stop();

    /// Time between start() and stop(), or until now while running. The coarser readings are
    /// truncated, not rounded.
    [[nodiscard]] std::int64_t getElapsedTimeInMicroSec();
    [[nodiscard]] std::int64_t getElapsedTimeInMilliSec();
    [[nodiscard]] std::int64_t getElapsedTimeInSec();
    [[nodiscard]] std::int64_t getElapsedTime();

private:
    int stopped = 0;
    timeval startCount{};
    timeval endCount{};
};

}  // namespace pelorus

#endif
