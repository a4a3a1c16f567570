#include "daemon/signals.h"

#include <cerrno>
#include <csignal>
#include <ctime>
#include <initializer_list>

#include "common/log.h"
#include "common/termination.h"
#include "daemon/daemon_control.h"

namespace pelorus {

namespace {

void requestTermination(int sig) {
    DaemonControl::getInstance()->disableRemoteAccess();
    DaemonControl::getInstance()->stop();
    static_cast<void>(std::signal(sig, SIG_DFL));
    sigConnKilled = sig;
    logInfo("sigTrap - sigConnKilled is set to incoming signal.\n");
}

void handle(int sig) {
    switch (sig) {
        case SIGINT:
            logError("sigTrap - Received SIGINT signal.\n");
            requestTermination(sig);
            break;
        case SIGQUIT:
            logError("sigTrap - Received SIGQUIT signal.\n");
            requestTermination(sig);
            break;
        case SIGTERM:
            logError("sigTrap - Received SIGTERM signal.\n");
            requestTermination(sig);
            break;
        case _SIGENABLEREMOTEACCESS:
            DaemonControl::getInstance()->enableRemoteAccess();
            logError("sigTrap - Received _SIGENABLEREMOTEACCESS signal.\n");
            break;
        case _SIGDISABLEREMOTEACCESS:
            DaemonControl::getInstance()->disableRemoteAccess();
            logError("sigTrap - Received _SIGDISABLEREMOTEACCESS signal.\n");
            break;
        default:
            logError("Unhandled signal (%d) \n", sig);
            break;
    }
}

}  // namespace

void sigTrap(int sig) {
    const int interruptedErrno = errno;
    handle(sig);
    errno = interruptedErrno;
}

bool installSignalHandlers() {
    // Loads the time zone: the handler's log lines must not be the first to need it.
    tzset();
    sigset_t handled;
    sigemptyset(&handled);
    for (const int sig : {SIGINT, SIGTERM, SIGQUIT}) {
        if (std::signal(sig, sigTrap) == SIG_ERR) return false;
        sigaddset(&handled, sig);
    }
    // Whoever started the daemon may have ignored this one: the C library could not tell how a
    // command ended.
    if (std::signal(SIGCHLD, SIG_DFL) == SIG_ERR) return false;
    // Or blocked the others.
    return pthread_sigmask(SIG_UNBLOCK, &handled, nullptr) == 0;
}

}  // namespace pelorus
