// miniupnpc with one set of signatures. The library changed its argument lists over the years;
// every request to a gateway goes through these wrappers, and nothing else looks at the version.
// They also bound what a hostile gateway can make the library do, see BoundedCall.
#ifndef PELORUS_COMMON_MINIUPNPC_API_H
#define PELORUS_COMMON_MINIUPNPC_API_H

#include <miniupnpc/miniupnpc.h>
#include <miniupnpc/miniwget.h>
#include <miniupnpc/upnpcommands.h>
#include <miniupnpc/upnperrors.h>

#include "common/bounded_call.h"

#if !defined(MINIUPNPC_API_VERSION) || MINIUPNPC_API_VERSION < 9
#error "miniupnpc API version 9 or newer is needed"
#endif

namespace pelorus::miniupnpc {

/// Results of getValidIgd. Newer libraries tell more cases apart; they are folded into these.
enum IgdState : int {
    NO_IGD = 0,            ///< nothing usable, the URLs were not filled
    CONNECTED_IGD = 1,     ///< a connected gateway, its external address public or private
    UNCONNECTED_IGD = 2,   ///< a gateway that says it is not connected
    OTHER_UPNP_DEVICE = 3  ///< a UPnP device that is no gateway
};

/// Longest duration of each kind of call, seconds.
inline constexpr int kDiscoveryLimit = 20;
inline constexpr int kDescriptionLimit = 30;
inline constexpr int kRequestLimit = 10;
inline constexpr int kLocalLimit = 30;

/// Calls a library function whose argument list never changed.
template <typename Function, typename... Args>
auto call(Function function, Args... args) {
    const BoundedCall bounds{Peer::GATEWAY, kRequestLimit};
    return function(args...);
}

/// Discovers UPnP devices for @p delay milliseconds. The caller releases the list with
/// freeUPNPDevlist; null when nothing answered.
inline UPNPDev* discover(int delay) {
    const BoundedCall bounds{Peer::GATEWAY, kDiscoveryLimit};
    int error = 0;
#if MINIUPNPC_API_VERSION >= 14
    constexpr unsigned char kTtl = 2;
    return upnpDiscover(delay, nullptr, nullptr, 0, 0, kTtl, &error);
#else
    return upnpDiscover(delay, nullptr, nullptr, 0, 0, &error);
#endif
}

/// Chooses a gateway from @p devices and fills @p urls, @p data and @p lanAddress. Any result but
/// NO_IGD means that the caller releases @p urls with FreeUPNPUrls. Values beyond IgdState are
/// possible with libraries newer than this header.
inline int getValidIgd(
    UPNPDev* devices, UPNPUrls& urls, IGDdatas& data, char* lanAddress, int lanAddressSize) {
    const BoundedCall bounds{Peer::GATEWAY, kDescriptionLimit};
#if MINIUPNPC_API_VERSION >= 18
    char wanAddress[64] = "";
    const int state = UPNP_GetValidIGD(devices, &urls, &data, lanAddress, lanAddressSize,
                                       wanAddress, sizeof wanAddress);
    return state >= 2 && state <= 4 ? state - 1 : state;
#else
    return UPNP_GetValidIGD(devices, &urls, &data, lanAddress, lanAddressSize);
#endif
}

/// Asks the gateway for the mapping of one external port; 0 when there is one.
// NOLINTNEXTLINE(readability-function-size): as many parameters as the library has
inline int getSpecificPortMappingEntry(const char* controlUrl,
                                       const char* serviceType,
                                       const char* externalPort,
                                       const char* protocol,
                                       char* internalClient,
                                       char* internalPort,
                                       char* description,
                                       char* enabled,
                                       char* leaseDuration) {
    const BoundedCall bounds{Peer::GATEWAY, kRequestLimit};
    return UPNP_GetSpecificPortMappingEntry(controlUrl, serviceType, externalPort, protocol,
#if MINIUPNPC_API_VERSION >= 10
                                            nullptr,
#endif
                                            internalClient, internalPort, description, enabled,
                                            leaseDuration);
}

/// Fetches @p url with a plain GET. The caller releases the answer of @p size bytes, which is not
/// terminated, with free; null when there was none.
inline void* wget(const char* url, int& size, unsigned scopeId) {
    const BoundedCall bounds{Peer::ANYBODY, kLocalLimit};
#if MINIUPNPC_API_VERSION >= 16
    return miniwget(url, &size, scopeId, nullptr);
#else
    return miniwget(url, &size, scopeId);
#endif
}

}  // namespace pelorus::miniupnpc

#endif
