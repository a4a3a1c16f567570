#include "support/virtual_clock.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace pelorus::support {

namespace {

// Delivers a pending signal that the mask lets through; false when there is none.
bool deliverPending(const sigset_t* mask) {
    sigset_t pending;
    sigpending(&pending);
    for (int signal = 1; mask != nullptr && signal < NSIG; ++signal) {
        if (sigismember(&pending, signal) != 1 || sigismember(mask, signal) == 1) continue;
        sigset_t own;
        pthread_sigmask(SIG_SETMASK, mask, &own);
        pthread_sigmask(SIG_SETMASK, &own, nullptr);
        return true;
    }
    return false;
}

}  // namespace

void VirtualClock::duringPause(int number, Action action) {
    actions[asked.size() + static_cast<std::size_t>(number)] = std::move(action);
}

bool VirtualClock::wait(std::int64_t waitMicros, const sigset_t* mask) {
    constexpr std::size_t kMostPauses = 100'000;
    asked.push_back(static_cast<long>(waitMicros / kMicrosPerSecond));
    if (asked.size() > kMostPauses) {
        std::fputs("virtual clock: the code under test pauses for ever\n", stderr);
        std::abort();
    }
    if (const auto found = actions.find(asked.size()); found != actions.end()) found->second();
    if (deliverPending(mask)) return true;
    micros += waitMicros;
    return false;
}

extern "C" {
unsigned __real_sleep(unsigned seconds);

time_t __wrap_time(time_t* result) {
    const time_t now = VirtualClock::get().now();
    if (result != nullptr) *result = now;
    return now;
}

int __wrap_gettimeofday(timeval* result, void* /*zone*/) {
    *result = VirtualClock::get().timeOfDay();
    return 0;
}

unsigned __wrap_sleep(unsigned seconds) {
    // A thread of the test tool itself; the daemon has one thread.
    if (gettid() != getpid()) return __real_sleep(seconds);
    VirtualClock::get().wait(std::int64_t{seconds} * 1'000'000, nullptr);
    return 0;
}

int __wrap_ppoll(pollfd* /*fds*/, nfds_t count, const timespec* timeout, const sigset_t* mask) {
    EXPECT_EQ(count, 0U) << "only a pause without descriptors is known here";
    const std::int64_t micros = std::int64_t{timeout->tv_sec} * 1'000'000 + timeout->tv_nsec / 1000;
    if (!VirtualClock::get().wait(micros, mask)) return 0;
    errno = EINTR;
    return -1;
}
}

}  // namespace pelorus::support
