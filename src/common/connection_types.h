// Connection types shared by several modules.
#ifndef PELORUS_COMMON_CONNECTION_TYPES_H
#define PELORUS_COMMON_CONNECTION_TYPES_H

namespace pelorus {

/// How the device is reachable from the internet. The numbers appear in log lines.
enum ConnectionType : int {
    NONE = 0,           ///< nothing tried yet
    PORTFORWARDED = 1,  ///< directly, through ports forwarded by the gateway
    RELAYED = 2,        ///< through the openvpn tunnel to a relay server
    CONNECTING = 3,     ///< an attempt is under way
    FAILED = 4,         ///< not reachable, or remote access disabled
};

/// Detail of a connection type, passed on with analytics events.
enum ConnectionSubType : int {
    SUBTYPE_NONE = 0,       ///< no detail: everything but port forwarding
    SUBTYPE_AUTOMATIC = 1,  ///< ports forwarded by this daemon
    SUBTYPE_MANUAL = 2,     ///< ports forwarded by the user
};

/// One of the device's two public services; also the scheme of a request URL.
enum HttpType : int {
    HTTP = 1,
    HTTPS = 2,
};

/// Result of a port test by the central server. Only PASS_TEST is a success.
enum PortTestResult : int {
    SKIP_TEST = 1,  ///< not tested: the disk sleeps, or the server asked the device to wait
    FAIL_TEST = 2,  ///< tested and not reachable, or not testable at all
    PASS_TEST = 3,  ///< the server reached this device on the port
};

/// DEVICETYPE of a device that is itself the maker's router: it uses helper scripts instead of a
/// gateway and keeps no count of its disk's idle minutes.
inline constexpr int kMakersRouter = 5;

}  // namespace pelorus

#endif
