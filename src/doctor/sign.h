// The signs from which causes are concluded.
#ifndef PELORUS_DOCTOR_SIGN_H
#define PELORUS_DOCTOR_SIGN_H

namespace pelorus::doctor {

/// Something that was seen. A sign that is absent was not seen, for whatever reason; where its
/// contrary matters, that is a sign too.
enum class Sign {
    // From files and the process table.
    STATIC_FILE_UNREADABLE,
    DYNAMIC_FILE_UNREADABLE,
    HAS_CREDENTIALS,
    CREDENTIALS_MISSING,
    REMOTE_ACCESS_OFF,
    MANUAL_MODE,
    MANUAL_PORT_INVALID,
    DEFAULT_PORTS_ONLY,
    OWN_ROUTER,  ///< the device is itself the home router
    DAEMON_RUNS,
    DAEMON_GONE,  ///< there is no such process
    TUNNEL_RUNS,  ///< the process that the pid file names
    TUNNEL_GONE,
    SECOND_TUNNEL_CLIENT,   ///< beside the process that the pid file names
    TUNNEL_CLIENT_ALONE,    ///< no other one beside it
    TUNNEL_SAYS_UP,         ///< the client's output has the text of success
    TUNNEL_REFUSED,         ///< the client's output says that the relay refuses the credentials
    TUNNEL_UNANSWERED,      ///< the client's output says that it does not get through to the relay
    RELAY_UNRESOLVED,       ///< the client's output says that the relay's name has no address
    RELAY_CERTIFICATE_BAD,  ///< the client's output says that it does not trust the relay
    TUNNEL_FILES_UNWRITABLE,
    DISK_IN_USE,  ///< by the minutes file

    // From probes.
    NO_INTERFACE_UP,
    NO_ADDRESS,   ///< no usable one of IPv4
    HAS_ADDRESS,  ///< a usable one of IPv4, in a LAN
    NO_DEFAULT_ROUTE,
    GATEWAY_FOUND,       ///< through UPnP or NAT-PMP
    GATEWAY_ELSEWHERE,   ///< the one found is not that of the default route
    NO_GATEWAY_ANSWERS,  ///< in a way that the daemon can use
    GATEWAY_SILENT,      ///< that of the default route does not even tell its hardware address
    GATEWAY_WITHOUT_ADDRESS,
    GATEWAY_HIDES_ADDRESS,  ///< it tells none, but leads to the internet
    GATEWAY_ADDRESS_PRIVATE,
    GATEWAY_ADDRESS_SHARED,
    GATEWAY_ADDRESS_PUBLIC,
    GATEWAY_ADDRESS_CHANGED,  ///< it is not the published one
    OUR_MAPPINGS_MISSING,     ///< the gateway, asked for a published port, does not map it to us
    NO_PORT_MAPPED,           ///< to us, of those that are published
    PORT_HELD_BY_OTHER,
    WEB_SERVER_SILENT,  ///< on the internal HTTP port
    NO_WEB_SERVER,      ///< nor on that for HTTPS
    DISK_ACTIVE,        ///< by its own word
    BACK_END_ANSWERS,
    BACK_END_SILENT,
    SERVICE_REACHED,  ///< name, connection and certificate are right
    SERVICE_UNRESOLVED,
    SERVICE_UNREACHABLE,
    SERVICE_CERTIFICATE_BAD,
    CLOCK_WRONG,
    NAMES_RIGHT,
    NAMES_LEAD_ELSEWHERE,
    NAMES_UNRESOLVED,
    NO_TUNNEL_INTERFACE,   ///< is up, while the tunnel client runs
    RELAY_CLIENT_MISSING,  ///< no openvpn program
    TUNNEL_DEVICE_MISSING,
    SERVICE_SEES_SAME_ADDRESS,  ///< as the gateway says
    SERVICE_SEES_OTHER_ADDRESS,
    PORT_TEST_PASSES,
    OTHER_DEVICE_ANSWERS,  ///< to the port test
    PORT_TEST_FAILS,

    // From the log: the last time that the daemon dealt with the matter it was so.
    LOGGED_START_FAILED,  ///< settings unreadable at the start, or an unknown option
    LOGGED_END,           ///< it ended in an orderly way
    LOGGED_REMOTE_ACCESS_OFF,
    LOGGED_CREDENTIALS_MISSING,
    LOGGED_NO_ADDRESS,  ///< no interface of the device has an address
    LOGGED_ATTEMPT,     ///< a start or a change, with no result yet
    LOGGED_SECOND_NAT,  ///< the service sees another address than the gateway's
    LOGGED_NO_GATEWAY,
    LOGGED_GATEWAY_WITHOUT_ADDRESS,
    LOGGED_GATEWAY_REFUSES,  ///< every port of one kind that was asked for
    LOGGED_PORT_HELD_BY_OTHER,
    LOGGED_PORT_OPENED,  ///< a port of the last search; only to understand other lines
    LOGGED_TEST_FAILED,
    LOGGED_TEST_SKIPPED_DISK,
    LOGGED_SERVICE_WAIT,
    LOGGED_SERVICE_UNRESOLVED,
    LOGGED_SERVICE_UNREACHABLE,  ///< no connection
    LOGGED_SERVICE_SILENT,       ///< a connection, but no answer to requests
    LOGGED_TEST_UNANSWERED,      ///< no answer to the last port test
    LOGGED_SERVICE_CERTIFICATE,
    LOGGED_SERVICE_NONSENSE,
    LOGGED_OTHER_DEVICE,
    LOGGED_PUBLISHING_FAILED,
    LOGGED_BACK_END_SILENT,
    LOGGED_BACK_END_REFUSES,
    LOGGED_NAMES_LEAD_ELSEWHERE,
    LOGGED_NAMES_UNRESOLVED,
    LOGGED_MANUAL_PORT_INVALID,
    LOGGED_MANUAL_RULED_OUT,  ///< manual ports are not tested after a second NAT was found
    LOGGED_RELAY_DOES_NOT_COME_UP,
    LOGGED_TUNNEL_NO_OUTPUT,  ///< the start command did not run, or could not write
    LOGGED_TUNNEL_DIED,

    CHANGED_SINCE,  ///< what the log says is over, by what is seen now
};

}  // namespace pelorus::doctor

#endif
