// The openvpn client that carries a relayed connection.
#ifndef PELORUS_RELAY_VPN_MANAGER_H
#define PELORUS_RELAY_VPN_MANAGER_H

#include <string>

namespace pelorus {

/// Starts, recognises and stops the openvpn client. The client is a process of its own, started
/// by a configured shell command and known by its pid file; this class keeps no state.
class VPNManager {
public:
    static VPNManager* getInstance();
    VPNManager(const VPNManager&) = delete;
    VPNManager& operator=(const VPNManager&) = delete;

    /// Starts the client and waits until its output tells that the tunnel is up. True when it is,
    /// now or already. Blocks for up to four starts of 70 seconds each, plus the time to stop a
    /// client that did not come up. Changes the working directory meanwhile.
    bool openVPNConnection();

    /// Stops the client: SIGTERM, from the fourth pass on SIGKILL. True when none is left running;
    /// a client that took the signal and is still on its way out counts as stopped.
    bool closeVPNConnection();

    /// Removes a pid file that an earlier run left; does not stop a running client. False only
    /// when the file could not be removed.
    bool cleanupVPNConnection();

    /// True when the pid file names a live openvpn process. A pid file that does not is removed.
    bool isVPNRunning();

    /// The tunnel has no health check of its own: always true.
    [[nodiscard]] bool isVPNHealthy() const { return true; }

    /// The relay's IPv4 address from the client's output; the last one when there are several. Pass
    /// @p ip empty: the result is whether it holds an address at the end.
    bool fetchOpenVPN_IPAddr(std::string& ip);

    /// Whether @p line, a line of the pid file, names a live openvpn process; its trimmed text is
    /// returned in @p pid.
    bool pidIsOpenVPNProcess(char* line, std::string& pid);

    /// Removes blanks, tabs and line ends behind the text, and blanks and tabs in front of it.
    void trim(std::string& text);

private:
    VPNManager() = default;
    ~VPNManager() = default;

    bool writeCredentials();
    bool startClient();
    bool waitUntilUp(bool& isUp);
    bool stopOnce(int pass);
};

}  // namespace pelorus

#endif
