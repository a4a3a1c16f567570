#include "router/timer.h"

#include "common/log.h"

namespace pelorus {

namespace {

constexpr long kMicrosPerSecond = 1000000;
constexpr long kMicrosPerMilli = 1000;

}  // namespace

void Timer::start() {
    stopped = 0;
    gettimeofday(&startCount, nullptr);
}

void Timer::stop() {
    stopped = 1;
    gettimeofday(&endCount, nullptr);
}

long Timer::getElapsedTimeInMicroSec() {
    logInfo(
        "Timer::getElapsedTimeInMicroSec - end.sec[%ld] end.usec[%ld] start.sec[%ld] start.usec[%ld]\n",
        static_cast<long>(endCount.tv_sec), static_cast<long>(endCount.tv_usec),
        static_cast<long>(startCount.tv_sec), static_cast<long>(startCount.tv_usec));
    if (stopped == 0) gettimeofday(&endCount, nullptr);
    if (endCount.tv_usec < startCount.tv_usec) {
        endCount.tv_usec += kMicrosPerSecond;
        endCount.tv_sec -= 1;
    }
    return (endCount.tv_sec - startCount.tv_sec) * kMicrosPerSecond +
           (endCount.tv_usec - startCount.tv_usec);
}

long Timer::getElapsedTimeInMilliSec() {
    return getElapsedTimeInMicroSec() / kMicrosPerMilli;
}

long Timer::getElapsedTimeInSec() {
    return getElapsedTimeInMicroSec() / kMicrosPerSecond;
}

long Timer::getElapsedTime() {
    return getElapsedTimeInSec();
}

}  // namespace pelorus
