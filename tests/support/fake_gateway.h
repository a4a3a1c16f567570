// The home gateway of a test. The UPnP calls of miniupnpc, libnatpmp and select end here; in one
// mapping table; nothing is sent. Initially it speaks UPnP only, is connected and has no mapping.
// Only waits for NAT-PMP answers take time. Each call leaves one line, in order:
//
//   discover 2000 ms                           natpmp open
//   igd http://192.168.77.1:5000/rootDesc.xml  natpmp address
//   external ip                                natpmp map TCP 9091 -> 80 for 172800 s
//   entry TCP 9091                             natpmp map TCP 0 -> 80 for 0 s     (a removal)
//   entry #0                                   natpmp wait 250 ms
//   map TCP 9091 -> 192.168.77.10:80 Kavra     natpmp close
//   unmap TCP 9091
//
// Fails the test on a UPnP call while SIGPIPE could end the process, a NAT-PMP request on a socket
// that a child process would inherit, a remote host or a lease with a UPnP mapping, and a release
// of what was not handed out.
#ifndef PELORUS_SUPPORT_FAKE_GATEWAY_H
#define PELORUS_SUPPORT_FAKE_GATEWAY_H

#include <gtest/gtest.h>
#include <miniupnpc/miniupnpc.h>
#include <natpmp.h>

#include <map>
#include <optional>
#include <ostream>

#include "support/fake.h"

namespace pelorus::support {

/// The device as the gateway sees it.
inline constexpr const char* kDeviceAddress = "192.168.77.10";

class FakeGateway : public Single<FakeGateway>, public Calls<> {
public:
    struct Mapping {
        int externalPort = 0;
        std::string client = kDeviceAddress;
        int internalPort = 0;
        std::string description{};
        std::string protocol = "TCP";
        friend void PrintTo(const Mapping& mapping, std::ostream* out) {
            *out << mapping.protocol << " " << mapping.externalPort << " -> " << mapping.client
                 << ":" << mapping.internalPort << " " << mapping.description;
        }
        friend bool operator==(const Mapping& left, const Mapping& right) {
            return ::testing::PrintToString(left) == ::testing::PrintToString(right);
        }
    };
    /// A mapping as the gateway reports it, true or not. As in the library, a text is cut to the
    /// size of its buffer and has no terminator when it fills that.
    struct Reply {
        int status = 0;
        std::string client{}, internalPort{}, description{}, externalPort{}, protocol{};
        std::string enabled = "1", lease = "0";
    };
    /// What a NAT-PMP gateway grants in place of what was asked.
    struct Grant {
        std::optional<int> publicPort{}, privatePort{};
        std::optional<unsigned> lifetime{};
    };

    /// Fails the test when a device list or URLs were not released.
    void checkReleased() const { EXPECT_TRUE(listed.empty() && urlSets == 0); }

    bool upnp = true;
    bool natpmp = false;                     ///< off: refused at once, as where nothing listens
    std::string externalIp = "44.128.0.20";  ///< in both protocols
    int externalIpStatus = 0;
    /// URL and search target of the UPnP devices.
    std::vector<std::pair<std::string, std::string>> devices{
        {"http://192.168.77.1:5000/rootDesc.xml",
         "urn:schemas-upnp-org:device:InternetGatewayDevice:1"}};
    /// The library's choice: 0 none, 1 connected, 2 not connected, 3 no gateway.
    int igdState = 1;

    bool silent = false;    ///< requests from now on are lost
    long answerDelay = 0;   ///< requests are answered so much later
    long natpmpTime = 0;    ///< spent waiting for answers
    long clockSetBack = 0;  ///< by so many seconds after each request
    int copies = 1;         ///< of each answer
    /// Arrives in place of each answer, for the library itself to read.
    std::optional<std::string> datagram;
    /// NAT-PMP calls that fail with -9 and EIO: "open", "close", "address", "map", "timeout",
    /// "read".
    std::set<std::string> failing;

    Grant granted;
    std::vector<Mapping> table;
    std::set<int> refused;  ///< external ports
    bool refuseAll = false;
    /// The UPnP answer for every port and index, whatever the table says.
    std::optional<Reply> lie;

    // For the library calls.
    std::vector<UPNPDev> listed;  // handed out and not released
    int urlSets = 0;
    natpmpresp_t pending{};  // the answer to the last request
    long retryTime = 0;
    bool connectionRefused = false;
    std::multimap<long, natpmpresp_t> onTheWay;  // answers by arrival
};

}  // namespace pelorus::support

#endif
