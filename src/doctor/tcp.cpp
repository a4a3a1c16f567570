#include "doctor/tcp.h"

#include <fcntl.h>
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>

#include "common/handles.h"

namespace pelorus::doctor {

namespace {

using std::chrono::milliseconds;

bool becomesReady(int socket, short events, milliseconds limit) {
    pollfd waited{socket, events, 0};
    return poll(&waited, 1, static_cast<int>(limit.count())) == 1;
}

// 0, or the error.
int connectSocket(int socket, const addrinfo& address, milliseconds limit) {
    if (connect(socket, address.ai_addr, address.ai_addrlen) == 0) return 0;
    if (errno != EINPROGRESS) return errno;
    if (!becomesReady(socket, POLLOUT, limit)) return ETIMEDOUT;
    int error = 0;
    socklen_t size = sizeof error;
    return getsockopt(socket, SOL_SOCKET, SO_ERROR, &error, &size) == 0 ? error : errno;
}

std::string wordsFor(int error) {
    if (error == ECONNREFUSED) return "connection refused";
    if (error == ETIMEDOUT) return "no answer";
    return std::strerror(error);
}

}  // namespace

TcpConnection::TcpConnection(const std::string& host, int port, milliseconds limit) {
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* list = nullptr;
    if (getaddrinfo(host.c_str(), std::to_string(port).c_str(), &hints, &list) != 0) {
        reason = "name not found";
        return;
    }
    const std::unique_ptr<addrinfo, Releaser<freeaddrinfo>> owned(list);
    for (const addrinfo* entry = list; entry != nullptr; entry = entry->ai_next) {
        const int opened =
            ::socket(entry->ai_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
        if (opened < 0) continue;
        const int error = connectSocket(opened, *entry, limit);
        if (error == 0) {
            socket = opened;
            return;
        }
        static_cast<void>(close(opened));
        reason = wordsFor(error);
    }
}

TcpConnection::~TcpConnection() {
    if (socket >= 0) static_cast<void>(close(socket));
}

bool TcpConnection::answers(const std::string& request, milliseconds limit) const {
    if (send(socket, request.data(), request.size(), MSG_NOSIGNAL) < 0) return false;
    if (!becomesReady(socket, POLLIN, limit)) return false;
    char first = 0;
    return recv(socket, &first, 1, 0) == 1;
}

}  // namespace pelorus::doctor
