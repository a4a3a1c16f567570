#include "daemon/signals.h"

#include <csignal>
#include <initializer_list>

#include "common/log.h"
#include "common/termination.h"
#include "daemon/daemon_control.h"

namespace pelorus {

namespace {

void terminate(int sig, const char* message) {
    logLine(LOG_ERR, "%s", message);
    DaemonControl::getInstance()->disableRemoteAccess();
    DaemonControl::getInstance()->stop();
    signal(sig, SIG_DFL);
    sigConnKilled = sig;
    logLine(LOG_INFO, "sigTrap - sigConnKilled is set to incoming signal.\n");
}

}  // namespace

void sigTrap(int sig) {
    switch (sig) {
        case SIGINT:
            terminate(sig, "sigTrap - Received SIGINT signal.\n");
            break;
        case SIGQUIT:
            terminate(sig, "sigTrap - Received SIGQUIT signal.\n");
            break;
        case SIGTERM:
            terminate(sig, "sigTrap - Received SIGTERM signal.\n");
            break;
        case _SIGENABLEREMOTEACCESS:
            DaemonControl::getInstance()->enableRemoteAccess();
            logLine(LOG_ERR, "sigTrap - Received _SIGENABLEREMOTEACCESS signal.\n");
            break;
        case _SIGDISABLEREMOTEACCESS:
            DaemonControl::getInstance()->disableRemoteAccess();
            logLine(LOG_ERR, "sigTrap - Received _SIGDISABLEREMOTEACCESS signal.\n");
            break;
        default:
            logLine(LOG_ERR, "Unhandled signal (%d) \n", sig);
            break;
    }
}

bool installSignalHandlers() {
    for (const int sig : {SIGINT, SIGTERM, SIGQUIT}) {
        if (signal(sig, sigTrap) == SIG_ERR) return false;
    }
    return true;
}

}  // namespace pelorus
