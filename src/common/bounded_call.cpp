#include "common/bounded_call.h"

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "common/handles.h"
#include "common/text.h"

namespace pelorus {

namespace {

constexpr std::chrono::milliseconds kLook{20};

using DirectoryHandle = std::unique_ptr<DIR, Releaser<closedir>>;

bool onlyGateways = false;  // connect() below refuses everybody else

bool isSocket(int descriptor) {
    struct stat status {};
    return fstat(descriptor, &status) == 0 && S_ISSOCK(status.st_mode);
}

std::set<int> openSockets() {
    std::set<int> found;
    const DirectoryHandle list{opendir("/proc/self/fd")};
    // NOLINTNEXTLINE(concurrency-mt-unsafe): each thread reads a list of its own
    while (const dirent* entry = list ? readdir(list.get()) : nullptr) {
        const int descriptor = leadingInt(entry->d_name);
        if (isSocket(descriptor)) found.insert(descriptor);
    }
    return found;
}

// Bytes, 0 when unknown.
long residentMemory() {
    std::array<char, 128> text{};  // total and resident pages first
    const int file = open("/proc/self/statm", O_RDONLY | O_CLOEXEC);
    if (file < 0) return 0;
    const ssize_t size = read(file, text.data(), text.size() - 1);
    static_cast<void>(close(file));
    const char* const second = size > 0 ? std::strchr(text.data(), ' ') : nullptr;
    return second == nullptr ? 0 : std::atol(second) * sysconf(_SC_PAGESIZE);
}

int libcConnect(int socket, const sockaddr* address, socklen_t size) {
    using Connect = int (*)(int, const sockaddr*, socklen_t);
    static const auto original = reinterpret_cast<Connect>(dlsym(RTLD_NEXT, "connect"));
    if (original != nullptr) return original(socket, address, size);
    errno = ENOSYS;
    return -1;
}

// Traffic to one of the device's own addresses leaves from that same address. Nothing is sent.
bool isOwnAddress(const sockaddr_in& address) {
    const int probe = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (probe < 0) return true;
    sockaddr_in local{};
    socklen_t size = sizeof local;
    const bool known =
        libcConnect(probe, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
        getsockname(probe, reinterpret_cast<sockaddr*>(&local), &size) == 0;
    static_cast<void>(close(probe));
    return known && local.sin_addr.s_addr == address.sin_addr.s_addr;
}

bool isGatewayAddress(const sockaddr* address, socklen_t size) {
    if (address->sa_family != AF_INET || size < sizeof(sockaddr_in)) return false;
    const auto& target = *reinterpret_cast<const sockaddr_in*>(address);
    const in_addr_t network = ntohl(target.sin_addr.s_addr) >> 24;
    return network != 0 && network != IN_LOOPBACKNET && !isOwnAddress(target);
}

}  // namespace

BoundedCall::BoundedCall(Peer peer, int seconds)
    : before{openSockets()}, residentBefore{residentMemory()} {
    onlyGateways = peer == Peer::GATEWAY;
    try {
        watcher = std::thread([this, seconds] { watch(seconds); });
    } catch (const std::system_error&) {
        // Without a thread the library's own limits must do.
    }
}

BoundedCall::~BoundedCall() {
    {
        const std::lock_guard lock(mutex);
        over = true;
    }
    ended.notify_one();
    if (watcher.joinable()) watcher.join();
    onlyGateways = false;
}

// The library may open further sockets after the first ones were shut, hence every time.
void BoundedCall::watch(int seconds) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    bool exceeded = false;
    std::unique_lock lock(mutex);
    while (!ended.wait_for(lock, kLook, [this] { return over; })) {
        exceeded = exceeded || std::chrono::steady_clock::now() >= end ||
                   residentMemory() - residentBefore > kMostGrowth;
        if (exceeded) shutSockets();
    }
}

void BoundedCall::shutSockets() const {
    for (const int descriptor : openSockets()) {
        // Fails for a socket without a peer, and still ends a wait for datagrams.
        if (before.count(descriptor) == 0) static_cast<void>(shutdown(descriptor, SHUT_RDWR));
    }
}

}  // namespace pelorus

// Stands in for the C library's connect, also for the libraries that are linked dynamically.
extern "C" int connect(int socket, const sockaddr* address, socklen_t size) {
    if (pelorus::onlyGateways && !pelorus::isGatewayAddress(address, size)) {
        errno = EACCES;
        return -1;
    }
    return pelorus::libcConnect(socket, address, size);
}
