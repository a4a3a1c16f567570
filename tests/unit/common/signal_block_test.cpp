#include "common/signal_block.h"

#include <unistd.h>

#include <array>
#include <cerrno>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

class SignalBlockTest : public PelorusTest {
protected:
    SignalBlockTest() { static_cast<void>(std::signal(SIGTERM, count)); }
    ~SignalBlockTest() override { static_cast<void>(std::signal(SIGTERM, SIG_DFL)); }
    SignalBlockTest(const SignalBlockTest&) = delete;
    SignalBlockTest& operator=(const SignalBlockTest&) = delete;

    static bool isBlocked(int signal) {
        sigset_t mask;
        pthread_sigmask(SIG_SETMASK, nullptr, &mask);
        return sigismember(&mask, signal) == 1;
    }
    static bool isPending(int signal) {
        sigset_t pending;
        sigpending(&pending);
        return sigismember(&pending, signal) == 1;
    }
    // Writes to a peer that is gone.
    static int writeToClosedPipe() {
        std::array<int, 2> ends{};
        EXPECT_EQ(pipe(ends.data()), 0);
        close(ends[0]);
        const ssize_t written = write(ends[1], "x", 1);
        const int error = written < 0 ? errno : 0;
        close(ends[1]);
        return error;
    }

    static volatile std::sig_atomic_t delivered;

private:
    static void count(int /*signal*/) { delivered = delivered + 1; }
};

volatile std::sig_atomic_t SignalBlockTest::delivered = 0;

TEST_F(SignalBlockTest, ASignalIsDeliveredWhenTheOutermostScopeEnds) {
    {
        const SignalBlock outer{SIGTERM};
        {
            const SignalBlock inner{SIGTERM, SIGINT};
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGTERM), 1);
            EXPECT_EQ(sigismember(&inner.previousMask(), SIGINT), 0);
            raise(SIGTERM);
        }
        EXPECT_FALSE(isBlocked(SIGINT));
        EXPECT_EQ(delivered, 0);
    }
    EXPECT_EQ(delivered, 1);
}

TEST_F(SignalBlockTest, ABrokenPipeOnlyFailsTheWrite) {
    {
        const BrokenPipeGuard outer;
        const BrokenPipeGuard inner;
        EXPECT_EQ(writeToClosedPipe(), EPIPE);
    }
    EXPECT_FALSE(isPending(SIGPIPE));
    EXPECT_FALSE(isBlocked(SIGPIPE));
}

TEST_F(SignalBlockTest, ABrokenPipeOfTheCallerStaysHisOwn) {
    const SignalBlock callers{SIGPIPE};
    EXPECT_EQ(writeToClosedPipe(), EPIPE);
    {
        const BrokenPipeGuard guard;
        EXPECT_EQ(writeToClosedPipe(), EPIPE);
    }
    EXPECT_TRUE(isPending(SIGPIPE));
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN));  // takes it off the queue
    static_cast<void>(std::signal(SIGPIPE, SIG_DFL));
}

}  // namespace
}  // namespace pelorus::support
