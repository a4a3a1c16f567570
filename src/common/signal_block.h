// Blocking signals for the duration of a scope.
#ifndef PELORUS_COMMON_SIGNAL_BLOCK_H
#define PELORUS_COMMON_SIGNAL_BLOCK_H

#include <signal.h>

#include <initializer_list>

namespace pelorus {

/// Blocks the given signals for the calling thread until the end of the scope; a signal that
/// arrives meanwhile is delivered then. Do not start a child process inside such a scope: it would
/// inherit the mask.
class SignalBlock {
public:
    SignalBlock(std::initializer_list<int> signals);
    ~SignalBlock();
    SignalBlock(const SignalBlock&) = delete;
    SignalBlock& operator=(const SignalBlock&) = delete;

    /// The previous mask, e.g. for ppoll.
    [[nodiscard]] const sigset_t& previousMask() const { return previous; }

private:
    sigset_t previous{};
};

/// Holds SIGINT, SIGTERM and SIGQUIT back until the end of the scope. Their handler writes to the
/// log, and a log line takes the C library's log and time-zone locks: a handler that interrupts the
/// holder of one would wait forever. Hence around every library call that may take one of them,
/// OpenSSL's included. Not for system() and popen(): their children would be hard to stop.
class TerminationBlock : public SignalBlock {
public:
    TerminationBlock() : SignalBlock{SIGINT, SIGTERM, SIGQUIT} {}
};

/// Keeps SIGPIPE from ending the process when a peer closes its connection early: the signal is
/// blocked for the scope and discarded at its end, so that the write merely fails. For libraries
/// that write to sockets without MSG_NOSIGNAL.
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
