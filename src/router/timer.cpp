#include "router/timer.h"

#include "common/log.h"

namespace pelorus {

namespace {

constexpr int kMicrosPerSecond = 1000000;
constexpr int kMicrosPerMilli = 1000;

}  // namespace

void Timer::start() {
    stopped = 0;
    gettimeofday(&startCount, nullptr);
}

void Timer::stop() {
    stopped = 1;
    gettimeofday(&endCount, nullptr);
}

std::int64_t Timer::getElapsedTimeInMicroSec() {
    const std::int64_t endSeconds = endCount.tv_sec;
    const std::int64_t endMicros = endCount.tv_usec;
    const std::int64_t startSeconds = startCount.tv_sec;
    const std::int64_t startMicros = startCount.tv_usec;
    logInfo(
        "Timer::getElapsedTimeInMicroSec - end.sec[%jd] end.usec[%jd] start.sec[%jd] start.usec[%jd]\n",
        endSeconds, endMicros, startSeconds, startMicros);
    if (stopped == 0) gettimeofday(&endCount, nullptr);
    if (endCount.tv_usec < startCount.tv_usec) {
        endCount.tv_usec += kMicrosPerSecond;
        endCount.tv_sec -= 1;
    }
    const std::int64_t seconds = endCount.tv_sec - startCount.tv_sec;
    return seconds * kMicrosPerSecond + (endCount.tv_usec - startCount.tv_usec);
}

std::int64_t Timer::getElapsedTimeInMilliSec() {
    return getElapsedTimeInMicroSec() / kMicrosPerMilli;
}

std::int64_t Timer::getElapsedTimeInSec() {
    return getElapsedTimeInMicroSec() / kMicrosPerSecond;
}

std::int64_t Timer::getElapsedTime() {
    return getElapsedTimeInSec();
}

}  // namespace pelorus
