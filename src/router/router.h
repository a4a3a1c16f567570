// The home gateway, whatever protocol it speaks.
#ifndef PELORUS_ROUTER_ROUTER_H
#define PELORUS_ROUTER_ROUTER_H

#include <memory>
#include <string>
#include <vector>

#include "router/igd.h"
#include "router/lease_tracking.h"
#include "router/natpmp.h"

struct UPNPDev;

namespace pelorus {

/// One line of the mapping list of the maker's own router.
// NOLINTNEXTLINE(bugprone-reserved-identifier): the name the rest of the device uses
struct _BrenvikPortIp {
    std::string owner;      ///< "BRENVIK": made by this daemon, "OTHER": by someone else
    std::string protocol;   ///< "TCP" or "UDP"
    int firstExternal = 0;  ///< first external port of the range
    int lastExternal = 0;   ///< last external port, inclusive; the first when it is a single port
    std::string localIp;    ///< LAN client the ports lead to
    int internalPort = 0;   ///< port on that client
    std::string description;
};

/// Finds the gateway (UPnP IGD first, NAT-PMP second), learns the external and the device's own
/// address, and makes, renews and removes port mappings through the protocol that answered.
///
/// Each owner has its own Router: discovery and lease tracking are not shared. Every failure has
/// been logged when it is returned. Ports are 1 to 65535, protocols "TCP" or "UDP".
///
/// The ...Brenvik operations are for a device that is itself the maker's router: they use its
/// helper scripts and need no discovery.
class Router {
public:
    /// "No lifetime known", seconds.
    static const unsigned INVALID_LEASE_DURATION;

    Router();
    ~Router();
    Router(const Router&) = delete;
    Router& operator=(const Router&) = delete;

    /// A process-wide instance, for users without one of their own.
    static Router* getInstance();

    // --- discovery -------------------------------------------------------------------------

    /// Looks for the gateway again. True when one answered with its external address; until then
    /// the mapping operations fail. On failure the addresses of an earlier discovery are kept.
    /// When the stop budget cuts it short, an earlier gateway is kept, too, and the result is true.
    /// Takes some seconds.
    bool discover();
    /// Chooses the device's LAN address from its interfaces; IPv4 before IPv6, and the address in
    /// use stays as long as an interface has it.
    void initLocalIp();
    /// The two halves of discover().
    bool upnp_discover();
    bool natpmp_discover();

    [[nodiscard]] bool isInitialized() const { return initialized; }
    [[nodiscard]] std::string getExternalIp() const { return externalIp; }
    /// The LAN address; asks the maker's router script when none is known yet.
    [[nodiscard]] std::string getLocalIp();

    /// Whether the last discovery assigned a new address. A change that has been read is
    /// cleared by the next discovery; an unread one is kept.
    [[nodiscard]] bool hasExternalIpChanged();
    [[nodiscard]] bool hasLocalIpChanged();

    /// True when the mappings go through NAT-PMP.
    [[nodiscard]] bool isNatPMPGateway() const { return isNatPMP && pNatpmp != nullptr; }

    /// Requested leases in seconds. No lease is sent to a UPnP gateway; the UPnP one only decides
    /// when a mapping is renewed.
    void getReqPortMappingLifetime(unsigned& upnp, unsigned& natpmp) const;
    void setReqPortMappingLifetime(unsigned upnp, unsigned natpmp);

    // --- port mapping ----------------------------------------------------------------------

    /// Maps @p externalPort to @p internalPort of this device. Both must be above 10. A mapping
    /// of the external port that leads elsewhere makes it fail; one that leads here is refreshed.
    /// A NAT-PMP gateway may grant another port: it is returned in @p externalPort.
    bool mapPort(int internalPort,
                 int& externalPort,
                 const std::string& protocol,
                 const std::string& description,
                 bool isHttps);
    /// Removes one mapping. True when the gateway confirmed it.
    bool unmapPort(int internalPort, int externalPort, const std::string& protocol);
    /// Removes all mappings of this device with @p description (NAT-PMP: all mappings).
    /// Through UPnP the result is false although the mappings are gone; do not depend on it.
    bool unmapAllPorts(const std::string& protocol, const std::string& description);
    /// Renews the mapping of @p which ("HTTP" or "HTTPS") when half of its lease has passed. A
    /// mapping renewed through UPnP loses its description.
    void renewPortMapping(const char* which);
    /// Renews both mappings as they fall due.
    void CheckExpiredMappings();
    /// Whether @p externalPort leads to this device. Also true when it cannot be asked (no
    /// discovery, bad protocol): check isInitialized() first.
    [[nodiscard]] bool isPortMapped(int externalPort, const std::string& protocol);
    /// The internal port of this device that @p externalPort leads to, -1 when there is none, 0
    /// when it cannot be asked. UPnP only.
    [[nodiscard]] int getMappedInternalPort(int externalPort, const std::string& protocol);

    // --- the maker's own router ------------------------------------------------------------

    /// Reads WAN and LAN address from the router's script. 0 when there is no WAN address,
    /// positive otherwise. An empty answer, or one that is no address, does not clear what was
    /// known.
    int initIpAddrBrenvik();
    /// 1 when the port is mapped to this device, newly or already; 0 when someone else holds it,
    /// the port is below 1 or the script could not be run.
    int mapPortBrenvik(int internalPort,
                       int externalPort,
                       const std::string& protocol,
                       const std::string& description);
    /// 1 when the removal was run or there was nothing to do (external port 0), else 0.
    int unmapPortBrenvik(int internalPort, int externalPort, const std::string& protocol);
    /// Removes every mapping that leads to this device, with a second's pause after each.
    void unmapAllPortBrenvik(const std::string& protocol);
    /// The mappings that lead to this device; empty when the list cannot be read.
    [[nodiscard]] std::vector<_BrenvikPortIp> getPortListBrenvik(const std::string& protocol);

private:
    [[nodiscard]] Igd igd() const { return {controlUrl, serviceType}; }
    void forgetSeenChanges();
    void takeLocalIp(const std::string& ipv4, const std::string& ipv6);
    bool useGateway(UPNPDev& gateways);
    bool findExternalIp();
    bool takeExternalIp(const std::string& address);

    std::optional<int> mapThroughNatpmp(int internalPort,
                                        int externalPort,
                                        const std::string& protocol,
                                        const std::string& description,
                                        bool isHttps);
    [[nodiscard]] bool heldByAnother(int internalPort,
                                     int externalPort,
                                     const std::string& protocol) const;
    [[nodiscard]] bool addMapping(int internalPort,
                                  int externalPort,
                                  const std::string& protocol,
                                  const std::string& description) const;
    void trackMapping(int internalPort, int externalPort, bool isHttps);
    void forgetMapping(int internalPort);
    bool removeOwnMappings(const std::string& protocol, const std::string& description);

    void loadPortListBrenvik();

    std::string externalIp;
    std::string localIp;
    std::string controlUrl;
    std::string serviceType;
    std::vector<_BrenvikPortIp> brenvikPorts;
    bool initialized = false;
    bool localIpChanged = false;
    bool localIpChangeSeen = false;
    bool externalIpChanged = false;
    bool externalIpChangeSeen = false;
    std::unique_ptr<CMnatpmp> pNatpmp;
    bool isNatPMP = false;
    GWPortsTracker gwPorts;
};

}  // namespace pelorus

#endif
