#include "common/shell.h"

#include "support/fake_commands.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

using ShellTest = PelorusTest;

volatile std::sig_atomic_t delivered = 0;

TEST_F(ShellTest, ASignalThatArrivesDuringACommandIsDeliveredAfterIt) {
    const auto interrupt = [](const std::string&) {
        for (const int signal : {SIGINT, SIGQUIT}) {
            std::signal(signal, SIG_IGN);  // as the C library does while a command runs
            raise(signal);
            std::signal(signal, [](int) { delivered = delivered + 1; });
        }
    };
    commands.answer("sleep", FakeCommands::Answer{"", 3, false, interrupt});
    EXPECT_EQ(WEXITSTATUS(runShell("sleep 5")), 3);
    EXPECT_EQ(delivered, 2);
}

}  // namespace
}  // namespace pelorus::support
