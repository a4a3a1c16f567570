#include "support/fake_gateway.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <miniupnpc/upnpcommands.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <iterator>

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

// The first stands for the socket of every NAT-PMP client, the second is the gateway's. Open before
// any test begins, since clients may live longer than the test that made them.
const std::array<int, 2> sockets = [] {  // NOLINT(cert-err58-cpp): throws nothing
    std::array<int, 2> pair{};
    if (socketpair(AF_UNIX, SOCK_DGRAM, 0, pair.data()) != 0) pair = {-1, -1};
    return pair;
}();
const int socketStandIn = sockets[0];
const int gatewaySocket = sockets[1];

void checkNothingUnread() {
    char late = 0;
    EXPECT_LT(recv(socketStandIn, &late, 1, MSG_DONTWAIT | MSG_PEEK), 0)
        << "a late answer would be taken for that to this request";
}

void checkBrokenPipeBlocked() {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGPIPE), 1) << "a closed connection would end the process";
}

std::string protocolName(int protocol) {
    if (protocol == NATPMP_PROTOCOL_TCP) return "TCP";
    return protocol == NATPMP_PROTOCOL_UDP ? "UDP" : "protocol " + std::to_string(protocol);
}

}  // namespace

struct FakeGateway::DeviceList {
    std::vector<Device> texts;
    std::vector<UPNPDev> nodes;
};

FakeGateway::FakeGateway() {
    reset();
}

// Never destroyed: a Router under test may say goodbye at the end of the process.
FakeGateway& FakeGateway::get() {
    static auto* const instance = new FakeGateway;
    return *instance;
}

void FakeGateway::reset() {
    upnp = true;
    natpmp = silent = refuseAll = keepMappings = false;
    externalIp = "44.128.0.20";
    externalIpStatus = 0;
    devices = {{"http://192.168.77.1:5000/rootDesc.xml",
                "urn:schemas-upnp-org:device:InternetGatewayDevice:1"}};
    igdState = 1;
    table.clear();
    refused.clear();
    specificLie.reset();
    genericLie.reset();
    granted = {};
    failures.clear();
    lines.clear();
    hook = nullptr;
    pending.reset();
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

void FakeGateway::checkReleased() const {
    EXPECT_TRUE(lists.empty()) << "device lists not released: " << lists.size();
    EXPECT_EQ(urlSets, 0) << "URLs not released";
}

void FakeGateway::note(const std::string& line) {
    lines.push_back(line);
    if (hook) hook(line);
}

// --- UPnP ----------------------------------------------------------------------------------

UPNPDev* FakeGateway::discover(int delay) {
    checkBrokenPipeBlocked();
    note("discover " + std::to_string(delay) + " ms");
    if (!upnp || devices.empty()) return nullptr;
    auto list = std::make_unique<DeviceList>();
    list->texts = devices;
    for (Device& device : list->texts) {
        UPNPDev node{};
        node.descURL = device.url.data();
        node.st = device.target.data();
        list->nodes.push_back(node);
    }
    for (std::size_t at = 0; at + 1 < list->nodes.size(); ++at) {
        list->nodes[at].pNext = &list->nodes[at + 1];
    }
    UPNPDev* const head = list->nodes.data();
    lists[head] = std::move(list);
    return head;
}

void FakeGateway::releaseDevices(UPNPDev* list) {
    EXPECT_EQ(lists.erase(list), 1U) << "a device list that was not handed out";
}

int FakeGateway::validIgd(
    UPNPDev* list, UPNPUrls* urls, IGDdatas* data, char* lanAddress, int size) {
    checkBrokenPipeBlocked();
    std::string line = "igd";
    // Reads every text, so that one released too early is found out.
    for (; list != nullptr; list = list->pNext) line.append(" ").append(list->descURL);
    note(line);
    if (igdState == 0) return 0;
    ++urlSets;
    *urls = {};
    urls->controlURL = strdup(kControlUrl);
    *data = {};
    fill(data->first.servicetype, sizeof data->first.servicetype, kServiceType);
    fill(lanAddress, static_cast<std::size_t>(size), kDeviceAddress);
    return igdState;
}

void FakeGateway::releaseUrls(UPNPUrls* urls) {
    EXPECT_NE(urls->controlURL, nullptr) << "URLs that were not handed out";
    free(urls->controlURL);  // NOLINT(*-no-malloc): given out as the library does
    *urls = {};
    --urlSets;
}

bool FakeGateway::isReached(const char* url, const char* service) const {
    checkBrokenPipeBlocked();
    return upnp && std::string(url) == kControlUrl && std::string(service) == kServiceType;
}

int FakeGateway::tellExternalIp(const char* url, const char* service, char* address) {
    note("external ip");
    if (!isReached(url, service)) return UPNPCOMMAND_HTTP_ERROR;
    if (externalIpStatus == 0) fill(address, INET_ADDRSTRLEN, externalIp);
    return externalIpStatus;
}

FakeGateway::Reply FakeGateway::replyFor(const Mapping& mapping) const {
    Reply reply;
    reply.client = mapping.client;
    reply.internalPort = std::to_string(mapping.internalPort);
    reply.description = mapping.description;
    reply.externalPort = std::to_string(mapping.externalPort);
    reply.protocol = mapping.protocol;
    return reply;
}

std::vector<FakeGateway::Mapping>::iterator FakeGateway::find(int externalPort,
                                                              const std::string& protocol) {
    return std::find_if(table.begin(), table.end(), [&](const Mapping& mapping) {
        return mapping.externalPort == externalPort && mapping.protocol == protocol;
    });
}

FakeGateway::Reply FakeGateway::specificEntry(const char* url,
                                              const char* service,
                                              const char* port,
                                              const char* proto) {
    note(std::string("entry ") + proto + " " + port);
    Reply failure;
    failure.status = UPNPCOMMAND_HTTP_ERROR;
    if (!isReached(url, service)) return failure;
    if (specificLie) return *specificLie;
    const auto found = find(std::stoi(port), proto);
    failure.status = kNoSuchEntry;
    return found == table.end() ? failure : replyFor(*found);
}

FakeGateway::Reply FakeGateway::genericEntry(const char* url,
                                             const char* service,
                                             const char* index) {
    note(std::string("entry #") + index);
    Reply failure;
    failure.status = UPNPCOMMAND_HTTP_ERROR;
    if (!isReached(url, service)) return failure;
    if (genericLie) return *genericLie;
    const std::size_t at = std::stoul(index);
    failure.status = kNoSuchIndex;
    return at < table.size() ? replyFor(table[at]) : failure;
}

int FakeGateway::addMapping(const char* url, const char* service, const Mapping& mapping) {
    note("map " + mapping.protocol + " " + std::to_string(mapping.externalPort) + " -> " +
         mapping.client + ":" + std::to_string(mapping.internalPort) + " " + mapping.description);
    if (!isReached(url, service)) return UPNPCOMMAND_HTTP_ERROR;
    if (refuseAll || refused.count(mapping.externalPort) != 0) return kConflict;
    const auto held = find(mapping.externalPort, mapping.protocol);
    if (held == table.end()) {
        table.push_back(mapping);
    } else {
        *held = mapping;
    }
    return 0;
}

int FakeGateway::removeMapping(const char* url,
                               const char* service,
                               const char* port,
                               const char* proto) {
    note(std::string("unmap ") + proto + " " + port);
    if (!isReached(url, service)) return UPNPCOMMAND_HTTP_ERROR;
    if (keepMappings) return kActionFailed;
    const auto found = find(std::stoi(port), proto);
    if (found == table.end()) return kNoSuchEntry;
    table.erase(found);
    return 0;
}

// --- NAT-PMP -------------------------------------------------------------------------------

bool FakeGateway::fails(Natpmp call, int& status) {
    const auto failure = failures.find(call);
    if (failure == failures.end()) return false;
    status = failure->second.first;
    errno = failure->second.second;
    return true;
}

int FakeGateway::openClient(natpmp_t* client) {
    note("natpmp open");
    int status = 0;
    ++clients;
    *client = {};
    client->s = socketStandIn;
    // The library keeps the socket of a failed start.
    if (fails(Natpmp::OPEN, status)) return status;
    // As the library's socket comes.
    fcntl(socketStandIn, F_SETFD, 0);
    return 0;
}

int FakeGateway::closeClient() {
    note("natpmp close");
    EXPECT_GT(clients, 0) << "a NAT-PMP client that was not opened";
    --clients;
    int status = 0;
    return fails(Natpmp::CLOSE, status) ? status : 0;
}

void FakeGateway::answerLate() {
    EXPECT_EQ(send(gatewaySocket, "late", 4, 0), 4);
}

int FakeGateway::sendAddressRequest() {
    note("natpmp address");
    checkNothingUnread();
    int status = 0;
    if (fails(Natpmp::SEND_ADDRESS, status)) return status;
    pending = Request{};
    reads = 0;
    return 2;
}

int FakeGateway::sendMappingRequest(int protocol,
                                    int privatePort,
                                    int publicPort,
                                    unsigned lifetime) {
    note("natpmp map " + protocolName(protocol) + " " + std::to_string(publicPort) + " -> " +
         std::to_string(privatePort) + " for " + std::to_string(lifetime) + " s");
    checkNothingUnread();
    int status = 0;
    if (fails(Natpmp::SEND_MAPPING, status)) return status;
    pending = Request{protocol, privatePort, publicPort, lifetime};
    reads = 0;
    return 12;
}

int FakeGateway::requestTimeout(timeval* timeout) {
    int status = 0;
    if (fails(Natpmp::TIMEOUT, status)) return status;
    if (!pending) return NATPMP_ERR_NOPENDINGREQ;
    constexpr int kFirst = 250'000;
    *timeout = {0, kFirst << reads};
    return 0;
}

int FakeGateway::waitForAnswer(int count, const fd_set* readable, const timeval* timeout) {
    note("natpmp wait " + std::to_string(timeout->tv_sec * 1000 + timeout->tv_usec / 1000) + " ms");
    EXPECT_EQ(count, FD_SETSIZE);
    EXPECT_TRUE(FD_ISSET(socketStandIn, readable));
    EXPECT_NE(fcntl(socketStandIn, F_GETFD) & FD_CLOEXEC, 0) << "inherited by child processes";
    return silent ? 0 : 1;
}

int FakeGateway::readAnswer(natpmpresp_t* response) {
    ++reads;
    int status = 0;
    if (fails(Natpmp::READ, status)) return status;
    if (!pending) return NATPMP_ERR_NOPENDINGREQ;
    if (silent) {
        errno = EAGAIN;
        return NATPMP_TRYAGAIN;
    }
    if (!natpmp) {
        pending.reset();
        errno = ECONNREFUSED;
        return NATPMP_ERR_NOGATEWAYSUPPORT;
    }
    *response = {};
    if (pending->protocol != 0) return answerMapping(response);
    pending.reset();
    response->type = NATPMP_RESPTYPE_PUBLICADDRESS;
    inet_pton(AF_INET, externalIp.c_str(), &response->pnu.publicaddress.addr);
    return 0;
}

int FakeGateway::answerMapping(natpmpresp_t* response) {
    const Request asked = *pending;
    pending.reset();
    const std::string protocol = protocolName(asked.protocol);
    const bool refuses = refuseAll || refused.count(asked.publicPort) != 0;
    if (asked.lifetime == 0 ? keepMappings : refuses) return NATPMP_ERR_NOTAUTHORIZED;

    const auto isOwn = [&](const Mapping& held) {
        return held.client == kDeviceAddress && held.protocol == protocol &&
               (asked.privatePort == 0 || held.internalPort == asked.privatePort);
    };
    table.erase(std::remove_if(table.begin(), table.end(), isOwn), table.end());
    int publicPort = granted.publicPort.value_or(asked.publicPort);
    if (asked.lifetime != 0) {
        while (find(publicPort, protocol) != table.end()) ++publicPort;
        table.push_back({publicPort, kDeviceAddress, asked.privatePort, "", protocol});
    }
    response->type = static_cast<std::uint16_t>(asked.protocol);
    auto& mapping = response->pnu.newportmapping;
    mapping.privateport =
        static_cast<std::uint16_t>(granted.privatePort.value_or(asked.privatePort));
    mapping.mappedpublicport = static_cast<std::uint16_t>(publicPort);
    mapping.lifetime = granted.lifetime.value_or(asked.lifetime);
    return 0;
}

bool operator==(const FakeGateway::Mapping& left, const FakeGateway::Mapping& right) {
    return left.externalPort == right.externalPort && left.client == right.client &&
           left.internalPort == right.internalPort && left.description == right.description &&
           left.protocol == right.protocol;
}

void PrintTo(const FakeGateway::Mapping& mapping, std::ostream* out) {
    *out << mapping.protocol << " " << mapping.externalPort << " -> " << mapping.client << ":"
         << mapping.internalPort << " " << mapping.description;
}

}  // namespace pelorus::support

using pelorus::support::FakeGateway;

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
    return FakeGateway::get().discover(delay);
}

void __wrap_freeUPNPDevlist(UPNPDev* list) {
    FakeGateway::get().releaseDevices(list);
}

#if MINIUPNPC_API_VERSION >= 18
int __wrap_UPNP_GetValidIGD(UPNPDev* list,
                            UPNPUrls* urls,
                            IGDdatas* data,
                            char* lanAddress,
                            int size,
                            char* /*wanAddress*/,
                            int /*wanSize*/) {
    const int state = FakeGateway::get().validIgd(list, urls, data, lanAddress, size);
    return state >= 2 ? state + 1 : state;
}
#else
int __wrap_UPNP_GetValidIGD(
    UPNPDev* list, UPNPUrls* urls, IGDdatas* data, char* lanAddress, int size) {
    return FakeGateway::get().validIgd(list, urls, data, lanAddress, size);
}
#endif

void __wrap_FreeUPNPUrls(UPNPUrls* urls) {
    FakeGateway::get().releaseUrls(urls);
}

int __wrap_UPNP_GetExternalIPAddress(const char* url, const char* service, char* address) {
    return FakeGateway::get().tellExternalIp(url, service, address);
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
    const auto reply = FakeGateway::get().specificEntry(url, service, port, proto);
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
    FakeGateway::Mapping mapping;
    mapping.externalPort = std::stoi(port);
    mapping.client = client;
    mapping.internalPort = std::stoi(internalPort);
    mapping.description = description;
    mapping.protocol = proto;
    return FakeGateway::get().addMapping(url, service, mapping);
}

int __wrap_UPNP_DeletePortMapping(const char* url,
                                  const char* service,
                                  const char* port,
                                  const char* proto,
                                  const char* remoteHost) {
    EXPECT_EQ(remoteHost, nullptr);
    return FakeGateway::get().removeMapping(url, service, port, proto);
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
    const auto reply = FakeGateway::get().genericEntry(url, service, index);
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
    return FakeGateway::get().openClient(client);
}

int __wrap_closenatpmp(natpmp_t* /*client*/) {
    return FakeGateway::get().closeClient();
}

int __wrap_sendpublicaddressrequest(natpmp_t* /*client*/) {
    return FakeGateway::get().sendAddressRequest();
}

int __wrap_sendnewportmappingrequest(natpmp_t* /*client*/,
                                     int protocol,
                                     std::uint16_t privatePort,
                                     std::uint16_t publicPort,
                                     std::uint32_t lifetime) {
    return FakeGateway::get().sendMappingRequest(protocol, privatePort, publicPort, lifetime);
}

int __wrap_getnatpmprequesttimeout(natpmp_t* /*client*/, timeval* timeout) {
    return FakeGateway::get().requestTimeout(timeout);
}

int __wrap_readnatpmpresponseorretry(natpmp_t* /*client*/, natpmpresp_t* response) {
    return FakeGateway::get().readAnswer(response);
}

int __wrap_select(int count, fd_set* readable, fd_set* writable, fd_set* broken, timeval* timeout) {
    EXPECT_EQ(writable, nullptr);
    EXPECT_EQ(broken, nullptr);
    return FakeGateway::get().waitForAnswer(count, readable, timeout);
}
// NOLINTEND(bugprone-reserved-identifier, readability-function-size)
