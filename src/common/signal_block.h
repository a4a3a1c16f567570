// Holding signals back for the length of a scope.
#ifndef PELORUS_COMMON_SIGNAL_BLOCK_H
#define PELORUS_COMMON_SIGNAL_BLOCK_H

#include <signal.h>

#include <initializer_list>

namespace pelorus {

/// Blocks the given signals for the calling thread until the end of the scope; a signal that
/// comes meanwhile is delivered then. Start no child process inside such a scope: it would
/// inherit the mask.
class SignalBlock {
public:
    SignalBlock(std::initializer_list<int> signals);
    ~SignalBlock();
    SignalBlock(const SignalBlock&) = delete;
    SignalBlock& operator=(const SignalBlock&) = delete;

    /// The mask that was in force before, e.g. for ppoll.
    [[nodiscard]] const sigset_t& previousMask() const { return previous; }

private:
    sigset_t previous{};
};

/// Keeps a peer that closes its connection early from ending the process with SIGPIPE: the
/// signal is held back for the scope and taken off the queue at its end, so that the writing
/// call just fails. For libraries that write to sockets without MSG_NOSIGNAL.
class BrokenPipeGuard {
public:
    BrokenPipeGuard();
    ~BrokenPipeGuard();
    BrokenPipeGuard(const BrokenPipeGuard&) = delete;
    BrokenPipeGuard& operator=(const BrokenPipeGuard&) = delete;

private:
    sigset_t previous{};
    bool pendingBefore = false;
};

}  // namespace pelorus

#endif
