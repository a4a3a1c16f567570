#include "daemon/daemon_control.h"

#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <string>

#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/pause.h"
#include "common/termination.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"
#include "relay/vpn_manager.h"

namespace pelorus {

namespace {

constexpr int kMinSleepTime = 30;   // seconds
constexpr int kMaxSleepTime = 900;  // seconds

}  // namespace

DaemonControl* DaemonControl::getInstance() {
    // Constant-initialised: the signal handler may be the first caller.
    static DaemonControl instance;
    return &instance;
}

void DaemonControl::run() {
    lastConnectionType = NONE;
    startClean();
    // Would spin with both flags false, which no public call can produce.
    while (remoteAccessEnabled || !stopRequested) {
        if (remoteAccessEnabled) runCycle();
    }
    shutDown();
}

void DaemonControl::startClean() {
    const std::string status = setting("COMMUNICATION_STATUS");
    if (status.empty() || status == "disabled") {
        logNotice("DaemonControl::run - Update local comm mode.\n");
        TavikClient::getInstance()->updateLocalCommStatus("connecting");
    }
    if (remoteAccessEnabled) {
        // An earlier run may have ended without removing its mappings or its tunnel.
        logNotice("DaemonControl::run - Kill direct connection comm mode.\n");
        ConnectionManager::getInstance()->killConnection(PORTFORWARDED);
        VPNManager::getInstance()->cleanupVPNConnection();
    }
    logInfo("DaemonControl::run - nslookup check interval %jd\n",
            ConnectionManager::getInstance()->getDNSCheckInterval());
    unsigned upnp = 0;
    unsigned natpmp = 0;
    ConnectionManager::getInstance()->getReqPortMappingLifetime(upnp, natpmp);
    logInfo("DaemonControl::run - UPnP lifetime %u, NAT-PMP lifetime %u\n", upnp, natpmp);
}

void DaemonControl::runCycle() {
    ConnectionManager::getInstance()->checkConnection(lastConnectionType);
    lastConnectionType = ConnectionManager::getInstance()->createConnection();
    const int serverSleepTime = TavikClient::getInstance()->getServerSleepTime();
    if (sleepTime >= serverSleepTime) {
        logInfo("DaemonControl::run - sleep %d secs.\n", sleepTime);
        pauseUnlessTerminated(sleepTime);
    } else {
        logInfo("DaemonControl::run - retry connection after %d secs.\n", serverSleepTime);
        pauseUnlessTerminated(serverSleepTime);
    }
    TavikClient::getInstance()->resetServerSleepTime();
}

void DaemonControl::shutDown() {
    TavikClient::getInstance()->sendAnalytics("disabled", lastConnectionType, SUBTYPE_NONE);
    TavikClient::getInstance()->updateLocalCommStatus("disabled");
    stopRequested = false;
    ConnectionManager::getInstance()->killConnection(PORTFORWARDED);
    ConnectionManager::getInstance()->killConnection(RELAYED);
    logInfo("DaemonControl::run - Remote access disabled.\n");
    // sigTrap has restored the default action, so the parent process sees that the signal ended us.
    if (terminationRequested()) static_cast<void>(kill(getpid(), sigConnKilled));
}

void DaemonControl::setSleepTime(int seconds) {
    sleepTime = std::clamp(seconds, kMinSleepTime, kMaxSleepTime);
}

void DaemonControl::enableRemoteAccess() {
    logNotice("DaemonControl::enableRemoteAcces - remote access is enabled.\n");
    remoteAccessEnabled = true;
    stopRequested = false;
}

void DaemonControl::disableRemoteAccess() {
    logNotice("DaemonControl::disableRemoteAccess - remote access is disabled.\n");
    remoteAccessEnabled = false;
    stopRequested = true;
}

void DaemonControl::stop() {
}

}  // namespace pelorus
