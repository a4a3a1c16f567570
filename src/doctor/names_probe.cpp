#include "doctor/names_probe.h"

#include <unistd.h>

#include <algorithm>
#include <array>

#include "common/files.h"
#include "doctor/address_class.h"
#include "doctor/resolver.h"
#include "doctor/tunnel_look.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr std::string_view kPeerText = "Peer Connection Initiated with [AF_INET]";

std::vector<std::string> namesOf(const Evidence& evidence) {
    const std::string id = evidence.setting("DEVICEID");
    std::array<char, 512> host{};
    if (id.empty() || gethostname(host.data(), host.size() - 1) != 0 || host[0] == '\0') return {};
    const std::string label = "device" + id + domainOfNames(evidence.setting("SERVER_BASE_URL"));
    const std::string name = host.data();
    std::vector<std::string> names{name + "." + label, name + "-" + label};
    const std::string subdomain = evidence.setting("SUBDOMAIN");
    if (!subdomain.empty()) names.push_back(subdomain);
    return names;
}

// Where the names should lead; empty when nothing tells it.
std::string expectedAddress(const Evidence& evidence, bool relayed) {
    if (!relayed) return evidence.setting("EXTERNAL_IP");
    const std::string output = tunnelFile(evidence, "STARTCMD_OUTFILE");
    return relayInOutput(readForeignFile(output, Part::TAIL).text.value_or(""));
}

void unresolved(Findings& findings, const std::string& text) {
    findings.add(Sign::NAMES_UNRESOLVED, text);
    findings.problem("public names: " + text);
}

}  // namespace

std::string relayInOutput(std::string_view output) {
    const std::size_t found = output.rfind(kPeerText);
    if (found == output.npos) return {};
    const std::string_view rest = output.substr(found + kPeerText.size());
    const std::string address{rest.substr(0, rest.find_first_not_of("0123456789."))};
    return classOf(address) == AddressClass::NONE ? std::string{} : address;
}

void judgeNames(const std::vector<std::string>& addresses,
                const std::string& expected,
                bool relayed,
                Findings& findings) {
    const auto missing = std::count(addresses.begin(), addresses.end(), "");
    const std::string all = std::to_string(addresses.size());
    if (missing != 0) {
        unresolved(findings, std::to_string(missing) + " of " + all + " public names are unknown");
        return;
    }
    const std::string& wanted = expected.empty() ? addresses.front() : expected;
    const auto wrong = std::find_if(addresses.begin(), addresses.end(),
                                    [&](const std::string& address) { return address != wanted; });
    if (expected.empty() && wrong != addresses.end()) {
        unresolved(findings, "the public names lead to " + wanted + " and " + *wrong);
    } else if (expected.empty()) {
        findings.notSeen("public names: they lead to " + wanted +
                         ", but nothing tells where they should lead");
    } else if (wrong != addresses.end()) {
        const std::string text = "the public names lead to " + *wrong + " instead of " + wanted;
        findings.add(Sign::NAMES_LEAD_ELSEWHERE, text);
        findings.problem(text);
    } else {
        const std::string text = "public names lead to " + std::string{relayed ? "the relay " : ""};
        findings.add(Sign::NAMES_RIGHT, "the " + text + wanted);
        findings.ok(text + wanted);
    }
}

void lookAtNames(const Evidence& evidence, Findings& findings) {
    const bool relayed = evidence.statusWord == "relayed";
    if (!relayed && evidence.statusWord != "portforwarded") return;
    const std::vector<std::string> names = namesOf(evidence);
    if (names.empty()) return;
    hurryResolver();
    std::vector<std::string> addresses;
    for (const std::string& name : names) {
        const Lookup found = lookUp(name);
        if (found.noServer) {
            unresolved(findings, found.obstacle);
            return;
        }
        addresses.push_back(found.addresses.empty() ? "" : found.addresses.front());
    }
    judgeNames(addresses, plainText(expectedAddress(evidence, relayed), 40), relayed, findings);
}

}  // namespace pelorus::doctor
