// State set by the termination signal handler.
#ifndef PELORUS_COMMON_TERMINATION_H
#define PELORUS_COMMON_TERMINATION_H

#include <atomic>

namespace pelorus {

/// Value of sigConnKilled while no termination signal has arrived.
inline constexpr int kNoSignal = -1;

/// Number of the termination signal that ended remote access, or kNoSignal. Written by the
/// signal handler, raised again after everything has been torn down.
extern std::atomic<int> sigConnKilled;
static_assert(std::atomic<int>::is_always_lock_free, "written by a signal handler");

/// True once a termination signal has arrived; for waits without a time limit.
[[nodiscard]] bool terminationRequested();

}  // namespace pelorus

#endif
