// Bounds around calls of miniupnpc, which has none of its own: a peer that sends a byte now and
// then holds it for hours, one that never stops sending fills the memory.
#ifndef PELORUS_COMMON_BOUNDED_CALL_H
#define PELORUS_COMMON_BOUNDED_CALL_H

#include <bitset>
#include <chrono>
#include <cstddef>

#include "common/signal_block.h"

namespace pelorus {

/// Who the sockets that are opened during the call may connect to.
enum class Peer {
    ANYBODY,
    GATEWAY,  ///< IPv4 hosts other than this device: its own servers trust local clients
};

/// Sockets with numbers below this are shut down when a call takes too long.
constexpr std::size_t kMostDescriptors = 1024;
/// One bit for each descriptor.
using Descriptors = std::bitset<kMostDescriptors>;

/// Bounds what a library does with sockets it opens before the end of the scope. After @p seconds
/// they are shut down: the library then fails as if the peer had closed the connection. So it does
/// after kMostReceived, and a call to a gateway when the stop budget is spent. One that is running
/// when a termination signal comes gets at most kCycleBudget from then on; if that is not enough,
/// nothing is left for the rest of the cycle. Also holds termination signals back and keeps a closed
/// connection from raising SIGPIPE. One at a time; not around child processes. The first one starts
/// a thread that stays.
class BoundedCall {
public:
    /// Bytes that recvfrom returns in one call, on all sockets. To parse them miniupnpc may need 35
    /// times as much memory.
    static constexpr long kMostReceived = 256L * 1024;

    BoundedCall(Peer peer, int seconds);
    ~BoundedCall();
    BoundedCall(const BoundedCall&) = delete;
    BoundedCall& operator=(const BoundedCall&) = delete;

private:
    friend class Watcher;
    using Clock = std::chrono::steady_clock;

    // The watcher's, which holds its lock meanwhile.
    void look();
    [[nodiscard]] Clock::time_point nextLook() const;
    void endTransfers() const;

    const Clock::time_point began = Clock::now();
    TerminationBlock termination;
    BrokenPipeGuard brokenPipe;
    Descriptors before;  // sockets that were open
    Clock::time_point looked = began;
    Clock::time_point end;
    bool exceeded = false;
    bool terminating = false;
    bool hurried = false;  // by a termination signal
};

}  // namespace pelorus

#endif
