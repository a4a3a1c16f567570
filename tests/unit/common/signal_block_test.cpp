#include "common/signal_block.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using SignalBlockTest = PelorusTest;  // checks that the mask is restored

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

TEST_F(SignalBlockTest, DiscardsBrokenPipeSignalsExceptThoseAlreadyPending) {
    {
        const BrokenPipeGuard outer;
        const BrokenPipeGuard inner;
        raise(SIGPIPE);
    }
    const SignalBlock callers{SIGPIPE};
    raise(SIGPIPE);
    {
        const BrokenPipeGuard guard;
        raise(SIGPIPE);
    }
    sigset_t pending;
    sigpending(&pending);
    EXPECT_EQ(sigismember(&pending, SIGPIPE), 1);
    std::signal(SIGPIPE, SIG_IGN);  // discards it
}

}  // namespace
}  // namespace pelorus::support
