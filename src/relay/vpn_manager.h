// The openvpn client that carries a relayed connection.
#ifndef PELORUS_RELAY_VPN_MANAGER_H
#define PELORUS_RELAY_VPN_MANAGER_H

#include <string>

namespace pelorus {

/// Starts, recognises and stops the openvpn client, a separate process that a configured shell
/// command starts and a pid file identifies. This class keeps no state.
class VPNManager {
public:
    static VPNManager* getInstance();
    VPNManager(const VPNManager&) = delete;
    VPNManager& operator=(const VPNManager&) = delete;

    /// Starts the client, unless it is running, and waits until its output says that the tunnel is
    /// up; true when it is. A client that does not come up in time is stopped. Blocks for up to
    /// four starts of 70 seconds each, plus the stops. Changes the working directory meanwhile.
    bool openVPNConnection();

    /// Stops the client: SIGTERM in the first three passes, SIGKILL in two more, 3 seconds each.
    /// True when none is left running; a client that was signalled and is still exiting counts as
    /// stopped.
    bool closeVPNConnection();

    /// Removes the pid file an earlier run left behind; a running client is not stopped. False only
    /// when the file cannot be removed.
    bool cleanupVPNConnection();

    /// True when the pid file names a live openvpn process; any other pid file is removed.
    bool isVPNRunning();

    /// The tunnel has no health check of its own: always true.
    [[nodiscard]] bool isVPNHealthy() const { return true; }

    /// Reads the relay's IPv4 address from the client's output, the last one when there are
    /// several. Pass @p ip empty: the result says only that it is not empty at the end.
    bool fetchOpenVPN_IPAddr(std::string& ip);

    /// True when @p line of the pid file names a live openvpn process. @p pid becomes the trimmed
    /// line in either case.
    bool pidIsOpenVPNProcess(char* line, std::string& pid);

    /// Removes trailing blanks, tabs and line ends, and leading blanks and tabs.
    void trim(std::string& text);

private:
    enum class StartState {
        UP,
        NOT_YET,     // not within the time of one start
        UNREADABLE,  // its output cannot be opened: further starts would be pointless
    };

    VPNManager() = default;
    ~VPNManager() = default;

    bool writeCredentials();
    bool startClient();
    StartState waitUntilUp();
    bool stopOnce(int pass);
};

}  // namespace pelorus

#endif
