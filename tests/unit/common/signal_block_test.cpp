#include "common/signal_block.h"

#include <unistd.h>

#include <array>
#include <cerrno>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using SignalBlockTest = PelorusTest;  // checks that the mask is restored

int writeToClosedPipe() {
    std::array<int, 2> ends{};
    EXPECT_EQ(pipe(ends.data()), 0);
    close(ends[0]);
    const int error = write(ends[1], "x", 1) < 0 ? errno : 0;
    close(ends[1]);
    return error;
}

volatile std::sig_atomic_t delivered = 0;

TEST_F(SignalBlockTest, ASignalIsDeliveredWhenTheScopeThatBlocksItEnds) {
    std::signal(SIGTERM, [](int) { delivered = delivered + 1; });
    {
        const SignalBlock outer{SIGTERM};
        {
            const SignalBlock inner{SIGINT};
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGTERM), 1);
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGINT), 0);
            raise(SIGTERM);
        }
        EXPECT_EQ(delivered, 0);
    }
    EXPECT_EQ(delivered, 1);
}

TEST_F(SignalBlockTest, ABrokenPipeOnlyFailsTheWrite) {
    const BrokenPipeGuard outer;
    const BrokenPipeGuard inner;
    EXPECT_EQ(writeToClosedPipe(), EPIPE);
}

TEST_F(SignalBlockTest, ABrokenPipeOfTheCallerStaysPending) {
    const SignalBlock callers{SIGPIPE};
    writeToClosedPipe();
    {
        const BrokenPipeGuard guard;
        writeToClosedPipe();
    }
    sigset_t pending;
    sigpending(&pending);
    EXPECT_EQ(sigismember(&pending, SIGPIPE), 1);
    std::signal(SIGPIPE, SIG_IGN);  // discards it
}

}  // namespace
}  // namespace pelorus::support
