#include "support/fake_gateway.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <miniupnpc/upnpcommands.h>
#include <sys/select.h>

#include <cerrno>
#include <cstring>

namespace pelorus::support {

using Mapping = FakeGateway::Mapping;

namespace {

constexpr const char* kControlUrl = "http://192.168.77.1:5000/ctl/IPConn";
constexpr const char* kServiceType = "urn:schemas-upnp-org:service:WANIPConnection:1";

// Stands for the socket of every NAT-PMP client; nothing is sent. Open before any test begins,
// since clients may outlive the test that made them.
const int clientSocket = open("/dev/null", O_RDONLY);
int clientsMade = 0;
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

// The next answer to the client that asked last; answers to clients closed since are lost.
auto nextAnswer() {
    return std::find_if(gateway.onTheWay.begin(), gateway.onTheWay.end(),
                        [](const auto& answer) { return answer.second.client == gateway.asking; });
}

bool hasArrived() {
    return nextAnswer() != gateway.onTheWay.end() && nextAnswer()->first <= gateway.natpmpTime;
}

void checkBrokenPipeBlocked() {
    EXPECT_EQ(blockedSignals().count(SIGPIPE), 1U) << "a closed connection would end the process";
}

void fill(char* buffer, std::size_t size, const std::string& text) {
    std::strncpy(buffer, text.c_str(), size);
}

// Notes a question to the control URL; true when it arrives.
bool arrives(const char* url, const char* service, const std::string& line) {
    checkBrokenPipeBlocked();
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

std::string protocolName(int protocol) {
    return protocol == NATPMP_PROTOCOL_TCP ? "TCP" : "UDP";
}

// Makes or removes a mapping; a refusal has a result code.
natpmpresp_t map(int type, int privatePort, int publicPort, unsigned lifetime) {
    natpmpresp_t answer{};
    answer.type = static_cast<std::uint16_t>(type);
    if (lifetime != 0 && refuses(publicPort)) {
        answer.resultcode = 2;  // not authorized
        return answer;
    }
    const std::string protocol = protocolName(type);
    const auto isOwn = [&](const Mapping& held) {
        return held.client == kDeviceAddress && held.protocol == protocol &&
               (privatePort == 0 || held.internalPort == privatePort);
    };
    auto& table = gateway.table;
    table.erase(std::remove_if(table.begin(), table.end(), isOwn), table.end());
    const auto& granted = gateway.granted;
    publicPort = granted.publicPort.value_or(publicPort);
    if (lifetime != 0) {
        while (find(publicPort, protocol) != table.end()) ++publicPort;
        table.push_back({publicPort, kDeviceAddress, privatePort, "", protocol});
    }
    auto& mapping = answer.pnu.newportmapping;
    mapping.privateport = static_cast<std::uint16_t>(granted.privatePort.value_or(privatePort));
    mapping.mappedpublicport = static_cast<std::uint16_t>(publicPort);
    mapping.lifetime = granted.lifetime.value_or(lifetime);
    return answer;
}

// Sends the pending request, for the first time or again.
void transmit(natpmp_t* client) {
    gateway.retryTime = gateway.natpmpTime + (250L << client->try_number);
    ++client->try_number;
    gateway.connectionRefused = !gateway.natpmp;
    const long arrival = std::max(gateway.natpmpTime + gateway.answerDelay, gateway.hungUntil);
    for (int copy = 0; gateway.pending && copy < gateway.copies; ++copy) {
        gateway.onTheWay.insert({arrival, {gateway.asking, *gateway.pending}});
    }
}

int ask(natpmp_t* client, const std::string& call, const std::function<natpmpresp_t()>& answer) {
    gateway.asking = client->pending_request_len;
    if (const int status = failure(call)) return status;
    gateway.pending.reset();
    if (gateway.natpmp && !gateway.silent) gateway.pending = answer();
    client->has_pending_request = 1;
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
    checkBrokenPipeBlocked();
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
    checkBrokenPipeBlocked();
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
    client->pending_request_len = ++clientsMade;  // not otherwise used here
    ++openClients;
    const int status = failure("open");  // the library keeps its socket
    if (status == 0) fcntl(clientSocket, F_SETFD, 0);
    return status;
}

int __wrap_closenatpmp(natpmp_t* /*client*/) {
    gateway.note("natpmp close");
    EXPECT_GT(openClients--, 0) << "a NAT-PMP client that was not opened";
    return failure("close");
}

int __wrap_sendpublicaddressrequest(natpmp_t* client) {
    gateway.note("natpmp address");
    return ask(client, "address", [] {
        natpmpresp_t answer{};
        inet_pton(AF_INET, gateway.externalIp.c_str(), &answer.pnu.publicaddress.addr);
        return answer;
    });
}

int __wrap_sendnewportmappingrequest(natpmp_t* client,
                                     int protocol,
                                     std::uint16_t privatePort,
                                     std::uint16_t publicPort,
                                     std::uint32_t lifetime) {
    gateway.note("natpmp map " + protocolName(protocol) + " " + std::to_string(publicPort) +
                 " -> " + std::to_string(privatePort) + " for " + std::to_string(lifetime) + " s");
    return ask(client, "map", [&] { return map(protocol, privatePort, publicPort, lifetime); });
}

int __wrap_getnatpmprequesttimeout(natpmp_t* client, timeval* timeout) {
    if (const int status = failure("timeout")) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    *timeout = {0, std::max(0L, gateway.retryTime - gateway.natpmpTime) * 1000};
    return 0;
}

int __wrap_readnatpmpresponseorretry(natpmp_t* client, natpmpresp_t* response) {
    if (const int status = failure("read")) return status;
    if (client->has_pending_request == 0) return NATPMP_ERR_NOPENDINGREQ;
    if (hasArrived()) {
        const natpmpresp_t answer = gateway.onTheWay.extract(nextAnswer()).mapped().answer;
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
    const long limit = timeout->tv_usec / 1000;
    gateway.note("natpmp wait " + std::to_string(limit) + " ms");
    if (gateway.connectionRefused) return 1;
    const auto next = nextAnswer();
    const long end = gateway.natpmpTime + limit;
    gateway.natpmpTime = std::max(
        gateway.natpmpTime, next == gateway.onTheWay.end() ? end : std::min(end, next->first));
    return hasArrived() ? 1 : 0;
}
}
// clang-format on
// NOLINTEND(bugprone-reserved-identifier, readability-function-size)

}  // namespace pelorus::support
