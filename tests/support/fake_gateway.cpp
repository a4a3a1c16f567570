#include "support/fake_gateway.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <miniupnpc/upnpcommands.h>
#include <sys/select.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace pelorus::support {

using Mapping = FakeGateway::Mapping;

namespace {

constexpr const char* kControlUrl = "http://192.168.77.1:5000/ctl/IPConn";
constexpr const char* kServiceType = "urn:schemas-upnp-org:service:WANIPConnection:1";

// Stands for the socket of every NAT-PMP client, and is its own peer: only datagrams come out of it.
// Open before any test begins, since clients may outlive the test that made them.
const int clientSocket = [] {
    sockaddr_in address{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t size = sizeof address;
    auto* const plain = reinterpret_cast<sockaddr*>(&address);
    const int loop = socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    const bool isOpen = bind(loop, plain, size) == 0 && getsockname(loop, plain, &size) == 0 &&
                        connect(loop, plain, size) == 0;
    return isOpen ? loop : -1;
}();
int openClients = 0;

FakeGateway& gateway = FakeGateway::get();  // NOLINT(cert-err58-cpp): as above

int failure(const std::string& call) {
    if (gateway.failing.count(call) == 0) return 0;
    errno = EIO;
    return -9;
}

bool refuses(int port) {
    return gateway.refuseAll || gateway.refused.count(port) != 0;
}

auto find(int port, const std::string& protocol) {
    return std::find_if(gateway.table.begin(), gateway.table.end(), [&](const Mapping& mapping) {
        return mapping.externalPort == port && mapping.protocol == protocol;
    });
}

bool hasArrived() {
    return !gateway.onTheWay.empty() && gateway.onTheWay.begin()->first <= gateway.natpmpTime;
}

void fill(char* buffer, std::size_t size, const std::string& text) {
    std::strncpy(buffer, text.c_str(), size);
}

// Notes a question to the control URL; true when it arrives.
bool arrives(const char* url, const char* service, const std::string& line) {
    expectBrokenPipeHeld();
    gateway.note(line);
    return gateway.upnp && std::string(url) == kControlUrl && std::string(service) == kServiceType;
}

FakeGateway::Reply replyFor(const std::vector<Mapping>::iterator& held, int missing) {
    if (gateway.lie) return *gateway.lie;
    if (held == gateway.table.end()) return {missing};
    const std::string externalPort = std::to_string(held->externalPort);
    const std::string internalPort = std::to_string(held->internalPort);
    return {0, held->client, internalPort, held->description, externalPort, held->protocol};
}

// Makes or removes the mapping of an internal port; a refusal has a result code.
natpmpresp_t map(int type, int privatePort, int publicPort, unsigned lifetime) {
    natpmpresp_t answer{};
    answer.type = static_cast<std::uint16_t>(type);
    answer.resultcode = lifetime != 0 && refuses(publicPort) ? 2 : 0;  // not authorized
    if (answer.resultcode != 0) return answer;
    const auto& granted = gateway.granted;
    auto& mapping = answer.pnu.newportmapping;
    mapping.privateport = static_cast<std::uint16_t>(granted.privatePort.value_or(privatePort));
    mapping.mappedpublicport = static_cast<std::uint16_t>(granted.publicPort.value_or(publicPort));
    mapping.lifetime = granted.lifetime.value_or(lifetime);
    auto& table = gateway.table;
    const auto isOld = [&](const Mapping& held) {
        return held.client == kDeviceAddress &&
               (privatePort == 0 || held.internalPort == privatePort);
    };
    table.erase(std::remove_if(table.begin(), table.end(), isOld), table.end());
    if (lifetime != 0) table.push_back({mapping.mappedpublicport, kDeviceAddress, privatePort});
    return answer;
}

// Sends the pending request, for the first time or again.
void transmit(natpmp_t* client) {
    gateway.retryTime = gateway.natpmpTime + (250L << client->try_number);
    ++client->try_number;
    gateway.connectionRefused = !gateway.natpmp;
    if (!gateway.natpmp || gateway.silent) return;
    for (int copy = 0; copy < gateway.copies; ++copy) {
        gateway.onTheWay.emplace(gateway.natpmpTime + gateway.answerDelay, gateway.pending);
    }
}

int ask(natpmp_t* client, const std::string& call, const natpmpresp_t& answer) {
    if (const int status = failure(call)) return status;
    gateway.pending = answer;
    client->has_pending_request = 1;
    client->pending_request[1] = static_cast<unsigned char>(answer.type);
    client->try_number = 0;
    transmit(client);
    return 0;
}

// NOLINTBEGIN(bugprone-reserved-identifier, readability-function-size): names the linker gives
// Long argument lists, which changed with the versions of miniupnpc.
// clang-format off
int hand(const FakeGateway::Reply& reply, char* client, char* internalPort, char* description,
         char* enabled, char* lease) {
    fill(client, 16, reply.client);
    fill(internalPort, 6, reply.internalPort);
    fill(description, 80, reply.description);
    fill(enabled, 4, reply.enabled);
    fill(lease, 16, reply.lease);
    return reply.status;
}

}  // namespace

extern "C" {
UPNPDev* __wrap_upnpDiscover(int delay, const char*, const char*, int, int,
#if MINIUPNPC_API_VERSION >= 14
                             unsigned char,
#endif
                             int* error) {
    *error = 0;
    expectBrokenPipeHeld();
    gateway.note("discover " + std::to_string(delay) + " ms");
    auto& listed = gateway.listed;
    if (gateway.upnp) listed.resize(gateway.devices.size());
    for (std::size_t at = 0; at < listed.size(); ++at) {
        listed[at].pNext = at + 1 < listed.size() ? &listed[at + 1] : nullptr;
        listed[at].descURL = gateway.devices[at].first.data();
        listed[at].st = gateway.devices[at].second.data();
    }
    return listed.empty() ? nullptr : listed.data();
}

void __wrap_freeUPNPDevlist(UPNPDev* list) {
    EXPECT_EQ(list, gateway.listed.data()) << "a device list that was not handed out";
    gateway.listed.clear();
}

int __wrap_UPNP_GetValidIGD(UPNPDev* list, UPNPUrls* urls, IGDdatas* data,
                            char* lanAddress, int size
#if MINIUPNPC_API_VERSION >= 18
                            , char*, int
#endif
) {
    expectBrokenPipeHeld();
    EXPECT_FALSE(gateway.listed.empty()) << "texts of a list that was released";
    std::string line = "igd";
    for (; list != nullptr; list = list->pNext) line.append(" ").append(list->descURL);
    gateway.note(line);
    if (gateway.igdState == 0) return 0;
    ++gateway.urlSets;
    urls->controlURL = strdup(kControlUrl);
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

int __wrap_UPNP_GetSpecificPortMappingEntry(const char* url, const char* service, const char* port,
                                            const char* protocol,
#if MINIUPNPC_API_VERSION >= 10
                                            const char* /*remoteHost*/,
#endif
                                            char* client, char* internalPort, char* description,
                                            char* enabled, char* lease) {
    const std::string line = std::string("entry ") + protocol + " " + port;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    const auto reply = replyFor(find(std::stoi(port), protocol), 714);
    return hand(reply, client, internalPort, description, enabled, lease);
}

int __wrap_UPNP_AddPortMapping(const char* url, const char* service, const char* port,
                               const char* internalPort, const char* client,
                               const char* description, const char* protocol,
                               const char* remoteHost, const char* lease) {
    EXPECT_TRUE(remoteHost == nullptr && lease == nullptr);
    const std::string line = std::string("map ") + protocol + " " + port + " -> " + client + ":" +
                             internalPort + " " + description;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    if (refuses(std::stoi(port))) return 718;  // conflict
    const auto held = find(std::stoi(port), protocol);
    const auto place = held == gateway.table.end() ? gateway.table.emplace(held) : held;
    *place = {std::stoi(port), client, std::stoi(internalPort), description, protocol};
    return 0;
}

int __wrap_UPNP_DeletePortMapping(const char* url, const char* service, const char* port,
                                  const char* protocol, const char* remoteHost) {
    EXPECT_EQ(remoteHost, nullptr);
    const std::string line = std::string("unmap ") + protocol + " " + port;
    if (!arrives(url, service, line)) return UPNPCOMMAND_HTTP_ERROR;
    const auto held = find(std::stoi(port), protocol);
    if (held == gateway.table.end()) return 714;  // no such entry
    gateway.table.erase(held);
    return 0;
}

int __wrap_UPNP_GetGenericPortMappingEntry(const char* url, const char* service, const char* index,
                                           char* port, char* client, char* internalPort,
                                           char* protocol, char* description, char* enabled,
                                           char* remoteHost, char* lease) {
    if (!arrives(url, service, std::string("entry #") + index)) return UPNPCOMMAND_HTTP_ERROR;
    const auto at = std::min(std::stol(index), static_cast<long>(gateway.table.size()));
    const auto reply = replyFor(gateway.table.begin() + at, 713);
    fill(port, 6, reply.externalPort);
    fill(protocol, 4, reply.protocol);
    fill(remoteHost, 64, "");
    return hand(reply, client, internalPort, description, enabled, lease);
}

int __wrap_initnatpmp(natpmp_t* client, int forced, in_addr_t forcedAddress) {
    const in_addr_t found = inet_addr("192.168.77.1");
    EXPECT_EQ(forcedAddress, forced == 0 ? 0 : found) << "another gateway";
    gateway.note(forced == 0 ? "natpmp open" : "natpmp open at the same gateway");
    *client = {};
    client->gateway = found;
    client->s = clientSocket;
    ++openClients;
    const int status = failure("open");  // the library keeps its socket
    if (status == 0) fcntl(clientSocket, F_SETFD, 0);
    return status;
}

int __wrap_closenatpmp(natpmp_t* /*client*/) {
    gateway.note("natpmp close");
    gateway.onTheWay.clear();  // late answers find no socket
    while (recv(clientSocket, nullptr, 0, 0) >= 0) {
    }
    EXPECT_GT(openClients--, 0) << "a NAT-PMP client that was not opened";
    return failure("close");
}

int __wrap_sendpublicaddressrequest(natpmp_t* client) {
    gateway.note("natpmp address");
    natpmpresp_t answer{};
    inet_pton(AF_INET, gateway.externalIp.c_str(), &answer.pnu.publicaddress.addr);
    return ask(client, "address", answer);
}

int __wrap_sendnewportmappingrequest(natpmp_t* client, int protocol, std::uint16_t privatePort,
                                     std::uint16_t publicPort, std::uint32_t lifetime) {
    const std::string name = protocol == NATPMP_PROTOCOL_TCP ? "TCP " : "UDP ";
    gateway.note("natpmp map " + name + std::to_string(publicPort) + " -> " +
                 std::to_string(privatePort) + " for " + std::to_string(lifetime) + " s");
    return ask(client, "map", map(protocol, privatePort, publicPort, lifetime));
}

int __wrap_getnatpmprequesttimeout(natpmp_t* client, timeval* timeout) {
    if (const int status = failure("timeout")) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    *timeout = {gateway.clockSetBack,
                std::max(0L, gateway.retryTime - gateway.natpmpTime) * 1000};
    return 0;
}

// Missing where only the library's headers are used: the fake's own answer then stands for what
// arrives.
__attribute__((weak)) int __real_readnatpmpresponseorretry(natpmp_t* client,
                                                           natpmpresp_t* response);

int __wrap_readnatpmpresponseorretry(natpmp_t* client, natpmpresp_t* response) {
    if (const int status = failure("read")) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    if (hasArrived() && gateway.datagram && __real_readnatpmpresponseorretry != nullptr) {
        natpmp_t loop = *client;
        loop.gateway = htonl(INADDR_LOOPBACK);
        const int status = __real_readnatpmpresponseorretry(&loop, response);
        client->has_pending_request = loop.has_pending_request;
        return status;
    }
    if (hasArrived()) {
        const auto answer = gateway.onTheWay.extract(gateway.onTheWay.begin()).mapped();
        if (answer.resultcode != 0) return NATPMP_ERR_NOTAUTHORIZED;  // the request stays pending
        *response = answer;
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
    EXPECT_TRUE(FD_ISSET(clientSocket, readable) && writable == nullptr && broken == nullptr);
    EXPECT_NE(fcntl(clientSocket, F_GETFD) & FD_CLOEXEC, 0) << "inherited by child processes";
    const long limit = timeout->tv_sec * 1000 + timeout->tv_usec / 1000;
    gateway.note("natpmp wait " + std::to_string(limit) + " ms");
    if (gateway.connectionRefused) return 1;
    const long end = gateway.natpmpTime + limit;
    const long next = gateway.onTheWay.empty() ? end : gateway.onTheWay.begin()->first;
    gateway.natpmpTime = std::clamp(next, gateway.natpmpTime, end);
    const auto& datagram = gateway.datagram;
    if (hasArrived() && datagram) send(clientSocket, datagram->data(), datagram->size(), 0);
    return hasArrived() ? 1 : 0;
}
}
// clang-format on
// NOLINTEND(bugprone-reserved-identifier, readability-function-size)

}  // namespace pelorus::support
