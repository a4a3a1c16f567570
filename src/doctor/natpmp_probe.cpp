#include <arpa/inet.h>
#include <natpmp.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>

#include "doctor/gateway_probe.h"
#include "doctor/interfaces.h"

namespace pelorus::doctor {

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::chrono::seconds kPatience{4};
constexpr ssize_t kRefusalSize = 8;
constexpr ssize_t kAnswerSize = 12;

// The library does not look at the length of an answer.
bool hasWholeAnswer(int socket) {
    std::array<unsigned char, 16> answer{};
    const ssize_t size = recv(socket, answer.data(), answer.size(), MSG_PEEK | MSG_DONTWAIT);
    if (size < 0) return true;  // the library finds out why
    const bool refused = answer[2] != 0 || answer[3] != 0;
    return size >= (refused ? kRefusalSize : kAnswerSize);
}

// The library's status: 0 with @p response, or an error.
int askForAddress(natpmp_t& client, natpmpresp_t& response) {
    const Clock::time_point end = Clock::now() + kPatience;
    int status = sendpublicaddressrequest(&client);
    if (status < 0) return status;
    do {
        timeval pause{};
        status = getnatpmprequesttimeout(&client, &pause);
        if (status < 0) return status;
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (left <= 0) return NATPMP_TRYAGAIN;
        const auto wanted = decltype(left){pause.tv_sec} * 1000 + pause.tv_usec / 1000 + 1;
        pollfd waited{client.s, POLLIN, 0};
        static_cast<void>(poll(&waited, 1, static_cast<int>(std::min(wanted, left))));
        if (!hasWholeAnswer(client.s)) return NATPMP_ERR_UNDEFINEDERROR;
        status = readnatpmpresponseorretry(&client, &response);
    } while (status == NATPMP_TRYAGAIN);
    return status;
}

std::string textOf(in_addr address) {
    std::array<char, INET_ADDRSTRLEN> text{};
    static_cast<void>(inet_ntop(AF_INET, &address, text.data(), text.size()));
    return text.data();
}

// It speaks the protocol, but opens no ports.
bool isRefusal(int status) {
    return status == NATPMP_ERR_NOTAUTHORIZED || status == NATPMP_ERR_OUTOFRESOURCES;
}

}  // namespace

void askThroughNatpmp(Findings& findings) {
    const auto route = defaultRoute();
    in_addr gateway{};
    if (!route || inet_pton(AF_INET, route->gateway.c_str(), &gateway) != 1) {
        findings.set("silent", "no default route");
        return;
    }
    natpmp_t client{};
    int status = initnatpmp(&client, 1, gateway.s_addr);
    natpmpresp_t response{};
    if (status == 0) status = askForAddress(client, response);
    if (status == 0 && response.type == NATPMP_RESPTYPE_PUBLICADDRESS) {
        findings.set("gateway", route->gateway);
        findings.set("address", textOf(response.pnu.publicaddress.addr));
    } else if (status == NATPMP_ERR_NETWORKFAILURE) {
        findings.set("gateway", route->gateway);
    } else {
        if (isRefusal(status)) findings.set("announced", route->gateway);
        findings.set("silent", std::to_string(status));
    }
}

}  // namespace pelorus::doctor
