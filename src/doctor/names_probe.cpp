#include "doctor/names_probe.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>

#include "doctor/address_class.h"
#include "doctor/resolver.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kMostOutput = 256UL * 1024;
constexpr std::string_view kPeerText = "Peer Connection Initiated with [AF_INET]";

// The end of a regular file, empty if it cannot be read.
std::string tailOf(const std::string& path) {
    const int file = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
    if (file < 0) return {};
    struct stat status {};
    std::string text;
    if (fstat(file, &status) == 0 && S_ISREG(status.st_mode)) {
        text.resize(kMostOutput);
        const off_t start = std::max<off_t>(0, status.st_size - static_cast<off_t>(kMostOutput));
        const ssize_t size = pread(file, text.data(), text.size(), start);
        text.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
    }
    static_cast<void>(close(file));
    return text;
}

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

std::string statusOf(const Evidence& evidence) {
    return evidence.statusWord.empty() ? evidence.setting("COMMUNICATION_STATUS")
                                       : evidence.statusWord;
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
    if (wrong != addresses.end()) {
        const std::string text = "the public names lead to " + *wrong + " instead of " + wanted;
        findings.add(Sign::NAMES_LEAD_ELSEWHERE, text);
        findings.problem(text);
        return;
    }
    const std::string where = relayed && !expected.empty() ? "the relay " : "";
    const std::string text = "public names lead to " + where + wanted;
    findings.add(Sign::NAMES_RIGHT, "the " + text);
    findings.ok(text);
}

void lookAtNames(const Evidence& evidence, Findings& findings) {
    const std::string status = statusOf(evidence);
    const bool relayed = status == "relayed";
    if (!relayed && status != "portforwarded") return;
    const std::vector<std::string> names = namesOf(evidence);
    if (names.empty()) return;
    hurryResolver();
    std::vector<std::string> addresses;
    for (const std::string& name : names) {
        const Lookup found = lookUp(name);
        if (found.noServer) {
            unresolved(findings, "the name server does not answer");
            return;
        }
        addresses.push_back(found.addresses.empty() ? "" : found.addresses.front());
    }
    const std::string expected = relayed
                                     ? relayInOutput(tailOf(evidence.setting("STARTCMD_OUTFILE")))
                                     : evidence.setting("EXTERNAL_IP");
    judgeNames(addresses, plainText(expected, 40), relayed, findings);
}

}  // namespace pelorus::doctor
