#include "daemon/signals.h"

#include <cerrno>

#include "common/shell.h"
#include "common/signal_block.h"
#include "common/termination.h"
#include "daemon_fixture.h"

namespace pelorus {
namespace {

using SignalsTest = DaemonTest;

TEST_F(SignalsTest, ATerminationSignalDisablesAndIsKeptForTheEnd) {
    ASSERT_TRUE(installSignalHandlers());
    using Signal = std::pair<int, std::string>;
    log.onLine([](const support::LogLine&) { errno = EBADF; });
    for (const auto& [signal, name] :
         {Signal{SIGINT, "SIGINT"}, {SIGTERM, "SIGTERM"}, {SIGQUIT, "SIGQUIT"}}) {
        log.clear();
        errno = ENOENT;
        raise(signal);
        EXPECT_EQ(errno, ENOENT) << "the interrupted code looks at it";
        support::expectLogIs(
            {{LOG_ERR, "sigTrap - Received " + name + " signal.\n"},
             {LOG_NOTICE, "DaemonControl::disableRemoteAccess - remote access is disabled.\n"},
             {LOG_INFO, "sigTrap - sigConnKilled is set to incoming signal.\n"}});
        EXPECT_EQ(sigConnKilled, signal);
        EXPECT_EQ(std::signal(signal, SIG_DFL), SIG_DFL) << "a second one ends the process at once";
    }
}

TEST_F(SignalsTest, AnInheritedBlockAndTheTimeZoneAreSettledAtTheStart) {
    const TerminationBlock inherited;  // from whoever started the daemon
    setenv("TZ", "XYZ3", 1);
    ASSERT_TRUE(installSignalHandlers());
    EXPECT_STREQ(tzname[0], "XYZ") << "no time zone is read in the handler";
    raise(SIGTERM);
    EXPECT_TRUE(terminationRequested());
}

// With SIGCHLD ignored the C library cannot tell how a command ended.
TEST_F(SignalsTest, CommandsAreWaitedForWhateverTheParentIgnored) {
    std::signal(SIGCHLD, SIG_IGN);
    ASSERT_TRUE(installSignalHandlers());
    EXPECT_EQ(runShell("kill -15 1"), 0);
}

TEST_F(SignalsTest, OtherNumbersAreNotInstalledAndDoNotTerminate) {
    ASSERT_TRUE(installSignalHandlers());
    for (const int signal : {SIGHUP, SIGPIPE, SIGCHLD, 30, 31}) {
        EXPECT_NE(std::signal(signal, SIG_DFL), sigTrap) << signal;
    }
    for (const int signal : {30, 31, SIGHUP}) sigTrap(signal);
    support::expectLogIs(
        {{LOG_NOTICE, "DaemonControl::enableRemoteAcces - remote access is enabled.\n"},
         {LOG_ERR, "sigTrap - Received _SIGENABLEREMOTEACCESS signal.\n"},
         {LOG_NOTICE, "DaemonControl::disableRemoteAccess - remote access is disabled.\n"},
         {LOG_ERR, "sigTrap - Received _SIGDISABLEREMOTEACCESS signal.\n"},
         {LOG_ERR, "Unhandled signal (1) \n"}});
    EXPECT_FALSE(terminationRequested());
}

}  // namespace
}  // namespace pelorus
