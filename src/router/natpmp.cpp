#include "router/natpmp.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/select.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <optional>

#include "common/log.h"
#include "common/stop_budget.h"

namespace pelorus {

namespace {

constexpr int kMaxReads = 3;
constexpr time_t kLongestWait = 1;  // seconds; the library's own last one
constexpr int kSelectDescriptors = FD_SETSIZE;
constexpr ssize_t kRefusalSize = 8;
constexpr ssize_t kAddressAnswerSize = 12;
constexpr ssize_t kMappingAnswerSize = 16;

// The protocol's number for "TCP" or "UDP", 0 for anything else.
int protocolNumber(const std::string& protocol) {
    if (protocol == "TCP") return NATPMP_PROTOCOL_TCP;
    if (protocol == "UDP") return NATPMP_PROTOCOL_UDP;
    return 0;
}

// The client's socket outlives many child processes; openvpn runs for weeks. None may inherit it.
void closeOnExec(int socket) {
    const int flags = fcntl(socket, F_GETFD);
    if (flags >= 0) static_cast<void>(fcntl(socket, F_SETFD, flags | FD_CLOEXEC));
}

// Opens @p client for @p gateway, or for the default gateway if that is 0. The library's status.
int openClient(natpmp_t& client, in_addr_t gateway) {
    const int status = initnatpmp(&client, gateway != 0 ? 1 : 0, gateway);
    if (status == 0) {
        closeOnExec(client.s);
    } else if (client.s > 0) {
        // The library opens its socket first and keeps it when it then finds no gateway.
        static_cast<void>(closenatpmp(&client));
    }
    return status;
}

void waitForAnswer(int socket, timeval timeout) {
    fd_set readable;
    FD_ZERO(&readable);
    if (socket >= 0 && socket < kSelectDescriptors) FD_SET(socket, &readable);
    // Whatever ends the wait, the read that follows finds out.
    static_cast<void>(select(kSelectDescriptors, &readable, nullptr, nullptr, &timeout));
}

// 0 when the library may read from the socket of @p client, else the status in its place. The
// library does not look at the length of an answer: what a short one lacks would be whatever the
// stack held before. Such an answer fails with EBADMSG. A failure of the socket is reported only
// once, here.
int peekAnswer(const natpmp_t& client) {
    std::array<char, kMappingAnswerSize> answer{};
    const ssize_t size = recv(client.s, answer.data(), answer.size(), MSG_PEEK | MSG_DONTWAIT);
    if (size < 0) {
        if (errno == EAGAIN) return 0;
        return errno == ECONNREFUSED ? NATPMP_ERR_NOGATEWAYSUPPORT : NATPMP_ERR_RECVFROM;
    }
    const bool isMapping = client.pending_request[1] != 0;
    const bool isRefusal = size >= kRefusalSize && (answer[2] != 0 || answer[3] != 0);
    if (isRefusal || size >= (isMapping ? kMappingAnswerSize : kAddressAnswerSize)) return 0;
    errno = EBADMSG;
    return NATPMP_ERR_UNDEFINEDERROR;
}

}  // namespace

CMnatpmp::~CMnatpmp() {
    close();
}

bool CMnatpmp::init() {
    return initialized || open(0);
}

bool CMnatpmp::open(in_addr_t gateway) {
    natpmp = {};
    const int status = openClient(natpmp, gateway);
    initialized = status == 0;
    if (!initialized) logError("CMnatpmp::init  initnatpmp failed %d\n", status);
    return initialized;
}

// The library takes whatever the gateway sends for the answer to its last request. It repeats a
// request that is not answered at once, so a slow gateway answers it more than once, and the network
// may duplicate an answer. Late answers go to the port the request came from, so each request gets
// a socket of its own. The library's try_number counts how often its last request was sent.
bool CMnatpmp::openForRequest() {
    if (!initialized || natpmp.try_number == 0) return init();
    const in_addr_t gateway = natpmp.gateway;
    natpmp_t fresh{};
    // Open the new socket before closing the old one, so that the ports differ.
    const bool isOpen = openClient(fresh, gateway) == 0;
    close();
    if (!isOpen) return open(gateway);  // where descriptors are short, there is one more now
    natpmp = fresh;
    initialized = true;
    return true;
}

bool CMnatpmp::close() {
    if (initialized) {
        const int status = closenatpmp(&natpmp);
        if (status < 0) logError("CMnatpmp::close  closenatpmp failed %d\n", status);
        initialized = false;
    }
    return true;
}

int CMnatpmp::CheckNATPMPResponse() {
    const auto began = std::chrono::steady_clock::now();
    const int status = readResponse();
    const int error = errno;
    spendStopBudget(std::chrono::steady_clock::now() - began);
    errno = error;
    return status;
}

int CMnatpmp::readResponse() {
    int status = NATPMP_TRYAGAIN;
    for (int reads = 0; status == NATPMP_TRYAGAIN && reads < kMaxReads; ++reads) {
        timeval timeout{};
        status = getnatpmprequesttimeout(&natpmp, &timeout);
        if (status < 0) {
            const int error = errno;
            logError("CMnatpmp::CheckNATPMPResponse  getnatpmprequesttimeout error %d\n", status);
            errno = error;
            return status;
        }
        // The library reckons with a clock that may have been set back meanwhile.
        if (timeout.tv_sec >= kLongestWait) timeout = {kLongestWait, 0};
        waitForAnswer(natpmp.s, timeout);
        status = peekAnswer(natpmp);
        if (status == 0) status = readnatpmpresponseorretry(&natpmp, &response);
    }
    return status;
}

bool CMnatpmp::retrieveExternalIP(std::string& ip) {
    if (!openForRequest()) {
        logError("CMnatpmp::retrieveExternalIP  libnatpmp was not previously initialized.\n");
        return false;
    }
    const int sent = sendpublicaddressrequest(&natpmp);
    if (sent < 0) {
        const int error = errno;
        logError("CMnatpmp::retrieveExternalIP  sendpublicaddressrequest error %d, errno %d\n",
                 sent, error);
        return false;
    }
    if (CheckNATPMPResponse() < 0) {
        const int error = errno;
        externalIp.clear();
        ip.clear();
        logInfo("CMnatpmp::retrieveExternalIP  failed to fetched external IP address, errno %d\n",
                error);
        return false;
    }
    std::array<char, INET_ADDRSTRLEN> text{};
    static_cast<void>(
        inet_ntop(AF_INET, &response.pnu.publicaddress.addr, text.data(), text.size()));
    externalIp = text.data();
    ip = externalIp;
    logInfo("CMnatpmp::retrieveExternalIP  fetched external IP address %s\n", externalIp.c_str());
    return true;
}

bool CMnatpmp::portMappingRequest(int internalPort,
                                  int& externalPort,
                                  const std::string& protocol,
                                  const std::string& /*description*/,
                                  bool isHttps,
                                  unsigned& lifetime) {
    if (!openForRequest()) {
        logError("CMnatpmp::portMappingRequest  libnatpmp was not previously initialized.\n");
        return false;
    }
    if (protocolNumber(protocol) == 0) {
        logError("CMnatpmp::portMappingRequest  invalid protocol string %s\n", protocol.c_str());
        return false;
    }
    const auto granted =
        exchangeMapping(protocolNumber(protocol), internalPort, externalPort, lifetime);
    if (!granted) return false;
    externalPort = granted->externalPort;
    lifetime = granted->lifetime;
    if (lifetime != 0) {
        trackMapping(internalPort, externalPort, isHttps, lifetime);
    } else if (internalPort != 0) {
        forgetMapping(internalPort);
    } else {
        forgetAllMappings(internalPort, externalPort, lifetime);
    }
    return true;
}

// What the gateway granted wins over what was asked.
std::optional<CMnatpmp::Grant> CMnatpmp::exchangeMapping(int protocol,
                                                         int internalPort,
                                                         int externalPort,
                                                         unsigned lifetime) {
    const int sent =
        sendnewportmappingrequest(&natpmp, protocol, static_cast<std::uint16_t>(internalPort),
                                  static_cast<std::uint16_t>(externalPort), lifetime);
    if (sent < 0) {
        const int error = errno;
        logError(
            "CMnatpmp::portMappingRequest  sendnewportmappingrequest error %d, protocol %d, internalPort %d, externalPort %d, lifetime %u, errno %d\n",
            sent, protocol, internalPort, externalPort, lifetime, error);
        return std::nullopt;
    }
    if (CheckNATPMPResponse() < 0) {
        const int error = errno;
        logError(
            "CMnatpmp::portMappingRequest  failed to map public port %d to localport %d, protocol %d, lifetime %u, errno %d\n",
            externalPort, internalPort, protocol, lifetime, error);
        return std::nullopt;
    }
    const auto& granted = response.pnu.newportmapping;
    // The protocol in this line is the answer's type; the two have the same numbers.
    logInfo(
        "CMnatpmp::portMappingRequest  mapped public port %hu to localport %hu protocol %d, lifetime %u\n",
        granted.mappedpublicport, granted.privateport, static_cast<int>(response.type),
        granted.lifetime);
    const Grant result{granted.mappedpublicport, granted.lifetime};
    if (granted.privateport != internalPort) {
        logInfo(
            "CMnatpmp::portMappingRequest  requested internal port does not match the response internal port. req_internal_port %d, resp_internal_port %hu, external_port %d, lifetime %u\n",
            internalPort, granted.privateport, result.externalPort, result.lifetime);
    }
    return result;
}

void CMnatpmp::trackMapping(int internalPort, int externalPort, bool isHttps, unsigned lifetime) {
    const char* const label = isHttps ? "HTTPS" : "HTTP";
    const TrackedMapping tracked = gwPorts.track(isHttps, internalPort, externalPort, lifetime);
    logInfo(
        "CMnatpmp::portMappingRequest  set %s PMTracker params. internal_port %d, external_port %d, lifetime %u\n",
        label, internalPort, externalPort, lifetime);
    logInfo(
        "CMnatpmp::portMappingRequest - get after setting %s PMTracker params.   internalPort[%d], mappedExternalPort[%d], lifetime[%u]\n",
        label, tracked.internalPort, tracked.externalPort, tracked.lifetime);
}

void CMnatpmp::forgetMapping(int internalPort) {
    const auto [service, mapping] = gwPorts.forget(internalPort);
    switch (service) {
        case GWPortsTracker::Service::HTTP:
            logInfo(
                "CMnatpmp::portMappingRequest  destroyed HTTP port mapping. internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, mapping.externalPort, mapping.lifetime);
            break;
        case GWPortsTracker::Service::HTTPS:
            logInfo(
                "CMnatpmp::portMappingRequest  destroyed HTTPS port mapping. internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, mapping.externalPort, mapping.lifetime);
            break;
        case GWPortsTracker::Service::NONE:
            logInfo(
                "CMnatpmp::portMappingRequest  internal ports mismatch when destroying port mapping. tracked_internal_port %d, req_internal_port %d, external_port %d, lifetime %u\n",
                mapping.internalPort, internalPort, mapping.externalPort, mapping.lifetime);
            break;
    }
}

void CMnatpmp::forgetAllMappings(int internalPort, int externalPort, unsigned lifetime) {
    gwPorts.forgetAll();
    logInfo(
        "CMnatpmp::portMappingRequest  destroyed all mappings. internal_port %d, external_port %d, lifetime %u\n",
        internalPort, externalPort, lifetime);
}

bool CMnatpmp::mapPort(int internalPort,
                       int& externalPort,
                       const std::string& protocol,
                       const std::string& description,
                       bool isHttps) {
    unsigned lifetime = getReqPortMappingLifetime();
    return portMappingRequest(internalPort, externalPort, protocol, description, isHttps, lifetime);
}

bool CMnatpmp::unmapPort(int internalPort, int /*externalPort*/, const std::string& protocol) {
    int anyPort = 0;
    unsigned lifetime = 0;
    return portMappingRequest(internalPort, anyPort, protocol, "", true, lifetime);
}

bool CMnatpmp::unmapAllPorts(const std::string& protocol, const std::string& description) {
    int anyPort = 0;
    unsigned lifetime = 0;
    return portMappingRequest(0, anyPort, protocol, description, true, lifetime);
}

void CMnatpmp::renewPortMapping(const char* which) {
    const bool isHttps = std::strcmp(which, "HTTPS") == 0;
    std::optional<TrackedMapping> due = gwPorts.due(isHttps);
    if (!due) return;
    logInfo("CMnatpmp::renewPortMapping - pastHalfway() returned TRUE\n");
    const bool renewed = mapPort(due->internalPort, due->externalPort, "TCP", "", isHttps);
    const std::int64_t now = std::time(nullptr);
    logInfo(
        "CMnatpmp::renewPortMapping - Renew NAT-PMP port mapping PORTFORWARDED %s: mapPort returncode[%d], internalPort[%d], new externalPort[%d], now[%jd], previous start[%jd], previous lifetime[%jd], new lifetime[%u].\n",
        which, static_cast<int>(renewed), due->internalPort, due->externalPort, now,
        due->interval.GetIntervalStartTime(), due->interval.GetIntervalDuration(),
        getReqPortMappingLifetime());
}

void CMnatpmp::CheckExpiredMappings() {
    renewPortMapping("HTTP");
    renewPortMapping("HTTPS");
}

}  // namespace pelorus
