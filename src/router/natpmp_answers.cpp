#include "router/natpmp_answers.h"

#include <sys/select.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>

namespace pelorus {

namespace {

constexpr std::size_t kRememberedRequests = 4;
constexpr int kMostOwed = 16;
constexpr int kMostDropped = 100;

// Two seconds in all. Counted in waits, because the clock may be set during the wait.
constexpr int kWaits = 20;
constexpr suseconds_t kWait = 100'000;  // microseconds

bool isReadable(int socket, suseconds_t wait) {
    if (socket < 0 || socket >= FD_SETSIZE) return false;
    fd_set readable;
    FD_ZERO(&readable);
    FD_SET(socket, &readable);
    timeval timeout{0, wait};
    return select(FD_SETSIZE, &readable, nullptr, nullptr, &timeout) > 0;
}

// Whether the gateway answered, granting or refusing.
bool isFromGateway(int status) {
    return status >= 0 ||
           (status <= NATPMP_ERR_UNDEFINEDERROR && status >= NATPMP_ERR_OUTOFRESOURCES) ||
           status == NATPMP_ERR_UNSUPPORTEDVERSION || status == NATPMP_ERR_UNSUPPORTEDOPCODE;
}

}  // namespace

bool isAnswerTo(const natpmpresp_t& answer, const NatpmpRequest& request) {
    if (answer.type != request.type) return false;
    if (request.type == NATPMP_RESPTYPE_PUBLICADDRESS) return true;
    const auto& mapping = answer.pnu.newportmapping;
    return mapping.privateport == request.privatePort &&
           (mapping.lifetime == 0) == request.isRemoval;
}

void NatpmpAnswers::begin(const natpmp_t& client, const NatpmpRequest& request) {
    if (owed > 0) earlier.push_back(current);
    if (earlier.size() > kRememberedRequests) earlier.erase(earlier.begin());
    current = request;
    const int before = owed;
    for (int waits = 0; gatewayAnswers && owed > 0 && waits < kWaits; ++waits) {
        if (isReadable(client.s, kWait)) drop(client.s);
    }
    // Nothing in two seconds: assume they are lost. isLate() still recognises a straggler.
    if (gatewayAnswers && owed == before) owed = 0;
    for (int more = 0; more < kMostDropped; ++more) {
        if (!drop(client.s)) break;
    }
}

// Discards one datagram or a pending ECONNREFUSED. False when there was neither.
bool NatpmpAnswers::drop(int socket) {
    std::array<char, sizeof(natpmpresp_t)> answer{};
    if (recv(socket, answer.data(), answer.size(), MSG_DONTWAIT) < 0 && errno == EAGAIN) {
        return false;
    }
    countLate();
    return true;
}

// The library's try_number counts what was sent. Its has_pending_request does not tell whether the
// gateway answered: a refusal leaves it set.
void NatpmpAnswers::end(const natpmp_t& client, int status) {
    if (isFromGateway(status)) {
        gatewayAnswers = true;
        owed += client.try_number - 1;
    } else if (status == NATPMP_TRYAGAIN) {
        owed += client.try_number;
    }
    owed = std::min(owed, kMostOwed);
}

bool NatpmpAnswers::isLate(const natpmpresp_t& answer) const {
    return !isAnswerTo(answer, current) &&
           std::any_of(earlier.begin(), earlier.end(),
                       [&](const NatpmpRequest& request) { return isAnswerTo(answer, request); });
}

void NatpmpAnswers::countLate() {
    if (owed > 0 && --owed == 0) earlier.clear();
}

}  // namespace pelorus
