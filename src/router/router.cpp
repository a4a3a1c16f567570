#include "router/router.h"

#include <limits>
#include <new>

#include "common/log.h"

namespace pelorus {

namespace {

constexpr unsigned kUpnpLifetime = 604800;  // seconds, a week

}  // namespace

const unsigned Router::INVALID_LEASE_DURATION = std::numeric_limits<unsigned>::max();

Router::Router() : pNatpmp(std::make_unique<CMnatpmp>()) {
    gwPorts.reqLifetime = kUpnpLifetime;
}

Router::~Router() = default;

Router* Router::getInstance() {
    static Router instance;
    return &instance;
}

std::string Router::getLocalIp() {
    if (localIp.empty()) initIpAddrBrenvik();
    return localIp;
}

bool Router::hasExternalIpChanged() {
    externalIpChangeSeen = true;
    return externalIpChanged;
}

bool Router::hasLocalIpChanged() {
    localIpChangeSeen = true;
    return localIpChanged;
}

void Router::getReqPortMappingLifetime(unsigned& upnp, unsigned& natpmp) const {
    upnp = gwPorts.reqLifetime;
    natpmp = pNatpmp ? pNatpmp->getReqPortMappingLifetime() : INVALID_LEASE_DURATION;
}

void Router::setReqPortMappingLifetime(unsigned upnp, unsigned natpmp) {
    gwPorts.reqLifetime = upnp;
    if (!pNatpmp) {
        pNatpmp.reset(new (std::nothrow) CMnatpmp);
        logNotice("Router::setReqPortMappingLifetime - unexpected pNatpmp is NULL.\n");
    }
    if (!pNatpmp) {
        logNotice("Router::setReqPortMappingLifetime - unexpected pNatpmp is still NULL.\n");
        return;
    }
    pNatpmp->setReqPortMappingLifetime(natpmp);
}

}  // namespace pelorus
