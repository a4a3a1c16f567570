// The home gateway of a test. The UPnP calls of miniupnpc, libnatpmp and select end here, in one
// mapping table; nothing is sent.
//
// At first the gateway speaks UPnP but not NAT-PMP, is connected and has an empty table. UPnP takes
// no time; NAT-PMP keeps a time of its own, which only the waits for answers move. Every call
// leaves one line, in order:
//
//   discover 2000 ms                           natpmp open
//   igd http://192.168.77.1:5000/rootDesc.xml  natpmp address
//   external ip                                natpmp map TCP 9091 -> 80 for 172800 s
//   entry TCP 9091                             natpmp map TCP 0 -> 80 for 0 s     (a removal)
//   entry #0                                   natpmp wait 250 ms
//   map TCP 9091 -> 192.168.77.10:80 Kavra     natpmp close
//   unmap TCP 9091
//
// Fails the test by itself: a UPnP call while SIGPIPE could end the process, a NAT-PMP request while
// an answer is unread or on a socket that a child process would inherit, a remote host or a lease
// with a UPnP mapping, a release of what was not handed out.
#ifndef PELORUS_SUPPORT_FAKE_GATEWAY_H
#define PELORUS_SUPPORT_FAKE_GATEWAY_H

#include <miniupnpc/miniupnpc.h>
#include <natpmp.h>

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <ostream>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

using Texts = std::vector<std::string>;

/// The device as the gateway sees it; also the first address FakeNet gives it.
inline constexpr const char* kDeviceAddress = "192.168.77.10";

class FakeGateway {
public:
    struct Mapping {
        int externalPort = 0;
        std::string client = kDeviceAddress;
        int internalPort = 0;
        std::string description{};
        std::string protocol = "TCP";
    };
    /// A UPnP device that answers a search.
    struct Device {
        std::string url;
        std::string target;
    };
    /// A mapping as the gateway tells it, true or not. Each text is cut to what the library
    /// documents for it, without a terminator when it fills that.
    struct Reply {
        int status = 0;
        std::string client{};
        std::string internalPort{};
        std::string description{};
        std::string externalPort{};
        std::string protocol = "TCP";
        std::string enabled = "1";
        std::string lease = "0";
    };
    enum class Natpmp { OPEN, CLOSE, SEND_ADDRESS, SEND_MAPPING, TIMEOUT, READ };
    /// What a NAT-PMP gateway grants in place of what was asked.
    struct Grant {
        std::optional<int> publicPort{};
        std::optional<int> privatePort{};
        std::optional<unsigned> lifetime{};
    };

    static FakeGateway& get();
    void reset();
    /// Fails the test when a device list or URLs were not released.
    void checkReleased() const;

    // --- what the gateway is; each may change at any time --------------------------------

    void speakUpnp(bool on) { upnp = on; }
    /// Off: requests are refused at once, as where nothing listens.
    void speakNatpmp(bool on) { natpmp = on; }
    /// The address both protocols tell, at first 44.128.0.20.
    void setExternalIp(const std::string& address) { externalIp = address; }
    /// Status of the UPnP question for the external address.
    int externalIpStatus = 0;
    /// The devices a search finds, at first one gateway.
    std::vector<Device> devices;
    /// The library's choice: 0 none, 1 connected (as at first), 2 not connected, 3 no gateway.
    int igdState = 1;

    // --- NAT-PMP in time -----------------------------------------------------------------

    /// Requests from now on are lost.
    bool silent = false;
    /// Requests are answered so much later, milliseconds.
    long answerDelay = 0;
    /// What comes before this time is answered at it, milliseconds.
    long hungUntil = 0;
    /// Milliseconds spent waiting for answers.
    long natpmpTime = 0;

    // --- its mapping table ---------------------------------------------------------------

    void add(const Mapping& mapping) { table.push_back(mapping); }
    /// In the order in which they were made.
    [[nodiscard]] const std::vector<Mapping>& mappings() const { return table; }
    /// Refuses to map this external port, whoever asks.
    void refusePort(int port) { refused.insert(port); }
    void acceptPort(int port) { refused.erase(port); }
    void refuseAllPorts(bool on = true) { refuseAll = on; }
    /// Fails removals and keeps the mapping.
    bool keepMappings = false;
    /// The answer to every question for one mapping, whatever the table says.
    std::optional<Reply> entryLie;
    /// The answer for every index of the table, so that a status of 0 never ends.
    std::optional<Reply> tableLie;
    /// NAT-PMP: grants differ from what was asked.
    void grant(const Grant& what) { granted = what; }
    /// Status and errno with which a library call fails.
    std::map<Natpmp, std::pair<int, int>> failures;

    // --- what was asked ------------------------------------------------------------------

    [[nodiscard]] const Texts& calls() const { return lines; }
    /// Those that hold @p part, in order.
    [[nodiscard]] Texts calls(const std::string& part) const;
    [[nodiscard]] int count(const std::string& part) const;
    /// Forgets the calls, not the table and the state.
    void clear() { lines.clear(); }
    /// Runs @p action at each following call, before it is answered; gets its line.
    void onCall(std::function<void(const std::string&)> action) { hook = std::move(action); }

    // --- for the library calls -----------------------------------------------------------

    struct DeviceList {
        std::vector<Device> texts;
        std::vector<UPNPDev> nodes;
    };
    struct Datagram {
        int status = 0;
        natpmpresp_t response{};
    };
    /// A NAT-PMP request; protocol 0 asks for the address.
    struct Request {
        int protocol = 0;
        int privatePort = 0;
        int publicPort = 0;
        unsigned lifetime = 0;
    };

    void note(const std::string& line);
    /// The status to fail with, errno set, or 0.
    [[nodiscard]] int failure(Natpmp call) const;
    [[nodiscard]] std::vector<Mapping>::iterator find(int externalPort,
                                                      const std::string& protocol);
    [[nodiscard]] bool refuses(int port) const { return refuseAll || refused.count(port) != 0; }

    bool upnp = true;
    bool natpmp = false;
    std::string externalIp;
    std::vector<Mapping> table;
    std::set<int> refused;
    bool refuseAll = false;
    Grant granted;
    Texts lines;
    std::function<void(const std::string&)> hook;
    std::map<UPNPDev*, std::unique_ptr<DeviceList>> lists;
    int urlSets = 0;
    int clients = 0;
    Request pending;
    long retryTime = 0;
    bool connectionRefused = false;
    std::multimap<long, Datagram> onTheWay;

private:
    FakeGateway() { reset(); }
};

bool operator==(const FakeGateway::Mapping& left, const FakeGateway::Mapping& right);
void PrintTo(const FakeGateway::Mapping& mapping, std::ostream* out);

}  // namespace pelorus::support

#endif
