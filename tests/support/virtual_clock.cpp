#include "support/virtual_clock.h"

#include <poll.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

namespace pelorus::support {

extern "C" {
unsigned __real_sleep(unsigned seconds);
int __real_ppoll(pollfd* fds, nfds_t count, const timespec* timeout, const sigset_t* mask);
}

bool VirtualClock::wait(std::int64_t waitMicros, const sigset_t* mask) {
    constexpr std::size_t kMostPauses = 100'000;
    asked.push_back(static_cast<long>(waitMicros / kMicrosPerSecond));
    if (asked.size() > kMostPauses) {
        std::fputs("virtual clock: the code under test pauses forever\n", stderr);
        std::abort();
    }
    if (const auto found = actions.find(asked.size()); found != actions.end()) found->second();
    if (hook) hook(static_cast<long>(waitMicros / kMicrosPerSecond));
    const timespec moment{0, 1};  // delivers a pending signal that the mask lets in
    if (mask != nullptr && __real_ppoll(nullptr, 0, &moment, mask) != 0) return true;
    micros += waitMicros;
    return false;
}

extern "C" {
time_t __wrap_time(time_t* result) {
    const time_t now = VirtualClock::get().now();
    if (result != nullptr) *result = now;
    return now;
}

int __wrap_gettimeofday(timeval* result, void* /*zone*/) {
    const VirtualClock& clock = VirtualClock::get();
    *result = {clock.now(), static_cast<suseconds_t>(clock.micros % kMicrosPerSecond)};
    return 0;
}

unsigned __wrap_sleep(unsigned seconds) {
    // A thread of the test tool itself; the daemon has one thread.
    if (gettid() != getpid()) return __real_sleep(seconds);
    VirtualClock::get().wait(seconds * kMicrosPerSecond, nullptr);
    return 0;
}

int __wrap_ppoll(pollfd* /*fds*/, nfds_t count, const timespec* timeout, const sigset_t* mask) {
    EXPECT_EQ(count, 0U) << "only a pause without descriptors is known here";
    const std::int64_t micros = timeout->tv_sec * kMicrosPerSecond + timeout->tv_nsec / 1000;
    return VirtualClock::get().wait(micros, mask) ? -1 : 0;
}
}

}  // namespace pelorus::support
