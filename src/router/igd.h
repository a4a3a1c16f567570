// A UPnP Internet Gateway Device: the calls of its connection service.
#ifndef PELORUS_ROUTER_IGD_H
#define PELORUS_ROUTER_IGD_H

#include <functional>
#include <string>

namespace pelorus {

/// One mapping as the gateway reports it. Texts are untrusted; each is cut to the size the library
/// documents for it.
struct IgdEntry {
    int status = 0;  ///< the library's, 0 when the gateway reported a mapping
    std::string externalPort;
    std::string internalClient;
    std::string internalPort;
    std::string protocol;
    std::string description;
    std::string enabled;
    std::string lease;
};

/// An external address as the gateway reports it; also untrusted. Empty when it reports none.
struct IgdAddress {
    int status = 0;  ///< the library's
    std::string text;
};

/// The connection service of one gateway. Protocols are "TCP" or "UDP". A status is the library's:
/// 0 for success, negative when the gateway could not be asked, else the gateway's error.
struct Igd {
    std::string controlUrl;
    std::string serviceType;

    /// Asks for the external address.
    [[nodiscard]] IgdAddress externalAddress() const;
    /// Asks for the mapping of @p externalPort. Some texts may be set although the status is an
    /// error. The external port and protocol are not filled in.
    [[nodiscard]] IgdEntry entry(int externalPort, const std::string& protocol) const;
    /// Maps @p externalPort to @p internalPort of @p client, without a lease.
    [[nodiscard]] int add(int externalPort,
                          int internalPort,
                          const std::string& client,
                          const std::string& description,
                          const std::string& protocol) const;
    /// Removes the mapping of @p externalPort.
    [[nodiscard]] int remove(int externalPort, const std::string& protocol) const;
    /// Hands the gateway's mappings one by one to @p visit, which returns false to stop. True when
    /// neither the gateway nor the visitor ended the list: it was cut off after 65536 entries, 60
    /// seconds, or when the stop budget was spent.
    bool forEach(const std::function<bool(const IgdEntry&)>& visit) const;
};

}  // namespace pelorus

#endif
