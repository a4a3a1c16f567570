#include "doctor/gateway_verdict.h"

#include <algorithm>
#include <array>
#include <set>

#include "common/text.h"
#include "doctor/address_class.h"
#include "doctor/quotations.h"

namespace pelorus::doctor {

namespace {

using State = GatewayAnswer::State;

// The external ports that are tried first.
constexpr int kHttpPort = 9091;
constexpr int kHttpsPort = 9444;

bool isFound(const GatewayAnswer& answer) {
    return answer.state == State::FOUND;
}

bool tellsAddress(const GatewayAnswer& answer) {
    return isFound(answer) && classOf(answer.address) != AddressClass::NONE;
}

// The answer that the daemon takes: any text is an address, through UPnP first.
const GatewayAnswer& chosen(const GatewayAnswer& upnp, const GatewayAnswer& natpmp) {
    const bool isUpnpTaken = isFound(upnp) && !upnp.address.empty();
    if (isUpnpTaken || !isFound(natpmp)) return upnp;
    return !natpmp.address.empty() || !isFound(upnp) ? natpmp : upnp;
}

std::string protocols(const GatewayAnswer& upnp, const GatewayAnswer& natpmp) {
    if (isFound(upnp) && isFound(natpmp) && upnp.gateway == natpmp.gateway) {
        return " (UPnP and NAT-PMP)";
    }
    return &chosen(upnp, natpmp) == &upnp ? " (UPnP)" : " (NAT-PMP)";
}

struct ClassWords {
    AddressClass kind;
    Sign sign;
    const char* words;
};

constexpr std::array<ClassWords, 5> kClasses{{
    {AddressClass::NONE, Sign::GATEWAY_WITHOUT_ADDRESS, " is none"},
    {AddressClass::HOME, Sign::GATEWAY_ADDRESS_PRIVATE, " is private"},
    {AddressClass::RESERVED, Sign::GATEWAY_WITHOUT_ADDRESS, " is not an internet address"},
    {AddressClass::SHARED, Sign::GATEWAY_ADDRESS_SHARED, " is shared address space"},
    {AddressClass::PUBLIC, Sign::GATEWAY_ADDRESS_PUBLIC, " is public"},
}};

const ClassWords& wordsFor(AddressClass kind) {
    return *std::find_if(kClasses.begin(), kClasses.end(),
                         [kind](const ClassWords& row) { return row.kind == kind; });
}

void judgeAddress(const GatewayAnswer& answer, const std::string& line, Findings& findings) {
    if (!tellsAddress(answer)) {
        const std::string text = answer.address.empty() ? "tells no internet address"
                                                        : "says its address is " + answer.address;
        findings.add(Sign::GATEWAY_WITHOUT_ADDRESS, "the gateway " + text);
        findings.problem(line + text);
        return;
    }
    const ClassWords& row = wordsFor(classOf(answer.address));
    const std::string text = "address " + answer.address + row.words;
    findings.add(row.sign, text);
    // Some say so for ever, and map all the same.
    const std::string whole =
        line + (answer.connected ? "" : "says that it is not connected, ") + text;
    if (row.kind == AddressClass::PUBLIC) {
        findings.ok(whole);
    } else {
        findings.problem(whole);
    }
}

bool isElsewhere(const GatewayAnswer& answer, const std::vector<std::string>& routed) {
    return !routed.empty() &&
           std::find(routed.begin(), routed.end(), answer.gateway) == routed.end();
}

// An access point, for example, which the daemon does not use either. A gateway without an address
// is one all the same.
bool isOnlyAnnounced(const GatewayAnswer& answer, const std::vector<std::string>& routed) {
    return isFound(answer) && answer.address.empty() && isElsewhere(answer, routed);
}

void judgeSilence(const GatewayAnswer& upnp, const GatewayAnswer& natpmp, Findings& findings) {
    const std::string device = upnp.unanswered;
    if (upnp.state == State::SILENT && natpmp.state == State::SILENT) {
        std::string text = "no gateway answers to UPnP or NAT-PMP";
        if (!natpmp.unanswered.empty()) {
            text = "no gateway answers to UPnP, and " + natpmp.unanswered + " refuses NAT-PMP";
        }
        if (!device.empty()) text = device + " announces itself, but does not act as a gateway";
        findings.add(Sign::NO_GATEWAY_ANSWERS, text);
        findings.problem("gateway: " + text);
        return;
    }
    findings.notSeen(device.empty() ? "gateway: it did not answer in time"
                                    : "gateway: " + device + " did not answer in time");
}

bool isOwn(const GatewayTable& table, const TableEntry& entry) {
    const auto& own = table.ownAddresses;
    return std::find(own.begin(), own.end(), entry.client) != own.end();
}

bool isOurs(const GatewayTable& table, const TableEntry& entry) {
    const bool named = entry.description.empty() || entry.description == "Kavra" ||
                       entry.description == "KavraSSL";
    const bool leadsToServer = entry.internalPort == table.internalHttpPort ||
                               entry.internalPort == table.internalHttpsPort;
    return named && leadsToServer && isOwn(table, entry);
}

void append(std::string& list, const std::string& item) {
    list += (list.empty() ? "" : ", ") + item;
}

void tellOurs(const GatewayTable& table, Findings& findings) {
    std::string ours;
    for (const TableEntry& entry : table.entries) {
        if (entry.protocol != "TCP" || !isOurs(table, entry)) continue;
        append(ours,
               std::to_string(entry.externalPort) + " to " + std::to_string(entry.internalPort));
    }
    if (!ours.empty()) findings.ok("gateway maps " + ours + " of this device");
}

// Some gateways name the other device instead of telling its address.
bool tellsClient(const TableEntry& entry) {
    return classOf(entry.client) != AddressClass::NONE;
}

// What is wrong with the mapping of a published port; empty if nothing is, or it is not known.
std::string mappingFault(const GatewayTable& table, const PublishedPort& port) {
    if (!port.told) return {};
    if (!port.entry) {
        // One that knows no single entries may list it all the same.
        const bool isListed =
            std::any_of(table.entries.begin(), table.entries.end(), [&](const TableEntry& entry) {
                return entry.externalPort == port.externalPort &&
                       (isOwn(table, entry) || !tellsClient(entry));
            });
        return isListed ? "" : "the gateway does not map it";
    }
    const TableEntry& entry = *port.entry;
    if (!tellsClient(entry)) return {};
    if (isOwn(table, entry) && entry.internalPort == port.internalPort) return {};
    return "the gateway maps it to port " + std::to_string(entry.internalPort) + " of " +
           entry.client;
}

void judgePublished(const GatewayTable& table, Findings& findings) {
    std::size_t faults = 0;
    for (const PublishedPort& port : table.published) {
        const std::string fault = mappingFault(table, port);
        if (fault.empty()) continue;
        ++faults;
        const std::string text =
            "port " + std::to_string(port.externalPort) + " is published, but " + fault;
        findings.add(Sign::OUR_MAPPINGS_MISSING, text);
        findings.problem("gateway's table: " + text);
    }
    if (faults == 0 || faults < table.published.size() || !table.isComplete) return;
    findings.add(Sign::NO_PORT_MAPPED, "the gateway maps none of the published ports");
}

void judgeOthers(const GatewayTable& table, Findings& findings) {
    std::set<int> published;
    std::vector<TableEntry> entries = table.entries;
    for (const PublishedPort& port : table.published) {
        published.insert(port.externalPort);
        if (port.entry) entries.push_back(*port.entry);
    }
    std::set<int> wanted{kHttpPort, kHttpsPort};
    wanted.insert(published.begin(), published.end());
    std::string held;
    bool inTheWay = published.empty();
    for (const TableEntry& entry : entries) {
        if (entry.protocol != "TCP" || isOwn(table, entry) || !tellsClient(entry)) continue;
        if (wanted.erase(entry.externalPort) == 0) continue;
        inTheWay = inTheWay || published.count(entry.externalPort) != 0;
        const std::string name =
            entry.description.empty() ? "" : " (" + plainText(entry.description, 40) + ")";
        append(held, std::to_string(entry.externalPort) + " to " + entry.client + name);
    }
    if (held.empty()) return;
    findings.add(Sign::PORT_HELD_BY_OTHER, "the " + std::string{kTable} + held);
    const std::string line = std::string{kTable} + held + std::string{kNotOurs};
    if (inTheWay) {
        findings.problem(line);
    } else {
        findings.ok(line);
    }
}

}  // namespace

std::string externalAddress(const GatewayAnswer& upnp, const GatewayAnswer& natpmp) {
    const GatewayAnswer& answer = chosen(upnp, natpmp);
    return tellsAddress(answer) ? answer.address : std::string{};
}

void judgeGateway(GatewayAnswer upnp,
                  const GatewayAnswer& natpmp,
                  const std::vector<std::string>& routed,
                  Findings& findings) {
    if (isOnlyAnnounced(upnp, routed)) upnp = {State::SILENT, "", "", true, upnp.gateway};
    if (!isFound(upnp) && !isFound(natpmp)) {
        judgeSilence(upnp, natpmp, findings);
        return;
    }
    const GatewayAnswer& answer = chosen(upnp, natpmp);
    const std::string name = answer.gateway + protocols(upnp, natpmp);
    findings.add(Sign::GATEWAY_FOUND, "gateway " + name);
    judgeAddress(answer, "gateway " + name + ": ", findings);
    if (!isElsewhere(answer, routed)) return;
    const std::string text =
        answer.gateway + " answers as a gateway, the default route leads to " + routed.front();
    findings.add(Sign::GATEWAY_ELSEWHERE, text);
    findings.ok("gateway: " + text);
}

void judgeSilentGateway(const GatewayAnswer& upnp,
                        const GatewayAnswer& natpmp,
                        const std::vector<std::string>& routed,
                        Findings& findings) {
    for (const GatewayAnswer& answer : {upnp, natpmp}) {
        const std::string& device = isFound(answer) ? answer.gateway : answer.unanswered;
        if (std::find(routed.begin(), routed.end(), device) != routed.end()) return;
    }
    const std::string text = routed.front() + " does not answer in the home network at all";
    findings.add(Sign::GATEWAY_SILENT, "the gateway " + text);
    findings.problem("gateway: " + text);
}

void judgeTable(const GatewayTable& table, Findings& findings) {
    tellOurs(table, findings);
    judgePublished(table, findings);
    judgeOthers(table, findings);
}

}  // namespace pelorus::doctor
