#include "common/signal_block.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using SignalBlockTest = PelorusTest;  // checks that the mask is restored

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
