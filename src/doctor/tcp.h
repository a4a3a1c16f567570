// A TCP connection with a limit of time.
#ifndef PELORUS_DOCTOR_TCP_H
#define PELORUS_DOCTOR_TCP_H

#include <chrono>
#include <string>

namespace pelorus::doctor {

/// Connects to a host, and closes the connection at the end of the scope.
class TcpConnection {
public:
    /// @p host is a name or an address; its addresses are tried in turn, each for at most @p limit.
    TcpConnection(const std::string& host, int port, std::chrono::milliseconds limit);
    ~TcpConnection();
    TcpConnection(const TcpConnection&) = delete;
    TcpConnection& operator=(const TcpConnection&) = delete;

    [[nodiscard]] bool connected() const { return socket >= 0; }
    /// Why there is no connection, in a few words.
    [[nodiscard]] const std::string& obstacle() const { return reason; }
    /// Sends @p request; true when at least one byte comes back within @p limit.
    [[nodiscard]] bool answers(const std::string& request, std::chrono::milliseconds limit) const;

private:
    int socket = -1;
    std::string reason;
};

}  // namespace pelorus::doctor

#endif
