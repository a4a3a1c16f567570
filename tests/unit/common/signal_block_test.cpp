#include "common/signal_block.h"

#include <unistd.h>

#include <array>
#include <cerrno>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using SignalBlockTest = PelorusTest;

bool isPending(int signal) {
    sigset_t pending;
    sigpending(&pending);
    return sigismember(&pending, signal) == 1;
}

// Writes to a peer that is gone.
int writeToClosedPipe() {
    std::array<int, 2> ends{};
    EXPECT_EQ(pipe(ends.data()), 0);
    close(ends[0]);
    const int error = write(ends[1], "x", 1) < 0 ? errno : 0;
    close(ends[1]);
    return error;
}

volatile std::sig_atomic_t delivered = 0;

TEST_F(SignalBlockTest, ASignalIsDeliveredWhenTheOutermostScopeEnds) {
    std::signal(SIGTERM, [](int) { delivered = delivered + 1; });
    {
        const SignalBlock outer{SIGTERM};
        {
            const SignalBlock inner{SIGTERM, SIGINT};
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGTERM), 1);
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGINT), 0);
            raise(SIGTERM);
        }
        EXPECT_EQ(delivered, 0);
    }
    EXPECT_EQ(delivered, 1);
}

// The fixture looks whether the mask is as it was.
TEST_F(SignalBlockTest, ABrokenPipeOnlyFailsTheWrite) {
    {
        const BrokenPipeGuard outer;
        const BrokenPipeGuard inner;
        EXPECT_EQ(writeToClosedPipe(), EPIPE);
    }
    EXPECT_FALSE(isPending(SIGPIPE));
}

TEST_F(SignalBlockTest, ABrokenPipeOfTheCallerStaysHisOwn) {
    const SignalBlock callers{SIGPIPE};
    EXPECT_EQ(writeToClosedPipe(), EPIPE);
    {
        const BrokenPipeGuard guard;
        EXPECT_EQ(writeToClosedPipe(), EPIPE);
    }
    EXPECT_TRUE(isPending(SIGPIPE));
    std::signal(SIGPIPE, SIG_IGN);  // takes it off the queue
}

}  // namespace
}  // namespace pelorus::support
