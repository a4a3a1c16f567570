#include "common/signal_block.h"

#include <ctime>

namespace pelorus {

SignalBlock::SignalBlock(std::initializer_list<int> signals) {
    sigset_t blocked;
    sigemptyset(&blocked);
    for (const int signal : signals) sigaddset(&blocked, signal);
    pthread_sigmask(SIG_BLOCK, &blocked, &previous);
}

SignalBlock::~SignalBlock() {
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
}

namespace {

sigset_t brokenPipeOnly() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGPIPE);
    return set;
}

bool brokenPipePending() {
    sigset_t pending;
    return sigpending(&pending) == 0 && sigismember(&pending, SIGPIPE) == 1;
}

}  // namespace

BrokenPipeGuard::BrokenPipeGuard() {
    const sigset_t set = brokenPipeOnly();
    pthread_sigmask(SIG_BLOCK, &set, &previous);
    pendingBefore = brokenPipePending();
}

BrokenPipeGuard::~BrokenPipeGuard() {
    if (!pendingBefore && brokenPipePending()) {
        const sigset_t set = brokenPipeOnly();
        const timespec atOnce{};
        sigtimedwait(&set, nullptr, &atOnce);
    }
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
}

}  // namespace pelorus
