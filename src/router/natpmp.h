// NAT-PMP: the gateway protocol used where UPnP does not answer.
#ifndef PELORUS_ROUTER_NATPMP_H
#define PELORUS_ROUTER_NATPMP_H

#include <natpmp.h>

#include <optional>
#include <string>

#include "router/lease_tracking.h"

namespace pelorus {

/// NAT-PMP client for the default gateway. The first request opens it, the destructor closes it. A
/// request blocks for at most three reads of the library's retry schedule (1.75 s). Late answers
/// are dropped; none is taken for the answer to another request. Every failure is logged and
/// returned as false.
class CMnatpmp {
public:
    CMnatpmp() = default;
    ~CMnatpmp();
    CMnatpmp(const CMnatpmp&) = delete;
    CMnatpmp& operator=(const CMnatpmp&) = delete;

    /// Opens the client. True when it is open, now or already.
    bool init();
    /// Closes the client; always true.
    bool close();

    /// Waits for one answer. The library's status: 0 or more when an answer was read, negative on
    /// an error, NATPMP_TRYAGAIN when nothing came. The time counts as that of a gateway's call
    /// (see stop_budget.h).
    int CheckNATPMPResponse();

    /// Asks for the gateway's external address. On failure @p ip is emptied, unless the request
    /// could not even be sent.
    bool retrieveExternalIP(std::string& ip);

    /// The one request for mapping (@p lifetime > 0 seconds), removal (lifetime 0) and removal of
    /// all mappings (lifetime 0, @p internalPort 0).
    ///
    /// @p protocol is "TCP" or "UDP"; @p description is not sent, the protocol has none. What the
    /// gateway granted is returned in @p externalPort and @p lifetime and may differ from what was
    /// asked; a lifetime of 0 granted to a mapping counts as its removal. True when the gateway
    /// granted it. @p isHttps chooses the tracker of a new mapping.
    bool portMappingRequest(int internalPort,
                            int& externalPort,
                            const std::string& protocol,
                            const std::string& description,
                            bool isHttps,
                            unsigned& lifetime);

    /// Maps with the requested lifetime; @p externalPort is what was granted.
    bool mapPort(int internalPort,
                 int& externalPort,
                 const std::string& protocol,
                 const std::string& description,
                 bool isHttps);
    /// Removes the mapping of @p internalPort. @p externalPort is not looked at: the protocol
    /// removes by internal port.
    bool unmapPort(int internalPort, int externalPort, const std::string& protocol);
    /// Removes every mapping of this device for @p protocol.
    bool unmapAllPorts(const std::string& protocol, const std::string& description);

    /// Renews the mapping of @p which ("HTTP" or "HTTPS") when half of its lease has passed.
    void renewPortMapping(const char* which);
    /// Renews both mappings as they fall due.
    void CheckExpiredMappings();

    /// Lease asked for, seconds.
    [[nodiscard]] unsigned getReqPortMappingLifetime() const { return gwPorts.reqLifetime; }
    void setReqPortMappingLifetime(unsigned seconds) { gwPorts.reqLifetime = seconds; }

private:
    struct Grant {
        int externalPort;
        unsigned lifetime;
    };

    bool open(in_addr_t gateway);
    bool openForRequest();
    int readResponse();
    std::optional<Grant> exchangeMapping(int protocol,
                                         int internalPort,
                                         int externalPort,
                                         unsigned lifetime);
    void trackMapping(int internalPort, int externalPort, bool isHttps, unsigned lifetime);
    void forgetMapping(int internalPort);
    void forgetAllMappings(int internalPort, int externalPort, unsigned lifetime);

    bool initialized = false;
    std::string externalIp;
    natpmp_t natpmp{};
    natpmpresp_t response{};
    GWPortsTracker gwPorts;
};

}  // namespace pelorus

#endif
