#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "common/handles.h"
#include "common/log.h"
#include "common/miniupnpc_api.h"
#include "common/stop_budget.h"
#include "common/text.h"
#include "config/scrub.h"
#include "router/gateway_url.h"
#include "router/router.h"

namespace pelorus {

namespace {

constexpr int kDiscoverDelay = 2000;  // milliseconds
constexpr int kMostDevices = 100;     // the answers beyond are neither looked at nor logged
constexpr std::size_t kMostGateways = 8;

using Interfaces = std::unique_ptr<ifaddrs, Releaser<freeifaddrs>>;
using Devices = std::unique_ptr<UPNPDev, Releaser<freeUPNPDevlist>>;
// Releases what a UPNPUrls points at; the struct itself is not owned.
using UrlContents = std::unique_ptr<UPNPUrls, Releaser<FreeUPNPUrls>>;

// A LAN interface in use: not local to this host, no tunnel, no container bridge.
bool leadsToLan(const ifaddrs& entry) {
    constexpr unsigned kUnfit = IFF_LOOPBACK | IFF_POINTOPOINT | IFF_NOARP;
    constexpr unsigned kInUse = IFF_UP | IFF_RUNNING;
    return entry.ifa_addr != nullptr && (entry.ifa_flags & kUnfit) == 0 &&
           (entry.ifa_flags & kInUse) != 0 && !contains(entry.ifa_name, "docker");
}

// Where the address bytes stand in an interface's socket address.
const void* addressBytes(const sockaddr* address) {
    const void* const raw = address;
    if (address->sa_family == AF_INET6) return &static_cast<const sockaddr_in6*>(raw)->sin6_addr;
    return &static_cast<const sockaddr_in*>(raw)->sin_addr;
}

// The address of one interface as text, empty on failure.
std::string addressText(const ifaddrs& entry) {
    const int family = entry.ifa_addr->sa_family;
    const char* const familyName = family == AF_INET6 ? "AF_INET6" : "AF_INET";
    std::array<char, INET6_ADDRSTRLEN> text{};
    const socklen_t capacity = family == AF_INET6 ? INET6_ADDRSTRLEN : INET_ADDRSTRLEN;
    if (inet_ntop(family, addressBytes(entry.ifa_addr), text.data(), capacity) == nullptr) {
        const int error = errno;
        logError(
            "Router::initLocalIp() - inet_ntop failed, errno [%d]  Address Name: [%s]   Address Family: [%s][%d]   Flags: [%#08x]\n",
            error, entry.ifa_name, familyName, family, entry.ifa_flags);
        return "";
    }
    logDebug(
        "Router::initLocalIp() - Address Name: [%s]   Address Family: [%s][%d]   Address: [%s]  Flags: [%#08x]\n",
        entry.ifa_name, familyName, family, text.data(), entry.ifa_flags);
    return text.data();
}

std::string textOf(const char* text) {
    return text == nullptr ? "" : text;
}

void logDevices(const UPNPDev* device) {
    logInfo("Router::upnp_discover - List of UPNP devices found on the network :\n");
    for (int count = 0; device != nullptr && count < kMostDevices; ++count) {
        logInfo(" desc: %s\n st: %s\n\n", scrubSecrets(textOf(device->descURL)).c_str(),
                scrubSecrets(textOf(device->st)).c_str());
        device = device->pNext;
    }
}

// A description at "udhisapi.dll" belongs to a host that only pretends to be a gateway.
bool isGateway(const UPNPDev& device) {
    const std::string target = textOf(device.st);
    const bool wanted = target == "urn:schemas-upnp-org:device:InternetGatewayDevice:1" ||
                        target == "urn:schemas-upnp-org:service:WANIPConnection:1" ||
                        target == "urn:schemas-upnp-org:service:WANPPPConnection:1";
    return wanted && !contains(textOf(device.descURL), "udhisapi.dll");
}

// False, with a line that says so, when a gateway's description is not on another host.
bool isReachable(const UPNPDev& gateway) {
    const std::string url = textOf(gateway.descURL);
    if (leadsToAnotherHost(url)) return true;
    logNotice(
        "Router::upnp_discover - gateway ignored, its description is not at another host's IPv4 address: %s\n",
        scrubSecrets(url).c_str());
    return false;
}

// Copies the gateways from the list that starts at @p device, in order, up to the most that are
// tried. The strings still belong to that list.
std::vector<UPNPDev> gatewaysOf(const UPNPDev* device) {
    std::vector<UPNPDev> gateways;
    for (int count = 0; device != nullptr && count < kMostDevices; ++count) {
        if (isGateway(*device) && isReachable(*device)) gateways.push_back(*device);
        if (gateways.size() == kMostGateways) break;
        device = device->pNext;
    }
    UPNPDev* next = nullptr;
    for (auto gateway = gateways.rbegin(); gateway != gateways.rend(); ++gateway) {
        gateway->pNext = next;
        next = &*gateway;
    }
    return gateways;
}

void logChosenDevice(int state, const std::string& controlUrl, const char* lanAddress) {
    const std::string url = scrubSecrets(controlUrl);
    switch (state) {
        case miniupnpc::CONNECTED_IGD:
            logInfo("Router::upnp_discover - IGD found at: %s, local host IP address: %s \n",
                    url.c_str(), lanAddress);
            break;
        case miniupnpc::UNCONNECTED_IGD:
            logInfo(
                "Router::upnp_discover - Unconnected IGD found at: %s local host IP address: %s, proceeding anyway \n",
                url.c_str(), lanAddress);
            break;
        case miniupnpc::OTHER_UPNP_DEVICE:
            logInfo(
                "Router::upnp_discover - Non-IGD UPnP device found at: %s local hostIP address: %s , proceeding anyway \n",
                url.c_str(), lanAddress);
            break;
        default:
            logInfo(
                "Router::upnp_discover - Unknown device type found at: %s local address: %s, proceeding anyway \n",
                url.c_str(), lanAddress);
            break;
    }
}

}  // namespace

bool Router::discover() {
    const bool wasInitialized = std::exchange(initialized, false);
    const bool wasNatPMP = std::exchange(isNatPMP, false);
    const Igd earlier = igd();
    forgetSeenChanges();
    initLocalIp();
    if (upnp_discover()) return true;
    if (!wasInitialized || !stopBudgetSpent()) return natpmp_discover();
    // Cut short: the clean-up still needs the gateway that was found before.
    initialized = true;
    isNatPMP = wasNatPMP;
    controlUrl = earlier.controlUrl;
    serviceType = earlier.serviceType;
    return true;
}

void Router::forgetSeenChanges() {
    if (externalIpChangeSeen) externalIpChanged = false;
    externalIpChangeSeen = false;
    if (localIpChangeSeen) localIpChanged = false;
    localIpChangeSeen = false;
}

void Router::initLocalIp() {
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) {
        logError("Router::initLocalIP() - failed to get local NIC info.\n");
        return;
    }
    const Interfaces interfaces(list);
    std::string ipv4;
    std::string ipv6;
    for (const ifaddrs* entry = interfaces.get(); entry != nullptr; entry = entry->ifa_next) {
        if (!leadsToLan(*entry)) continue;
        const int family = entry->ifa_addr->sa_family;
        if (family == AF_INET && ipv4.empty()) ipv4 = addressText(*entry);
        if (family == AF_INET6 && ipv6.empty()) ipv6 = addressText(*entry);
    }
    takeLocalIp(ipv4, ipv6);
}

void Router::takeLocalIp(const std::string& ipv4, const std::string& ipv6) {
    if (ipv4.empty() && ipv6.empty()) {
        logError("Router::initLocalIP() - failed to retrieve local IPv4 or IPv6\n");
        return;
    }
    if (!localIp.empty() && (localIp == ipv4 || localIp == ipv6)) return;
    localIp = ipv4.empty() ? ipv6 : ipv4;
    localIpChanged = true;
    logInfo("Router::initLocalIP() - IPv4: [%s]  IPv6: [%s]  setting localIP to: [%s] \n",
            ipv4.c_str(), ipv6.c_str(), localIp.c_str());
}

bool Router::upnp_discover() {
    Devices devices(miniupnpc::discover(kDiscoverDelay));
    if (!devices) {
        logError("Router::upnp_discover - UPnP Discover failed to return any response.\n");
        return false;
    }
    logDevices(devices.get());
    std::vector<UPNPDev> gateways = gatewaysOf(devices.get());
    if (gateways.empty()) return false;
    const bool success = useGateway(gateways.front());
    devices.reset();
    gateways.clear();
    logInfo("Router::upnp_discover - finished discovery, success = %s \n",
            success ? "true" : "false");
    return success;
}

// Chooses among the gateways of a list and learns the external address from the chosen one.
bool Router::useGateway(UPNPDev& gateways) {
    UPNPUrls urls{};
    IGDdatas data{};
    constexpr int kLanAddressSize = 64;
    // The library may fill all of it; the byte beyond ends the text.
    std::array<char, kLanAddressSize + 1> lanAddress{};
    const int state =
        miniupnpc::getValidIgd(&gateways, urls, data, lanAddress.data(), kLanAddressSize);
    if (state == miniupnpc::NO_IGD) {
        logInfo("Router::upnp_discover - invalid device type \n");
        return false;
    }
    const UrlContents contents(&urls);
    const std::string url = textOf(urls.controlURL);
    // The description may send us anywhere, whoever served it.
    if (!leadsToAnotherHost(url)) {
        logNotice(
            "Router::upnp_discover - gateway ignored, its control URL is not at another host's IPv4 address: %s\n",
            scrubSecrets(url).c_str());
        return false;
    }
    const char* const type = data.first.servicetype;
    controlUrl = url;
    serviceType.assign(type, strnlen(type, sizeof data.first.servicetype));
    logChosenDevice(state, controlUrl, lanAddress.data());
    const bool found = findExternalIp();
    logInfo("Router::upnp_discover - FreeUPNPUrls.\n");
    return found;
}

bool Router::findExternalIp() {
    const IgdAddress address = igd().externalAddress();
    if (address.status != 0 || address.text.empty()) {
        logInfo(
            "Router::upnp_discover - failed to get External IP address, ipStatus: %d, value received: %s \n",
            address.status, scrubSecrets(address.text).c_str());
        return false;
    }
    if (takeExternalIp(address.text)) {
        logNotice("Router::upnp_discover - Router's external IP address has changed!\n");
    }
    logInfo("Router::upnp_discover - Router's external IP address: %s \n",
            scrubSecrets(address.text).c_str());
    initialized = true;
    return true;
}

bool Router::natpmp_discover() {
    if (!pNatpmp) {
        pNatpmp.reset(new (std::nothrow) CMnatpmp);
        logNotice("Router::natpmp_discover - unexpected pNatpmp is NULL.\n");
    }
    if (!pNatpmp) {
        logNotice("Router::natpmp_discover - unexpected pNatpmp is still NULL.\n");
        return false;
    }
    std::string ip;
    if (!pNatpmp->retrieveExternalIP(ip) || ip.empty()) {
        logInfo("Router::natpmp_discover - failed to get External IP address\n");
        return false;
    }
    isNatPMP = true;
    if (takeExternalIp(ip)) {
        logNotice("Router::natpmp_discover - Router's external IP address has changed!\n");
    }
    logInfo("Router::natpmp_discover - Router's external IP address: %s \n", ip.c_str());
    initialized = true;
    return true;
}

// True when @p address is new.
bool Router::takeExternalIp(const std::string& address) {
    if (externalIp == address) return false;
    externalIp = address;
    externalIpChanged = true;
    return true;
}

}  // namespace pelorus
