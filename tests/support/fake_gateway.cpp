#include "support/fake_gateway.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <miniupnpc/upnpcommands.h>
#include <sys/select.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <iterator>
#include <tuple>

namespace {

// As the library does it: not terminated when the text fills the buffer.
void fill(char* buffer, std::size_t size, const std::string& text) {
    std::memset(buffer, 0, size);
    std::copy_n(text.data(), std::min(size, text.size()), buffer);
}

}  // namespace

namespace pelorus::support {

namespace {

constexpr const char* kControlUrl = "http://192.168.77.1:5000/ctl/IPConn";
constexpr const char* kServiceType = "urn:schemas-upnp-org:service:WANIPConnection:1";
constexpr int kActionFailed = 501;
constexpr int kNoSuchIndex = 713;
constexpr int kNoSuchEntry = 714;
constexpr int kConflict = 718;
constexpr long kFirstTimeout = 250;  // milliseconds
constexpr long kMicrosPerMilli = 1000;
constexpr long kMillisPerSecond = 1000;

// The first stands for the socket of every NAT-PMP client, the second is the gateway's. Open before
// any test begins, since clients may live longer than the test that made them.
const std::array<int, 2> sockets = [] {  // NOLINT(cert-err58-cpp): throws nothing
    std::array<int, 2> pair{};
    if (socketpair(AF_UNIX, SOCK_DGRAM, 0, pair.data()) != 0) pair = {-1, -1};
    return pair;
}();
const int clientSocket = sockets[0];
const int gatewaySocket = sockets[1];

bool isUnread() {
    char answer = 0;
    return recv(clientSocket, &answer, 1, MSG_DONTWAIT | MSG_PEEK) >= 0;
}

void checkBrokenPipeBlocked() {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGPIPE), 1) << "a closed connection would end the process";
}

std::string protocolName(int protocol) {
    return protocol == NATPMP_PROTOCOL_TCP ? "TCP" : "UDP";
}

FakeGateway::Reply replyFor(const FakeGateway::Mapping& mapping) {
    return {0,
            mapping.client,
            std::to_string(mapping.internalPort),
            mapping.description,
            std::to_string(mapping.externalPort),
            mapping.protocol};
}

FakeGateway::Reply failure(int status) {
    FakeGateway::Reply reply;
    reply.status = status;
    return reply;
}

}  // namespace

struct FakeGateway::DeviceList {
    std::vector<Device> texts;
    std::vector<UPNPDev> nodes;
};

FakeGateway::FakeGateway() {
    reset();
}

// Never destroyed: a Router under test may close its client at the end of the process.
FakeGateway& FakeGateway::get() {
    static auto* const instance = new FakeGateway;
    return *instance;
}

void FakeGateway::reset() {
    upnp = true;
    natpmp = silent = refuseAll = keepMappings = connectionRefused = false;
    externalIp = "44.128.0.20";
    externalIpStatus = 0;
    devices = {{"http://192.168.77.1:5000/rootDesc.xml",
                "urn:schemas-upnp-org:device:InternetGatewayDevice:1"}};
    igdState = 1;
    answerDelay = hungUntil = natpmpTime = 0;
    table.clear();
    refused.clear();
    entryLie.reset();
    tableLie.reset();
    granted = {};
    failures.clear();
    lines.clear();
    hook = nullptr;
    onTheWay.clear();
}

void FakeGateway::checkReleased() const {
    EXPECT_TRUE(lists.empty()) << "device lists not released: " << lists.size();
    EXPECT_EQ(urlSets, 0) << "URLs not released";
}

Texts FakeGateway::calls(const std::string& part) const {
    Texts found;
    std::copy_if(lines.begin(), lines.end(), std::back_inserter(found),
                 [&](const auto& line) { return line.find(part) != std::string::npos; });
    return found;
}

int FakeGateway::count(const std::string& part) const {
    return static_cast<int>(calls(part).size());
}

void FakeGateway::note(const std::string& line) {
    lines.push_back(line);
    if (hook) hook(line);
}

bool FakeGateway::fails(Natpmp call, int& status) const {
    const auto found = failures.find(call);
    if (found == failures.end()) return false;
    std::tie(status, errno) = found->second;
    return true;
}

std::vector<FakeGateway::Mapping>::iterator FakeGateway::find(int externalPort,
                                                              const std::string& protocol) {
    return std::find_if(table.begin(), table.end(), [&](const Mapping& mapping) {
        return mapping.externalPort == externalPort && mapping.protocol == protocol;
    });
}

bool FakeGateway::refuses(int externalPort) const {
    return refuseAll || refused.count(externalPort) != 0;
}

bool operator==(const FakeGateway::Mapping& left, const FakeGateway::Mapping& right) {
    const auto fields = [](const FakeGateway::Mapping& of) {
        return std::tie(of.externalPort, of.client, of.internalPort, of.description, of.protocol);
    };
    return fields(left) == fields(right);
}

void PrintTo(const FakeGateway::Mapping& mapping, std::ostream* out) {
    *out << mapping.protocol << " " << mapping.externalPort << " -> " << mapping.client << ":"
         << mapping.internalPort << " " << mapping.description;
}

// The far end of the library calls.
struct GatewayCalls {
    using Mapping = FakeGateway::Mapping;
    using Reply = FakeGateway::Reply;
    FakeGateway& gateway = FakeGateway::get();

    // --- UPnP ------------------------------------------------------------------------------

    UPNPDev* discover(int delay) {
        checkBrokenPipeBlocked();
        gateway.note("discover " + std::to_string(delay) + " ms");
        if (!gateway.upnp || gateway.devices.empty()) return nullptr;
        auto list = std::make_unique<FakeGateway::DeviceList>();
        list->texts = gateway.devices;
        list->nodes.resize(list->texts.size());
        UPNPDev* next = nullptr;
        for (std::size_t at = list->nodes.size(); at-- > 0; next = &list->nodes[at]) {
            list->nodes[at].pNext = next;
            list->nodes[at].descURL = list->texts[at].url.data();
            list->nodes[at].st = list->texts[at].target.data();
        }
        gateway.lists[next] = std::move(list);
        return next;
    }

    void releaseDevices(UPNPDev* list) {
        EXPECT_EQ(gateway.lists.erase(list), 1U) << "a device list that was not handed out";
    }

    int validIgd(UPNPDev* list, UPNPUrls* urls, IGDdatas* data, char* lanAddress, int size) {
        checkBrokenPipeBlocked();
        std::string line = "igd";
        // Reads every text, so that one released too early is found out.
        for (; list != nullptr; list = list->pNext) line.append(" ").append(list->descURL);
        gateway.note(line);
        if (gateway.igdState == 0) return 0;
        ++gateway.urlSets;
        *urls = {};
        urls->controlURL = strdup(kControlUrl);
        *data = {};
        fill(data->first.servicetype, sizeof data->first.servicetype, kServiceType);
        fill(lanAddress, static_cast<std::size_t>(size), kDeviceAddress);
        return gateway.igdState;
    }

    void releaseUrls(UPNPUrls* urls) {
        EXPECT_NE(urls->controlURL, nullptr) << "URLs that were not handed out";
        free(urls->controlURL);  // NOLINT(*-no-malloc): given out as the library does
        *urls = {};
        --gateway.urlSets;
    }

    // Notes a question to the control URL; true when it arrives.
    bool arrives(const char* url, const char* service, const std::string& line) {
        checkBrokenPipeBlocked();
        gateway.note(line);
        return gateway.upnp && std::string(url) == kControlUrl &&
               std::string(service) == kServiceType;
    }

    int externalAddress(const char* url, const char* service, char* address) {
        if (!arrives(url, service, "external ip")) return UPNPCOMMAND_HTTP_ERROR;
        if (gateway.externalIpStatus == 0) fill(address, INET_ADDRSTRLEN, gateway.externalIp);
        return gateway.externalIpStatus;
    }

    Reply entry(const char* url, const char* service, const std::string& port, const char* proto) {
        if (!arrives(url, service, std::string("entry ") + proto + " " + port)) {
            return failure(UPNPCOMMAND_HTTP_ERROR);
        }
        if (gateway.entryLie) return *gateway.entryLie;
        const auto found = gateway.find(std::stoi(port), proto);
        return found == gateway.table.end() ? failure(kNoSuchEntry) : replyFor(*found);
    }

    Reply entryAt(const char* url, const char* service, const std::string& index) {
        if (!arrives(url, service, "entry #" + index)) return failure(UPNPCOMMAND_HTTP_ERROR);
        if (gateway.tableLie) return *gateway.tableLie;
        const std::size_t at = std::stoul(index);
        return at < gateway.table.size() ? replyFor(gateway.table[at]) : failure(kNoSuchIndex);
    }

    int add(const char* url, const char* service, const Mapping& mapping) {
        const std::string line =
            "map " + mapping.protocol + " " + std::to_string(mapping.externalPort) + " -> " +
            mapping.client + ":" + std::to_string(mapping.internalPort) + " " + mapping.description;
        if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
        if (gateway.refuses(mapping.externalPort)) return kConflict;
        const auto held = gateway.find(mapping.externalPort, mapping.protocol);
        if (held != gateway.table.end()) {
            *held = mapping;
        } else {
            gateway.table.push_back(mapping);
        }
        return 0;
    }

    int remove(const char* url, const char* service, const std::string& port, const char* proto) {
        if (!arrives(url, service, std::string("unmap ") + proto + " " + port)) {
            return UPNPCOMMAND_HTTP_ERROR;
        }
        if (gateway.keepMappings) return kActionFailed;
        const auto found = gateway.find(std::stoi(port), proto);
        if (found == gateway.table.end()) return kNoSuchEntry;
        gateway.table.erase(found);
        return 0;
    }

    // --- NAT-PMP ---------------------------------------------------------------------------

    int open(natpmp_t* client) {
        gateway.note("natpmp open");
        int status = 0;
        ++gateway.clients;
        *client = {};
        client->s = clientSocket;
        // The library keeps the socket of a failed start.
        if (gateway.fails(FakeGateway::Natpmp::OPEN, status)) return status;
        // As the library's socket comes.
        fcntl(clientSocket, F_SETFD, 0);
        return 0;
    }

    int close() {
        gateway.note("natpmp close");
        EXPECT_GT(gateway.clients, 0) << "a NAT-PMP client that was not opened";
        --gateway.clients;
        int status = 0;
        return gateway.fails(FakeGateway::Natpmp::CLOSE, status) ? status : 0;
    }

    int askAddress(natpmp_t* client) {
        gateway.note("natpmp address");
        return send(client, FakeGateway::Natpmp::SEND_ADDRESS, {});
    }

    int askMapping(natpmp_t* client, const FakeGateway::Request& request) {
        gateway.note("natpmp map " + protocolName(request.protocol) + " " +
                     std::to_string(request.publicPort) + " -> " +
                     std::to_string(request.privatePort) + " for " +
                     std::to_string(request.lifetime) + " s");
        return send(client, FakeGateway::Natpmp::SEND_MAPPING, request);
    }

    int send(natpmp_t* client, FakeGateway::Natpmp call, const FakeGateway::Request& request) {
        EXPECT_FALSE(isUnread()) << "a late answer would be taken for that to this request";
        int status = 0;
        if (gateway.fails(call, status)) return status;
        gateway.pending = request;
        client->has_pending_request = 1;
        client->try_number = 0;
        transmit(client);
        return 0;
    }

    // Sends the request, for the first time or again.
    void transmit(natpmp_t* client) {
        gateway.retryTime = gateway.natpmpTime + (kFirstTimeout << client->try_number);
        ++client->try_number;
        gateway.connectionRefused = !gateway.natpmp;
        if (!gateway.natpmp || gateway.silent) return;
        const long time = std::max(gateway.natpmpTime + gateway.answerDelay, gateway.hungUntil);
        gateway.onTheWay.emplace(time, answer(gateway.pending));
    }

    FakeGateway::Datagram answer(const FakeGateway::Request& asked) {
        FakeGateway::Datagram told;
        told.response.type = static_cast<std::uint16_t>(asked.protocol);
        if (asked.protocol == 0) {
            inet_pton(AF_INET, gateway.externalIp.c_str(), &told.response.pnu.publicaddress.addr);
            return told;
        }
        if (asked.lifetime == 0 ? gateway.keepMappings : gateway.refuses(asked.publicPort)) {
            told.status = NATPMP_ERR_NOTAUTHORIZED;
            return told;
        }
        const std::string protocol = protocolName(asked.protocol);
        const auto isOwn = [&](const Mapping& held) {
            return held.client == kDeviceAddress && held.protocol == protocol &&
                   (asked.privatePort == 0 || held.internalPort == asked.privatePort);
        };
        auto& table = gateway.table;
        table.erase(std::remove_if(table.begin(), table.end(), isOwn), table.end());
        int publicPort = gateway.granted.publicPort.value_or(asked.publicPort);
        if (asked.lifetime != 0) {
            while (gateway.find(publicPort, protocol) != table.end()) ++publicPort;
            table.push_back({publicPort, kDeviceAddress, asked.privatePort, "", protocol});
        }
        auto& mapping = told.response.pnu.newportmapping;
        mapping.privateport =
            static_cast<std::uint16_t>(gateway.granted.privatePort.value_or(asked.privatePort));
        mapping.mappedpublicport = static_cast<std::uint16_t>(publicPort);
        mapping.lifetime = gateway.granted.lifetime.value_or(asked.lifetime);
        return told;
    }

    int timeout(const natpmp_t* client, timeval* timeout) {
        int status = 0;
        if (gateway.fails(FakeGateway::Natpmp::TIMEOUT, status)) return status;
        if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
        *timeout = {0, std::max(0L, gateway.retryTime - gateway.natpmpTime) * kMicrosPerMilli};
        return 0;
    }

    int wait(int count, const fd_set* readable, const timeval* timeout) {
        const long limit = timeout->tv_sec * kMillisPerSecond + timeout->tv_usec / kMicrosPerMilli;
        if (limit > 0) gateway.note("natpmp wait " + std::to_string(limit) + " ms");
        EXPECT_EQ(count, FD_SETSIZE);
        EXPECT_TRUE(FD_ISSET(clientSocket, readable));
        EXPECT_NE(fcntl(clientSocket, F_GETFD) & FD_CLOEXEC, 0) << "inherited by child processes";
        if (gateway.connectionRefused || isUnread()) return 1;
        auto& onTheWay = gateway.onTheWay;
        const long end = gateway.natpmpTime + limit;
        if (onTheWay.empty() || onTheWay.begin()->first > end) {
            gateway.natpmpTime = end;
            return 0;
        }
        gateway.natpmpTime = std::max(gateway.natpmpTime, onTheWay.begin()->first);
        const FakeGateway::Datagram& next = onTheWay.begin()->second;
        EXPECT_GT(::send(gatewaySocket, &next, sizeof next, 0), 0);
        onTheWay.erase(onTheWay.begin());
        return 1;
    }

    int read(natpmp_t* client, natpmpresp_t* response) {
        int status = 0;
        if (gateway.fails(FakeGateway::Natpmp::READ, status)) return status;
        if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
        FakeGateway::Datagram told;
        if (recv(clientSocket, &told, sizeof told, MSG_DONTWAIT) > 0) {
            if (told.status != 0) return told.status;  // the request stays pending
            *response = told.response;
            client->has_pending_request = 0;
            return 0;
        }
        if (gateway.connectionRefused) {
            gateway.connectionRefused = false;
            errno = ECONNREFUSED;
            return NATPMP_ERR_NOGATEWAYSUPPORT;
        }
        if (gateway.natpmpTime >= gateway.retryTime) transmit(client);
        errno = EAGAIN;
        return NATPMP_TRYAGAIN;
    }
};

}  // namespace pelorus::support

using pelorus::support::FakeGateway;
using pelorus::support::GatewayCalls;

// The argument lists of the library changed with its versions.
// NOLINTBEGIN(bugprone-reserved-identifier, readability-function-size): names the linker gives
extern "C" {
decltype(upnpDiscover) __wrap_upnpDiscover;
decltype(freeUPNPDevlist) __wrap_freeUPNPDevlist;
decltype(UPNP_GetValidIGD) __wrap_UPNP_GetValidIGD;
decltype(FreeUPNPUrls) __wrap_FreeUPNPUrls;
decltype(UPNP_GetExternalIPAddress) __wrap_UPNP_GetExternalIPAddress;
decltype(UPNP_GetSpecificPortMappingEntry) __wrap_UPNP_GetSpecificPortMappingEntry;
decltype(UPNP_AddPortMapping) __wrap_UPNP_AddPortMapping;
decltype(UPNP_DeletePortMapping) __wrap_UPNP_DeletePortMapping;
decltype(UPNP_GetGenericPortMappingEntry) __wrap_UPNP_GetGenericPortMappingEntry;
decltype(initnatpmp) __wrap_initnatpmp;
decltype(closenatpmp) __wrap_closenatpmp;
decltype(sendpublicaddressrequest) __wrap_sendpublicaddressrequest;
decltype(sendnewportmappingrequest) __wrap_sendnewportmappingrequest;
decltype(getnatpmprequesttimeout) __wrap_getnatpmprequesttimeout;
decltype(readnatpmpresponseorretry) __wrap_readnatpmpresponseorretry;
int __wrap_select(int count, fd_set* readable, fd_set* writable, fd_set* broken, timeval* timeout);
}

namespace {

void fillEntry(const FakeGateway::Reply& reply,
               char* client,
               char* internalPort,
               char* description,
               char* enabled,
               char* lease) {
    if (!reply.client.empty()) fill(client, 16, reply.client);
    if (!reply.internalPort.empty()) fill(internalPort, 6, reply.internalPort);
    if (reply.status != 0) return;
    fill(description, 80, reply.description);
    fill(enabled, 4, reply.enabled);
    fill(lease, 16, reply.lease);
}

}  // namespace

UPNPDev* __wrap_upnpDiscover(int delay,
                             const char* /*multicastIf*/,
                             const char* /*socketPath*/,
                             int /*localPort*/,
                             int /*ipv6*/,
#if MINIUPNPC_API_VERSION >= 14
                             unsigned char /*ttl*/,
#endif
                             int* error) {
    *error = 0;
    return GatewayCalls{}.discover(delay);
}

void __wrap_freeUPNPDevlist(UPNPDev* list) {
    GatewayCalls{}.releaseDevices(list);
}

#if MINIUPNPC_API_VERSION >= 18
int __wrap_UPNP_GetValidIGD(UPNPDev* list,
                            UPNPUrls* urls,
                            IGDdatas* data,
                            char* lanAddress,
                            int size,
                            char* /*wanAddress*/,
                            int /*wanSize*/) {
    const int state = GatewayCalls{}.validIgd(list, urls, data, lanAddress, size);
    return state >= 2 ? state + 1 : state;
}
#else
int __wrap_UPNP_GetValidIGD(
    UPNPDev* list, UPNPUrls* urls, IGDdatas* data, char* lanAddress, int size) {
    return GatewayCalls{}.validIgd(list, urls, data, lanAddress, size);
}
#endif

void __wrap_FreeUPNPUrls(UPNPUrls* urls) {
    GatewayCalls{}.releaseUrls(urls);
}

int __wrap_UPNP_GetExternalIPAddress(const char* url, const char* service, char* address) {
    return GatewayCalls{}.externalAddress(url, service, address);
}

int __wrap_UPNP_GetSpecificPortMappingEntry(const char* url,
                                            const char* service,
                                            const char* port,
                                            const char* proto,
#if MINIUPNPC_API_VERSION >= 10
                                            const char* /*remoteHost*/,
#endif
                                            char* client,
                                            char* internalPort,
                                            char* description,
                                            char* enabled,
                                            char* lease) {
    const auto reply = GatewayCalls{}.entry(url, service, port, proto);
    fillEntry(reply, client, internalPort, description, enabled, lease);
    return reply.status;
}

int __wrap_UPNP_AddPortMapping(const char* url,
                               const char* service,
                               const char* port,
                               const char* internalPort,
                               const char* client,
                               const char* description,
                               const char* proto,
                               const char* remoteHost,
                               const char* lease) {
    EXPECT_EQ(remoteHost, nullptr);
    EXPECT_EQ(lease, nullptr);
    return GatewayCalls{}.add(
        url, service, {std::stoi(port), client, std::stoi(internalPort), description, proto});
}

int __wrap_UPNP_DeletePortMapping(const char* url,
                                  const char* service,
                                  const char* port,
                                  const char* proto,
                                  const char* remoteHost) {
    EXPECT_EQ(remoteHost, nullptr);
    return GatewayCalls{}.remove(url, service, port, proto);
}

int __wrap_UPNP_GetGenericPortMappingEntry(const char* url,
                                           const char* service,
                                           const char* index,
                                           char* port,
                                           char* client,
                                           char* internalPort,
                                           char* proto,
                                           char* description,
                                           char* enabled,
                                           char* remoteHost,
                                           char* lease) {
    const auto reply = GatewayCalls{}.entryAt(url, service, index);
    fillEntry(reply, client, internalPort, description, enabled, lease);
    if (reply.status != 0) return reply.status;
    fill(port, 6, reply.externalPort);
    fill(proto, 4, reply.protocol);
    fill(remoteHost, 64, "");
    return 0;
}

int __wrap_initnatpmp(natpmp_t* client, int forcedGateway, in_addr_t gateway) {
    EXPECT_EQ(forcedGateway, 0);
    EXPECT_EQ(gateway, 0U);
    return GatewayCalls{}.open(client);
}

int __wrap_closenatpmp(natpmp_t* /*client*/) {
    return GatewayCalls{}.close();
}

int __wrap_sendpublicaddressrequest(natpmp_t* client) {
    return GatewayCalls{}.askAddress(client);
}

int __wrap_sendnewportmappingrequest(natpmp_t* client,
                                     int protocol,
                                     std::uint16_t privatePort,
                                     std::uint16_t publicPort,
                                     std::uint32_t lifetime) {
    return GatewayCalls{}.askMapping(client, {protocol, privatePort, publicPort, lifetime});
}

int __wrap_getnatpmprequesttimeout(natpmp_t* client, timeval* timeout) {
    return GatewayCalls{}.timeout(client, timeout);
}

int __wrap_readnatpmpresponseorretry(natpmp_t* client, natpmpresp_t* response) {
    return GatewayCalls{}.read(client, response);
}

int __wrap_select(int count, fd_set* readable, fd_set* writable, fd_set* broken, timeval* timeout) {
    EXPECT_EQ(writable, nullptr);
    EXPECT_EQ(broken, nullptr);
    return GatewayCalls{}.wait(count, readable, timeout);
}
// NOLINTEND(bugprone-reserved-identifier, readability-function-size)
