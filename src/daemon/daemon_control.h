// The main loop.
#ifndef PELORUS_DAEMON_DAEMON_CONTROL_H
#define PELORUS_DAEMON_DAEMON_CONTROL_H

#include <atomic>

#include "common/connection_types.h"

namespace pelorus {

/// Owns the main loop and the flags that end it.
class DaemonControl {
public:
    static DaemonControl* getInstance();
    DaemonControl(const DaemonControl&) = delete;
    DaemonControl& operator=(const DaemonControl&) = delete;

    /// Runs cycles while remote access is enabled, then reports "disabled", tears down both kinds
    /// of connection and ends the process by the termination signal that arrived. Returns only when
    /// none did.
    void run();

    /// Period between cycles in seconds, clamped to 30 to 900. The server may ask for a longer one.
    void setSleepTime(int seconds);

    /// Safe to call from a signal handler, as is disableRemoteAccess.
    void enableRemoteAccess();
    void disableRemoteAccess();
    /// Does nothing: disabling remote access is what ends the loop.
    void stop();

private:
    DaemonControl() = default;
    ~DaemonControl() = default;

    void startClean();
    void runCycle();
    void shutDown();

    std::atomic<bool> remoteAccessEnabled{false};
    std::atomic<bool> stopRequested{false};
    int sleepTime = 0;  // seconds
    ConnectionType lastConnectionType = NONE;
};
static_assert(std::atomic<bool>::is_always_lock_free, "written by a signal handler");

}  // namespace pelorus

#endif
