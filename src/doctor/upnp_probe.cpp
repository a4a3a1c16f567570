#include <array>
#include <chrono>
#include <cstring>
#include <memory>
#include <optional>
#include <utility>

#include "common/handles.h"
#include "common/miniupnpc_api.h"
#include "common/text.h"
#include "doctor/address_class.h"
#include "doctor/gateway_probe.h"
#include "doctor/interfaces.h"
#include "doctor/url_host.h"
#include "router/gateway_url.h"

namespace pelorus::doctor {

namespace {

using Clock = std::chrono::steady_clock;
using Devices = std::unique_ptr<UPNPDev, Releaser<freeUPNPDevlist>>;
using UrlContents = std::unique_ptr<UPNPUrls, Releaser<FreeUPNPUrls>>;

constexpr int kDiscoverDelay = 2000;  // milliseconds
constexpr int kMostDevices = 100;
constexpr std::size_t kMostGateways = 8;
constexpr int kMostEntries = 1000;
constexpr int kNoSuchEntry = 714;  // in the gateway's table
constexpr std::chrono::seconds kTablePatience{4};

std::string textOf(const char* text) {
    return text == nullptr ? std::string{} : text;
}

// The address behind a URL that the daemon would ask. Else empty.
std::string gatewayBehind(const char* url) {
    if (!leadsToAnotherHost(textOf(url))) return {};
    const auto found = hostOfUrl(textOf(url));
    return found ? found->host : std::string{};
}

// By the daemon's rule: what it does not take for a gateway helps nobody.
bool isGateway(const UPNPDev& device) {
    const std::string target = textOf(device.st);
    const bool wanted = target == "urn:schemas-upnp-org:device:InternetGatewayDevice:1" ||
                        target == "urn:schemas-upnp-org:service:WANIPConnection:1" ||
                        target == "urn:schemas-upnp-org:service:WANPPPConnection:1";
    return wanted && !contains(textOf(device.descURL), "udhisapi.dll");
}

// The gateways of a list, as a list of their own. The strings still belong to the first one.
std::vector<UPNPDev> gatewaysOf(const UPNPDev* device) {
    std::vector<UPNPDev> gateways;
    for (int count = 0; device != nullptr && count < kMostDevices; ++count) {
        const bool isFit = isGateway(*device) && !gatewayBehind(device->descURL).empty();
        if (isFit) gateways.push_back(*device);
        if (gateways.size() == kMostGateways) break;
        device = device->pNext;
    }
    for (std::size_t i = 0; i < gateways.size(); ++i) {
        gateways[i].pNext = i + 1 < gateways.size() ? &gateways[i + 1] : nullptr;
    }
    return gateways;
}

// A chosen gateway's connection service.
struct Service {
    std::string controlUrl;
    std::string type;
};

// Nothing when the gateway does not answer the question; empty when it has no address.
std::optional<std::string> addressOf(const Service& service) {
    std::array<char, 64> address{};
    const int status = miniupnpc::call(UPNP_GetExternalIPAddress, service.controlUrl.c_str(),
                                       service.type.c_str(), address.data());
    if (status != UPNPCOMMAND_SUCCESS) return std::nullopt;
    return address.data();
}

// The library calls a gateway with a private address unconnected, too; so the gateway is asked.
bool saysUnconnected(const Service& service) {
    std::array<char, 128> state{};
    std::array<char, 128> lastError{};
    unsigned uptime = 0;
    const int status =
        miniupnpc::call(UPNP_GetStatusInfo, service.controlUrl.c_str(), service.type.c_str(),
                        state.data(), &uptime, lastError.data());
    return status == UPNPCOMMAND_SUCCESS && contains(state.data(), "isconnect");
}

// The buffers are larger than what the library writes.
struct EntryTexts {
    std::array<char, 16> externalPort{}, internalPort{}, protocol{}, enabled{};
    std::array<char, 32> client{}, lease{};
    std::array<char, 128> description{}, remoteHost{};
};

// The library's status.
int readEntry(const Service& service, int index, TableEntry& entry) {
    EntryTexts texts;
    const int status = miniupnpc::call(
        UPNP_GetGenericPortMappingEntry, service.controlUrl.c_str(), service.type.c_str(),
        std::to_string(index).c_str(), texts.externalPort.data(), texts.client.data(),
        texts.internalPort.data(), texts.protocol.data(), texts.description.data(),
        texts.enabled.data(), texts.remoteHost.data(), texts.lease.data());
    entry = {leadingInt(texts.externalPort.data()), texts.protocol.data(),
             plainText(texts.client.data(), 40), leadingInt(texts.internalPort.data()),
             texts.description.data()};
    return status;
}

// How gateways say that there is no entry with that index. One that rejects the arguments of the
// first question may not know the question.
bool isEnd(int status, int index) {
    constexpr int kInvalidArgs = 402;
    constexpr int kIndexInvalid = 713;
    return status == kIndexInvalid || status == kNoSuchEntry ||
           (status == kInvalidArgs && index > 0);
}

// False when the end was not reached.
bool readEntries(const Service& service, Clock::time_point end, std::vector<TableEntry>& entries) {
    for (int index = 0; index < kMostEntries && Clock::now() < end; ++index) {
        TableEntry entry;
        const int status = readEntry(service, index, entry);
        if (status != UPNPCOMMAND_SUCCESS) return isEnd(status, index);
        entries.push_back(entry);
    }
    return false;
}

void askFor(const Service& service, PublishedPort& port) {
    EntryTexts texts;
    const int status = miniupnpc::getSpecificPortMappingEntry(
        service.controlUrl.c_str(), service.type.c_str(), std::to_string(port.externalPort).c_str(),
        "TCP", texts.client.data(), texts.internalPort.data(), texts.description.data(),
        texts.enabled.data(), texts.lease.data());
    port.told = status == UPNPCOMMAND_SUCCESS || status == kNoSuchEntry;
    if (status != UPNPCOMMAND_SUCCESS) return;
    port.entry = {port.externalPort, "TCP", plainText(texts.client.data(), 40),
                  leadingInt(texts.internalPort.data()), texts.description.data()};
}

int portSetting(const Evidence& evidence, const char* key, int missing) {
    return scanInt(evidence.setting(key).c_str()).value_or(missing);
}

std::vector<PublishedPort> publishedPorts(const Evidence& evidence, const GatewayTable& table) {
    std::vector<PublishedPort> ports;
    for (const auto& [key, internal] :
         {std::pair{"EXTERNAL_HTTP_PORT", table.internalHttpPort},
          std::pair{"EXTERNAL_HTTPS_PORT", table.internalHttpsPort}}) {
        const int external = portSetting(evidence, key, 0);
        if (external > 0) ports.push_back({external, internal, false, {}});
    }
    return ports;
}

// What the user forwards by hand need not be in the table, nor what another gateway maps.
bool isMappedByDaemon(const Evidence& evidence, const std::string& address) {
    const std::string published = evidence.setting("EXTERNAL_IP");
    return evidence.statusWord == "portforwarded" &&
           evidence.setting("MANUAL_PORT_FORWARD") != "TRUE" &&
           (published.empty() || published == address);
}

// Of the gateway with this external address.
void lookAtTable(const Service& service,
                 const std::string& address,
                 const Evidence& evidence,
                 Findings& findings) {
    if (!evidence.hasSettings()) {
        findings.notSeen("gateway's table: " + evidence.unreadSettings);
        return;
    }
    const Clock::time_point end = Clock::now() + kTablePatience;
    GatewayTable table;
    table.ownAddresses = ownAddresses();
    table.internalHttpPort = portSetting(evidence, "INTERNAL_HTTP_PORT", 80);
    table.internalHttpsPort = portSetting(evidence, "INTERNAL_HTTPS_PORT", 443);
    table.published = publishedPorts(evidence, table);
    for (PublishedPort& port : table.published) {
        if (isMappedByDaemon(evidence, address) && Clock::now() < end) askFor(service, port);
    }
    table.isComplete = readEntries(service, end, table.entries);
    judgeTable(table, findings);
    if (!table.isComplete) findings.notSeen("gateway's table: it could not be read to its end");
}

void lookAtGateway(UPNPDev& gateways, const Evidence& evidence, Findings& findings) {
    UPNPUrls urls{};
    IGDdatas data{};
    std::array<char, 128> lanAddress{};
    const int state = miniupnpc::getValidIgd(&gateways, urls, data, lanAddress.data(), 64);
    if (state == miniupnpc::NO_IGD) return;
    const UrlContents contents(&urls);
    const std::string gateway = gatewayBehind(urls.controlURL);
    if (gateway.empty()) return;
    const char* const type = data.first.servicetype;
    const Service service{textOf(urls.controlURL),
                          std::string{type, strnlen(type, sizeof data.first.servicetype)}};
    findings.set("announced", gateway);
    const auto told = addressOf(service);
    const bool unconnected = state == miniupnpc::UNCONNECTED_IGD && saysUnconnected(service);
    const std::string address = told.value_or("");
    const bool isIgd = state != miniupnpc::OTHER_UPNP_DEVICE;
    if (address.empty() && !(isIgd && (told || unconnected))) return;
    findings.set("address", address);
    if (unconnected) findings.set("unconnected", "yes");
    findings.set("gateway", gateway);
    // Without an address it need not be the gateway that the daemon uses.
    if (classOf(address) != AddressClass::NONE) lookAtTable(service, address, evidence, findings);
}

}  // namespace

void askThroughUpnp(const Evidence& evidence, Findings& findings) {
    const Devices devices(miniupnpc::discover(kDiscoverDelay));
    std::vector<UPNPDev> gateways = gatewaysOf(devices.get());
    if (!gateways.empty()) {
        findings.set("announced", gatewayBehind(gateways.front().descURL));
        lookAtGateway(gateways.front(), evidence, findings);
    }
    if (findings.value("gateway").empty()) findings.set("silent", "yes");
}

}  // namespace pelorus::doctor
