// What follows from the answers of a gateway.
#ifndef PELORUS_DOCTOR_GATEWAY_VERDICT_H
#define PELORUS_DOCTOR_GATEWAY_VERDICT_H

#include <optional>
#include <string>
#include <vector>

#include "doctor/findings.h"

namespace pelorus::doctor {

/// What came of asking the gateway through one protocol.
struct GatewayAnswer {
    enum class State {
        UNKNOWN,  ///< not asked, or not finished in time
        SILENT,
        FOUND,
    };
    State state = State::UNKNOWN;
    std::string gateway;     ///< its own address
    std::string address;     ///< the external address it tells; empty if it tells none
    bool connected = true;   ///< false: it says that it is not
    std::string unanswered;  ///< a device that announces itself or refuses, and cannot be used
};

/// Concludes from both protocols together. @p routed has the addresses of the default route's
/// gateway, the one of the route first; empty if it is not known.
void judgeGateway(GatewayAnswer upnp,
                  const GatewayAnswer& natpmp,
                  const std::vector<std::string>& routed,
                  Findings& findings);

/// Concludes from a gateway of the default route that does not even tell its hardware address,
/// unless it has answered through one of the protocols.
void judgeSilentGateway(const GatewayAnswer& upnp,
                        const GatewayAnswer& natpmp,
                        const std::vector<std::string>& routed,
                        Findings& findings);

/// The external address that the daemon takes from the answers, of whichever class; empty if that is
/// none.
[[nodiscard]] std::string externalAddress(const GatewayAnswer& upnp, const GatewayAnswer& natpmp);

/// One entry of a gateway's table.
struct TableEntry {
    int externalPort{};
    std::string protocol;
    std::string client;
    int internalPort{};
    std::string description;
};

/// A published port, and what the gateway says when it is asked for that one.
struct PublishedPort {
    int externalPort{};
    int internalPort{};  ///< where it should lead
    bool told = false;   ///< the gateway has said which entry there is, or that none is
    std::optional<TableEntry> entry;  ///< nothing: there is none
};

/// A gateway's table, and what it is compared with.
struct GatewayTable {
    std::vector<TableEntry> entries;  ///< as far as it was read
    std::vector<std::string> ownAddresses;
    int internalHttpPort{}, internalHttpsPort{};
    std::vector<PublishedPort> published;
    bool isComplete = true;  ///< the entries were read to the end
};

/// Concludes from a table of mappings.
void judgeTable(const GatewayTable& table, Findings& findings);

}  // namespace pelorus::doctor

#endif
