// The home gateway of a test: the UPnP calls of miniupnpc, libnatpmp and select end here, in one
// mapping table, and nothing is sent.
//
// At first the gateway speaks UPnP, not NAT-PMP, is connected and has an empty table. No
// answer takes time. Every call leaves one line, in order:
//
//   discover 2000 ms                      natpmp open
//   igd                                   natpmp address
//   external ip                           natpmp map TCP 9091 -> 80 for 172800 s
//   entry TCP 9091                        natpmp map TCP 0 -> 80 for 0 s     (a removal)
//   entry #0                              natpmp wait 250 ms
//   map TCP 9091 -> 192.168.77.10:80 Kavra            natpmp close
//   unmap TCP 9091
//
// Fails the test by itself: a UPnP call while SIGPIPE could end the process, a NAT-PMP request on
// a socket that a child process would inherit, a remote host or a lease with a UPnP mapping, a
// release of what was not handed out.
#ifndef PELORUS_SUPPORT_FAKE_GATEWAY_H
#define PELORUS_SUPPORT_FAKE_GATEWAY_H

#include <miniupnpc/miniupnpc.h>
#include <natpmp.h>
#include <sys/select.h>

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

    // --- what the gateway is; each may change at any time --------------------------------

    void speakUpnp(bool on) { upnp = on; }
    /// Off: requests are refused at once, as where nothing listens.
    void speakNatpmp(bool on) { natpmp = on; }
    /// NAT-PMP requests get no answer at all.
    void keepSilent() { silent = true; }
    /// Sends an answer that no request waits for any more.
    void answerLate();
    /// The address both protocols tell, at first 44.128.0.20.
    void setExternalIp(const std::string& address) { externalIp = address; }
    /// Lets the question for the external address fail with @p status (UPnP).
    void failExternalIp(int status) { externalIpStatus = status; }
    /// The devices a search finds, at first one gateway.
    void setDevices(std::vector<Device> list) { devices = std::move(list); }
    /// The library's choice: 0 none, 1 connected (as at first), 2 not connected, 3 no gateway.
    void setIgdState(int state) { igdState = state; }

    // --- its mapping table ---------------------------------------------------------------

    void add(const Mapping& mapping) { table.push_back(mapping); }
    /// In the order in which they were made.
    [[nodiscard]] const std::vector<Mapping>& mappings() const { return table; }
    /// Refuses to map this external port, whoever asks.
    void refusePort(int port) { refused.insert(port); }
    void acceptPort(int port) { refused.erase(port); }
    void refuseAllPorts(bool on = true) { refuseAll = on; }
    /// Fails removals and keeps the mapping.
    void refuseRemovals() { keepMappings = true; }
    /// Answers every question for one mapping with @p reply, whatever the table says.
    void lieAboutEntry(const Reply& reply) { specificLie = reply; }
    /// Answers every index of the table with @p reply, so that a status of 0 never ends.
    void lieAboutTable(const Reply& reply) { genericLie = reply; }
    /// NAT-PMP: grants differ from what was asked.
    void grant(const Grant& what) { granted = what; }
    /// Lets one library call fail with @p status and errno @p error.
    void failNatpmp(Natpmp call, int status, int error = 0) { failures[call] = {status, error}; }

    // --- what was asked ------------------------------------------------------------------

    [[nodiscard]] const Texts& calls() const { return lines; }
    /// Those that hold @p part, in order.
    [[nodiscard]] Texts calls(const std::string& part) const;
    [[nodiscard]] int count(const std::string& part) const;
    /// Forgets the calls, not the table and the state.
    void clear() { lines.clear(); }
    /// Runs @p action at each following call, before it is answered; gets its line.
    void onCall(std::function<void(const std::string&)> action) { hook = std::move(action); }

    /// Fails the test when a device list or URLs were not released.
    void checkReleased() const;
    void reset();

    // --- the far end of the calls --------------------------------------------------------

    UPNPDev* discover(int delay);
    void releaseDevices(UPNPDev* list);
    int validIgd(UPNPDev* list, UPNPUrls* urls, IGDdatas* data, char* lanAddress, int size);
    void releaseUrls(UPNPUrls* urls);
    int tellExternalIp(const char* url, const char* service, char* address);
    Reply specificEntry(const char* url, const char* service, const char* port, const char* proto);
    Reply genericEntry(const char* url, const char* service, const char* index);
    int addMapping(const char* url, const char* service, const Mapping& mapping);
    int removeMapping(const char* url, const char* service, const char* port, const char* proto);

    int openClient(natpmp_t* client);
    int closeClient();
    int sendAddressRequest();
    int sendMappingRequest(int protocol, int privatePort, int publicPort, unsigned lifetime);
    int requestTimeout(timeval* timeout);
    int waitForAnswer(int count, const fd_set* readable, const timeval* timeout);
    int readAnswer(natpmpresp_t* response);

private:
    struct DeviceList;
    struct Request {
        int protocol = 0;  // 0 asks for the address
        int privatePort = 0;
        int publicPort = 0;
        unsigned lifetime = 0;
    };

    FakeGateway();

    void note(const std::string& line);
    [[nodiscard]] bool isReached(const char* url, const char* service) const;
    bool fails(Natpmp call, int& status);
    [[nodiscard]] Reply replyFor(const Mapping& mapping) const;
    std::vector<Mapping>::iterator find(int externalPort, const std::string& protocol);
    int answerMapping(natpmpresp_t* response);

    bool upnp = true;
    bool natpmp = false;
    bool silent = false;
    std::string externalIp = "44.128.0.20";
    int externalIpStatus = 0;
    std::vector<Device> devices;
    int igdState = 1;
    std::vector<Mapping> table;
    std::set<int> refused;
    bool refuseAll = false;
    bool keepMappings = false;
    std::optional<Reply> specificLie;
    std::optional<Reply> genericLie;
    Grant granted;
    std::map<Natpmp, std::pair<int, int>> failures;
    Texts lines;
    std::function<void(const std::string&)> hook;
    std::map<UPNPDev*, std::unique_ptr<DeviceList>> lists;
    int urlSets = 0;
    int clients = 0;
    std::optional<Request> pending;
    int reads = 0;
};

bool operator==(const FakeGateway::Mapping& left, const FakeGateway::Mapping& right);
void PrintTo(const FakeGateway::Mapping& mapping, std::ostream* out);

}  // namespace pelorus::support

#endif
