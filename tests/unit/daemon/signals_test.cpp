#include "daemon/signals.h"

#include <cerrno>

#include "daemon_fixture.h"

namespace pelorus::support {
namespace {

class SignalsTest : public DaemonTest {
protected:
    static bool hasDefaultAction(int signal) {
        struct sigaction action {};
        sigaction(signal, nullptr, &action);
        return action.sa_handler == SIG_DFL;
    }
};

constexpr const char* kEnabled = "DaemonControl::enableRemoteAcces - remote access is enabled.\n";
constexpr const char* kDisabled =
    "DaemonControl::disableRemoteAccess - remote access is disabled.\n";

TEST_F(SignalsTest, ATerminationSignalDisablesAndIsKeptForTheEnd) {
    ASSERT_TRUE(installSignalHandlers());
    const std::vector<std::pair<int, std::string>> signals{
        {SIGINT, "SIGINT"}, {SIGTERM, "SIGTERM"}, {SIGQUIT, "SIGQUIT"}};
    for (const auto& [signal, name] : signals) {
        log.clear();
        raise(signal);
        expectLogIs({{LOG_ERR, "sigTrap - Received " + name + " signal.\n"},
                     {LOG_NOTICE, kDisabled},
                     {LOG_INFO, "sigTrap - sigConnKilled is set to incoming signal.\n"}});
        EXPECT_EQ(sigConnKilled, signal);
        EXPECT_TRUE(terminationRequested());
        EXPECT_TRUE(hasDefaultAction(signal)) << "a second one ends the process at once";
    }
}

TEST_F(SignalsTest, OnlyTheThreeAreInstalled) {
    ASSERT_TRUE(installSignalHandlers());
    for (const int signal :
         {SIGHUP, SIGPIPE, SIGCHLD, SIGUSR1, _SIGENABLEREMOTEACCESS, _SIGDISABLEREMOTEACCESS}) {
        EXPECT_TRUE(hasDefaultAction(signal)) << signal;
    }
}

TEST_F(SignalsTest, OtherNumbersDoNotTerminate) {
    sigTrap(_SIGENABLEREMOTEACCESS);
    sigTrap(_SIGDISABLEREMOTEACCESS);
    sigTrap(SIGHUP);
    expectLogIs({{LOG_NOTICE, kEnabled},
                 {LOG_ERR, "sigTrap - Received _SIGENABLEREMOTEACCESS signal.\n"},
                 {LOG_NOTICE, kDisabled},
                 {LOG_ERR, "sigTrap - Received _SIGDISABLEREMOTEACCESS signal.\n"},
                 {LOG_ERR, "Unhandled signal (1) \n"}});
    EXPECT_FALSE(terminationRequested());
}

TEST_F(SignalsTest, TheInterruptedCodeKeepsItsErrno) {
    log.onLine([](const LogLine&) { errno = EBADF; });
    errno = ENOENT;
    sigTrap(SIGTERM);
    EXPECT_EQ(errno, ENOENT);
}

}  // namespace
}  // namespace pelorus::support
