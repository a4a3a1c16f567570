// The fortified recvfrom is an inline function, which could not be replaced below.
#undef _FORTIFY_SOURCE

#include "common/bounded_call.h"

#include <dlfcn.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstddef>
#include <cstring>
#include <exception>
#include <limits>
#include <mutex>
#include <new>
#include <thread>

#include "common/own_address.h"
#include "common/stop_budget.h"

namespace pelorus {

namespace {

// Between two looks for a termination signal, and between two attempts to end the transfers.
constexpr std::chrono::milliseconds kLook{1000}, kRepeat{20};

constexpr long kEverything = std::numeric_limits<long>::max();

bool onlyGateways = false;                  // connect() below refuses everybody else
std::atomic<long> mayReceive{kEverything};  // bytes; then recvfrom() below finds the end

bool terminationPending() {
    sigset_t pending;
    if (sigpending(&pending) != 0) return false;
    return sigismember(&pending, SIGINT) == 1 || sigismember(&pending, SIGTERM) == 1 ||
           sigismember(&pending, SIGQUIT) == 1;
}

bool isSocket(int descriptor) {
    struct stat status {};
    return fstat(descriptor, &status) == 0 && S_ISSOCK(status.st_mode);
}

// One call instead of one for each possible descriptor: many requests are made. Allocates nothing:
// the watcher's thread must not end with an exception when memory is short.
Descriptors openSockets() {
    std::array<pollfd, kMostDescriptors> all{};
    int next = 0;
    for (pollfd& entry : all) entry.fd = next++;
    const bool known = poll(all.data(), all.size(), 0) >= 0;
    Descriptors found;
    for (std::size_t i = 0; i < all.size(); ++i) {
        const bool closed = known && (all[i].revents & POLLNVAL) != 0;
        found[i] = !closed && isSocket(all[i].fd);
    }
    return found;
}

// The C library's function of this name and type.
template <typename Function>
Function* original(const char* name) {
    return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

int libcConnect(int socket, const sockaddr* address, socklen_t size) {
    static const auto call = original<decltype(connect)>("connect");
    if (call != nullptr) return call(socket, address, size);
    errno = ENOSYS;
    return -1;
}

// The library may ask a search daemon on this device first, through a socket in the file system.
bool isGatewayAddress(const sockaddr* address, socklen_t size) {
    if (address->sa_family == AF_UNIX) return true;
    if (address->sa_family != AF_INET || size < sizeof(sockaddr_in)) return false;
    sockaddr_in gateway{};
    std::memcpy(&gateway, address, sizeof gateway);
    return !isOwnAddress(gateway.sin_addr);
}

}  // namespace

// One thread for all calls: to start one takes longer than most of them. It is woken by neither the
// end of a call nor, while calls follow each other, their beginning.
class Watcher {
public:
    static Watcher& get() {
        // Never destroyed, since the thread runs until the process ends. Allocates nothing.
        alignas(Watcher) static std::array<std::byte, sizeof(Watcher)> storage;
        static Watcher& watcher = *new (storage.data()) Watcher;
        return watcher;
    }

    void begin(BoundedCall& call) {
        const std::lock_guard lock(mutex);
        watched = &call;
        if (!thread.joinable()) thread = std::thread([this] { run(); });
        // Where waits go by a clock that can be set back, one may last past its end.
        if (call.nextLook() < wakeUp || wakeUp <= Clock::now()) begun.notify_one();
    }
    void end() {
        const std::lock_guard lock(mutex);
        watched = nullptr;
    }

private:
    using Clock = BoundedCall::Clock;

    [[noreturn]] void run() {
        std::unique_lock lock(mutex);
        while (true) {
            if (watched == nullptr) {
                wakeUp = Clock::time_point::max();
                begun.wait(lock);
            } else {
                wakeUp = watched->nextLook();
                begun.wait_until(lock, wakeUp);
            }
            if (watched != nullptr) watched->look();
        }
    }

    std::thread thread;
    std::mutex mutex;
    std::condition_variable begun;
    BoundedCall* watched = nullptr;
    Clock::time_point wakeUp = Clock::time_point::min();  // nothing waits yet
};

BoundedCall::BoundedCall(Peer peer, int seconds) : before{openSockets()} {
    onlyGateways = peer == Peer::GATEWAY;
    Clock::duration limit = std::chrono::seconds(seconds);
    if (onlyGateways) limit = std::min(limit, stopBudgetLeft());
    // With nothing left there is still time for an answer at once.
    end = began + std::max<Clock::duration>(limit, kRepeat);
    terminating = !onlyGateways;  // only gateways are then cut short
    mayReceive = kMostReceived;
    try {
        Watcher::get().begin(*this);
    } catch (const std::exception&) {
        mayReceive = 0;  // rather no answer than an unbounded one
    }
}

BoundedCall::~BoundedCall() {
    Watcher::get().end();
    if (onlyGateways) spendStopBudget(Clock::now() - began);
    if (exceeded && hurried) renewStopBudget({});
    onlyGateways = false;
    mayReceive = kEverything;
}

BoundedCall::Clock::time_point BoundedCall::nextLook() const {
    return exceeded ? looked + kRepeat : std::min(looked + kLook, end);
}

// The library may open further sockets after the first ones were shut, hence every time.
void BoundedCall::look() {
    const auto now = Clock::now();
    if (!terminating && terminationPending()) {
        terminating = true;
        // The signal may have come just after the last look.
        hurried = end > looked + kCycleBudget;
        if (hurried) end = looked + kCycleBudget;
    }
    looked = now;
    exceeded = exceeded || now >= end;
    if (exceeded) endTransfers();
}

void BoundedCall::endTransfers() const {
    mayReceive = 0;
    const Descriptors opened = openSockets() & ~before;
    for (std::size_t i = 0; i < opened.size(); ++i) {
        // Fails for a socket without a peer, and still ends a wait for datagrams. What is queued
        // stays, and under a flood never ends.
        if (opened[i]) static_cast<void>(shutdown(static_cast<int>(i), SHUT_RDWR));
    }
}

}  // namespace pelorus

// Stands in for the C library's connect, also for the libraries that are linked dynamically.
extern "C" int connect(int fd, const sockaddr* addr, socklen_t len) {
    if (pelorus::onlyGateways && !pelorus::isGatewayAddress(addr, len)) {
        errno = EACCES;
        return -1;
    }
    return pelorus::libcConnect(fd, addr, len);
}

// The same for recvfrom: memory must not depend on how soon the watcher looks.
extern "C" ssize_t recvfrom(
    int fd, void* buf, size_t n, int flags, sockaddr* addr, socklen_t* len) {
    static const auto call = pelorus::original<decltype(recvfrom)>("recvfrom");
    if (call == nullptr) {
        errno = ENOSYS;
        return -1;
    }
    if (pelorus::mayReceive <= 0) return 0;
    const ssize_t received = call(fd, buf, n, flags, addr, len);
    if (received > 0 && pelorus::mayReceive != pelorus::kEverything) {
        pelorus::mayReceive -= received;
    }
    return received;
}
