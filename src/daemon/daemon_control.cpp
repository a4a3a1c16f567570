#include "daemon/daemon_control.h"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/signal_block.h"
#include "common/termination.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kShortestPeriod = 30;  // seconds
constexpr int kLongestPeriod = 900;  // seconds

}  // namespace

DaemonControl* DaemonControl::getInstance() {
    static DaemonControl instance;
    return &instance;
}

void DaemonControl::run() {
    lastConnectionType = NONE;
    startClean();
    // Both flags false would spin here; enabling and disabling never leave that state behind.
    while (remoteAccessEnabled || !stopRequested) {
        if (remoteAccessEnabled) runCycle();
    }
    shutDown();
}

// Brings down what an earlier run left, so that an enabled start begins with nothing.
void DaemonControl::startClean() {
    auto* manager = ConnectionManager::getInstance();
    const std::string status = setting("COMMUNICATION_STATUS");
    if (status.empty() || status == "disabled") {
        logLine(LOG_NOTICE, "DaemonControl::run - Update local comm mode.\n");
        TavikClient::getInstance()->updateLocalCommStatus("connecting");
    }
    if (remoteAccessEnabled) {
        logLine(LOG_NOTICE, "DaemonControl::run - Kill direct connection comm mode.\n");
        manager->killConnection(PORTFORWARDED);
        VPNManager::getInstance()->cleanupVPNConnection();
    }
    unsigned upnp = 0;
    unsigned natpmp = 0;
    logLine(LOG_INFO, "DaemonControl::run - nslookup check interval %ld\n",
            manager->getDNSCheckInterval());
    manager->getReqPortMappingLifetime(upnp, natpmp);
    logLine(LOG_INFO, "DaemonControl::run - UPnP lifetime %u, NAT-PMP lifetime %u\n", upnp, natpmp);
}

void DaemonControl::runCycle() {
    auto* manager = ConnectionManager::getInstance();
    auto* client = TavikClient::getInstance();
    manager->checkConnection(lastConnectionType);
    lastConnectionType = manager->createConnection();
    const int serverSleepTime = client->getServerSleepTime();
    if (sleepTime >= serverSleepTime) {
        logLine(LOG_INFO, "DaemonControl::run - sleep %d secs.\n", sleepTime);
        pause(sleepTime);
    } else {
        logLine(LOG_INFO, "DaemonControl::run - retry connection after %d secs.\n",
                serverSleepTime);
        pause(serverSleepTime);
    }
    client->resetServerSleepTime();
}

// Sleeps unless a termination signal came, be it while the cycle ran or at the last instant: the
// signals are let in by the wait alone.
void DaemonControl::pause(int seconds) const {
    const SignalBlock untilWaiting{SIGINT, SIGTERM, SIGQUIT};
    if (!remoteAccessEnabled) return;
    const timespec length{seconds, 0};
    ppoll(nullptr, 0, &length, &untilWaiting.previousMask());
}

void DaemonControl::shutDown() {
    TavikClient::getInstance()->sendAnalytics("disabled", lastConnectionType, SUBTYPE_NONE);
    TavikClient::getInstance()->updateLocalCommStatus("disabled");
    stopRequested = false;
    ConnectionManager::getInstance()->killConnection(PORTFORWARDED);
    ConnectionManager::getInstance()->killConnection(RELAYED);
    logLine(LOG_INFO, "DaemonControl::run - Remote access disabled.\n");
    // The handler has put that signal back to its default action: this ends the process.
    if (terminationRequested()) kill(getpid(), sigConnKilled);
}

void DaemonControl::setSleepTime(int seconds) {
    sleepTime = std::clamp(seconds, kShortestPeriod, kLongestPeriod);
}

void DaemonControl::enableRemoteAccess() {
    logLine(LOG_NOTICE, "DaemonControl::enableRemoteAcces - remote access is enabled.\n");
    remoteAccessEnabled = true;
    stopRequested = false;
}

void DaemonControl::disableRemoteAccess() {
    logLine(LOG_NOTICE, "DaemonControl::disableRemoteAccess - remote access is disabled.\n");
    remoteAccessEnabled = false;
    stopRequested = true;
}

void DaemonControl::stop() {
}

}  // namespace pelorus
