// The main loop.
#ifndef PELORUS_DAEMON_DAEMON_CONTROL_H
#define PELORUS_DAEMON_DAEMON_CONTROL_H

#include <atomic>

#include "common/connection_types.h"

namespace pelorus {

/// Owns the main loop and the switch that ends it.
class DaemonControl {
public:
    static DaemonControl* getInstance();
    DaemonControl(const DaemonControl&) = delete;
    DaemonControl& operator=(const DaemonControl&) = delete;

    /// Runs cycles while remote access is enabled, then reports "disabled", tears both kinds of
    /// connection down and ends the process with the termination signal that came. Returns only
    /// when none did.
    void run();

    /// Own period between cycles, seconds; kept within 30 to 900.
    void setSleepTime(int seconds);

    /// The switch. Both may be called by a signal handler.
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
