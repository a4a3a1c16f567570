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
#include <climits>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <iterator>
#include <tuple>
#include <utility>

namespace pelorus::support {

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

int FakeGateway::failure(Natpmp call) const {
    const auto found = failures.find(call);
    if (found == failures.end()) return 0;
    errno = found->second.second;
    return found->second.first;
}

std::vector<FakeGateway::Mapping>::iterator FakeGateway::find(int externalPort,
                                                              const std::string& protocol) {
    return std::find_if(table.begin(), table.end(), [&](const Mapping& mapping) {
        return mapping.externalPort == externalPort && mapping.protocol == protocol;
    });
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

}  // namespace pelorus::support

using pelorus::support::FakeGateway;
using pelorus::support::kDeviceAddress;

namespace {

constexpr const char* kControlUrl = "http://192.168.77.1:5000/ctl/IPConn";
constexpr const char* kServiceType = "urn:schemas-upnp-org:service:WANIPConnection:1";
constexpr int kActionFailed = 501;
constexpr int kNoSuchIndex = 713;
constexpr int kNoSuchEntry = 714;
constexpr int kConflict = 718;
constexpr long kFirstTimeout = 250;  // milliseconds
constexpr long kMicrosPerMilli = 1000;

// The first stands for the socket of every NAT-PMP client, the second is the gateway's. Open before
// any test begins, since clients may live longer than the test that made them.
const std::array<int, 2> sockets = [] {  // NOLINT(cert-err58-cpp): throws nothing
    std::array<int, 2> pair{};
    if (socketpair(AF_UNIX, SOCK_DGRAM, 0, pair.data()) != 0) pair = {-1, -1};
    return pair;
}();
const int clientSocket = sockets[0];
const int gatewaySocket = sockets[1];

FakeGateway& gateway = FakeGateway::get();  // NOLINT(cert-err58-cpp): as above

bool isUnread() {
    char answer = 0;
    return recv(clientSocket, &answer, 1, MSG_DONTWAIT | MSG_PEEK) >= 0;
}

void checkBrokenPipeBlocked() {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGPIPE), 1) << "a closed connection would end the process";
}

// As the library does it: not terminated when the text fills the buffer.
void fill(char* buffer, std::size_t size, const std::string& text) {
    std::memset(buffer, 0, size);
    std::copy_n(text.data(), std::min(size, text.size()), buffer);
}

int fillEntry(const FakeGateway::Reply& reply,
              char* client,
              char* internalPort,
              char* description,
              char* enabled,
              char* lease) {
    if (!reply.client.empty()) fill(client, 16, reply.client);
    if (!reply.internalPort.empty()) fill(internalPort, 6, reply.internalPort);
    if (reply.status != 0) return reply.status;
    fill(description, 80, reply.description);
    fill(enabled, 4, reply.enabled);
    fill(lease, 16, reply.lease);
    return 0;
}

// Notes a question to the control URL; true when it arrives.
bool arrives(const char* url, const char* service, const std::string& line) {
    checkBrokenPipeBlocked();
    gateway.note(line);
    return gateway.upnp && std::string(url) == kControlUrl && std::string(service) == kServiceType;
}

FakeGateway::Reply replyFor(const std::vector<FakeGateway::Mapping>::iterator& held, int missing) {
    if (held == gateway.table.end()) return {missing};
    return {0,
            held->client,
            std::to_string(held->internalPort),
            held->description,
            std::to_string(held->externalPort),
            held->protocol};
}

std::string protocolName(int protocol) {
    return protocol == NATPMP_PROTOCOL_TCP ? "TCP" : "UDP";
}

FakeGateway::Datagram answerTo(const FakeGateway::Request& asked) {
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
    const auto isOwn = [&](const FakeGateway::Mapping& held) {
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

// Sends the pending request, for the first time or again.
void transmit(natpmp_t* client) {
    gateway.retryTime = gateway.natpmpTime + (kFirstTimeout << client->try_number);
    ++client->try_number;
    gateway.connectionRefused = !gateway.natpmp;
    if (!gateway.natpmp || gateway.silent) return;
    gateway.onTheWay.emplace(std::max(gateway.natpmpTime + gateway.answerDelay, gateway.hungUntil),
                             answerTo(gateway.pending));
}

int ask(natpmp_t* client, FakeGateway::Natpmp call, const FakeGateway::Request& request) {
    EXPECT_FALSE(isUnread()) << "a late answer would be taken for that to this request";
    if (const int status = gateway.failure(call)) return status;
    gateway.pending = request;
    client->has_pending_request = 1;
    client->try_number = 0;
    transmit(client);
    return 0;
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

void __wrap_freeUPNPDevlist(UPNPDev* list) {
    EXPECT_EQ(gateway.lists.erase(list), 1U) << "a device list that was not handed out";
}

int __wrap_UPNP_GetValidIGD(UPNPDev* list,
                            UPNPUrls* urls,
                            IGDdatas* data,
                            char* lanAddress,
                            int size
#if MINIUPNPC_API_VERSION >= 18
                            ,
                            char* /*wanAddress*/,
                            int /*wanSize*/
#endif
) {
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
    const bool shifted = MINIUPNPC_API_VERSION >= 18 && gateway.igdState >= 2;
    return shifted ? gateway.igdState + 1 : gateway.igdState;
}

void __wrap_FreeUPNPUrls(UPNPUrls* urls) {
    EXPECT_NE(urls->controlURL, nullptr) << "URLs that were not handed out";
    free(urls->controlURL);  // NOLINT(*-no-malloc): given out as the library does
    *urls = {};
    --gateway.urlSets;
}

int __wrap_UPNP_GetExternalIPAddress(const char* url, const char* service, char* address) {
    if (!arrives(url, service, "external ip")) return UPNPCOMMAND_HTTP_ERROR;
    if (gateway.externalIpStatus == 0) fill(address, INET_ADDRSTRLEN, gateway.externalIp);
    return gateway.externalIpStatus;
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
    const std::string line = std::string("entry ") + proto + " " + port;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    const auto reply =
        gateway.entryLie.value_or(replyFor(gateway.find(std::stoi(port), proto), kNoSuchEntry));
    return fillEntry(reply, client, internalPort, description, enabled, lease);
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
    const std::string line = std::string("map ") + proto + " " + port + " -> " + client + ":" +
                             internalPort + " " + description;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    if (gateway.refuses(std::stoi(port))) return kConflict;
    const auto held = gateway.find(std::stoi(port), proto);
    const auto place = held == gateway.table.end() ? gateway.table.emplace(held) : held;
    *place = {std::stoi(port), client, std::stoi(internalPort), description, proto};
    return 0;
}

int __wrap_UPNP_DeletePortMapping(const char* url,
                                  const char* service,
                                  const char* port,
                                  const char* proto,
                                  const char* remoteHost) {
    EXPECT_EQ(remoteHost, nullptr);
    const std::string line = std::string("unmap ") + proto + " " + port;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    if (gateway.keepMappings) return kActionFailed;
    const auto held = gateway.find(std::stoi(port), proto);
    if (held == gateway.table.end()) return kNoSuchEntry;
    gateway.table.erase(held);
    return 0;
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
    if (!arrives(url, service, std::string("entry #") + index)) return UPNPCOMMAND_HTTP_ERROR;
    const auto at = std::min(std::stol(index), static_cast<long>(gateway.table.size()));
    const auto reply =
        gateway.tableLie.value_or(replyFor(gateway.table.begin() + at, kNoSuchIndex));
    if (reply.status == 0) {
        fill(port, 6, reply.externalPort);
        fill(proto, 4, reply.protocol);
        fill(remoteHost, 64, "");
    }
    return fillEntry(reply, client, internalPort, description, enabled, lease);
}

int __wrap_initnatpmp(natpmp_t* client, int forced, in_addr_t forcedAddress) {
    EXPECT_EQ(forced, 0);
    EXPECT_EQ(forcedAddress, 0U);
    gateway.note("natpmp open");
    ++gateway.clients;
    *client = {};
    client->s = clientSocket;
    fcntl(clientSocket, F_SETFD, 0);  // as the library's socket comes
    // The library keeps the socket of a failed start.
    return gateway.failure(FakeGateway::Natpmp::OPEN);
}

int __wrap_closenatpmp(natpmp_t* /*client*/) {
    gateway.note("natpmp close");
    EXPECT_GT(gateway.clients--, 0) << "a NAT-PMP client that was not opened";
    return gateway.failure(FakeGateway::Natpmp::CLOSE);
}

int __wrap_sendpublicaddressrequest(natpmp_t* client) {
    gateway.note("natpmp address");
    return ask(client, FakeGateway::Natpmp::SEND_ADDRESS, {});
}

int __wrap_sendnewportmappingrequest(natpmp_t* client,
                                     int protocol,
                                     std::uint16_t privatePort,
                                     std::uint16_t publicPort,
                                     std::uint32_t lifetime) {
    gateway.note("natpmp map " + protocolName(protocol) + " " + std::to_string(publicPort) +
                 " -> " + std::to_string(privatePort) + " for " + std::to_string(lifetime) + " s");
    return ask(client, FakeGateway::Natpmp::SEND_MAPPING,
               {protocol, privatePort, publicPort, lifetime});
}

int __wrap_getnatpmprequesttimeout(natpmp_t* client, timeval* timeout) {
    if (const int status = gateway.failure(FakeGateway::Natpmp::TIMEOUT)) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    *timeout = {0, std::max(0L, gateway.retryTime - gateway.natpmpTime) * kMicrosPerMilli};
    return 0;
}

int __wrap_readnatpmpresponseorretry(natpmp_t* client, natpmpresp_t* response) {
    if (const int status = gateway.failure(FakeGateway::Natpmp::READ)) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    FakeGateway::Datagram told;
    if (recv(clientSocket, &told, sizeof told, MSG_DONTWAIT) > 0) {
        if (told.status != 0) return told.status;  // the request stays pending
        *response = told.response;
        client->has_pending_request = 0;
        return 0;
    }
    if (std::exchange(gateway.connectionRefused, false)) {
        errno = ECONNREFUSED;
        return NATPMP_ERR_NOGATEWAYSUPPORT;
    }
    if (gateway.natpmpTime >= gateway.retryTime) transmit(client);
    errno = EAGAIN;
    return NATPMP_TRYAGAIN;
}

int __wrap_select(int count, fd_set* readable, fd_set* writable, fd_set* broken, timeval* timeout) {
    EXPECT_EQ(count, FD_SETSIZE);
    EXPECT_TRUE(FD_ISSET(clientSocket, readable));
    EXPECT_EQ(writable, nullptr);
    EXPECT_EQ(broken, nullptr);
    EXPECT_NE(fcntl(clientSocket, F_GETFD) & FD_CLOEXEC, 0) << "inherited by child processes";
    const long limit = timeout->tv_usec / kMicrosPerMilli;
    gateway.note("natpmp wait " + std::to_string(limit) + " ms");
    if (gateway.connectionRefused || isUnread()) return 1;
    auto& onTheWay = gateway.onTheWay;
    const long next = onTheWay.empty() ? LONG_MAX : onTheWay.begin()->first;
    gateway.natpmpTime = std::max(gateway.natpmpTime, std::min(next, gateway.natpmpTime + limit));
    for (; !onTheWay.empty() && onTheWay.begin()->first <= gateway.natpmpTime;
         onTheWay.erase(onTheWay.begin())) {
        const FakeGateway::Datagram& told = onTheWay.begin()->second;
        EXPECT_GT(send(gatewaySocket, &told, sizeof told, 0), 0);
    }
    return isUnread() ? 1 : 0;
}
// NOLINTEND(bugprone-reserved-identifier, readability-function-size)
