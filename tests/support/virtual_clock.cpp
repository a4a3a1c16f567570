#include "support/virtual_clock.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace pelorus::support {

namespace {

void runAll(std::multimap<std::size_t, VirtualClock::Action>& actions, std::size_t number) {
    for (auto found = actions.find(number); found != actions.end(); found = actions.find(number)) {
        const VirtualClock::Action action = std::move(found->second);
        actions.erase(found);
        action();
    }
}

}  // namespace

VirtualClock& VirtualClock::get() {
    static VirtualClock instance;
    return instance;
}

void VirtualClock::beforePause(int number, Action action) {
    before.emplace(asked.size() + static_cast<std::size_t>(number), std::move(action));
}

void VirtualClock::duringPause(int number, Action action) {
    during.emplace(asked.size() + static_cast<std::size_t>(number), std::move(action));
}

void VirtualClock::raiseSignal(int signal) {
    EXPECT_EQ(std::raise(signal), 0);
    // A blocked one waits for the mask of the pause to let it in.
    sigset_t pending;
    sigpending(&pending);
    if (sigismember(&pending, signal) != 1) interrupted = true;
}

void VirtualClock::reset() {
    micros = kStart * kMicrosPerSecond;
    asked.clear();
    before.clear();
    during.clear();
    timed.clear();
    interrupted = false;
}

timeval VirtualClock::timeOfDay() const {
    return {now(), static_cast<suseconds_t>(micros % kMicrosPerSecond)};
}

bool VirtualClock::deliverPending(const sigset_t* mask) {
    if (mask == nullptr) return false;
    sigset_t pending;
    sigpending(&pending);
    for (int signal = 1; signal < NSIG; ++signal) {
        if (sigismember(&pending, signal) != 1 || sigismember(mask, signal) == 1) continue;
        sigset_t own;
        pthread_sigmask(SIG_SETMASK, mask, &own);
        pthread_sigmask(SIG_SETMASK, &own, nullptr);
        return true;
    }
    return false;
}

void VirtualClock::enterPause(long waitMicros) {
    asked.push_back(waitMicros / kMicrosPerSecond);
    if (asked.size() > kMostPauses) {
        std::fputs("virtual clock: the code under test pauses for ever\n", stderr);
        std::abort();
    }
    runAll(before, asked.size());
    interrupted = false;
    runAll(during, asked.size());
}

VirtualClock::Waited VirtualClock::wait(long waitMicros, const sigset_t* mask) {
    enterPause(waitMicros);
    const long end = micros + waitMicros;
    const auto signalled = [&] {
        const bool delivered = deliverPending(mask) || interrupted;
        interrupted = false;
        return delivered;
    };
    if (signalled()) return {true, waitMicros};
    while (!timed.empty() && timed.begin()->first * kMicrosPerSecond <= end) {
        const auto next = timed.begin();
        const Action action = std::move(next->second);
        if (next->first > now()) micros = next->first * kMicrosPerSecond;
        timed.erase(next);
        action();
        if (signalled()) return {true, end - micros};
    }
    micros = end;
    return {false, 0};
}

}  // namespace pelorus::support

using pelorus::support::VirtualClock;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
unsigned __real_sleep(unsigned seconds);
time_t __wrap_time(time_t* result);
int __wrap_gettimeofday(timeval* result, void* zone);
unsigned __wrap_sleep(unsigned seconds);
int __wrap_ppoll(pollfd* fds, nfds_t count, const timespec* timeout, const sigset_t* mask);
}

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
    constexpr long kMicros = 1'000'000;
    const auto waited = VirtualClock::get().wait(static_cast<long>(seconds) * kMicros, nullptr);
    // The seconds left, rounded up as the kernel does.
    return static_cast<unsigned>((waited.left + kMicros - 1) / kMicros);
}

int __wrap_ppoll(pollfd* /*fds*/, nfds_t count, const timespec* timeout, const sigset_t* mask) {
    if (count != 0 || timeout == nullptr) {
        ADD_FAILURE() << "only a timed pause without descriptors is known here";
        errno = EINVAL;
        return -1;
    }
    constexpr long kMicros = 1'000'000;
    constexpr long kNanosPerMicro = 1000;
    const long wanted = timeout->tv_sec * kMicros + timeout->tv_nsec / kNanosPerMicro;
    if (!VirtualClock::get().wait(wanted, mask).interrupted) return 0;
    errno = EINTR;
    return -1;
}
// NOLINTEND(bugprone-reserved-identifier)
