#include <arpa/inet.h>
#include <netinet/in.h>
#include <unistd.h>

#include <array>
#include <charconv>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "common/handles.h"
#include "common/log.h"
#include "router/router.h"

namespace pelorus {

namespace {

constexpr const char* kHelperScript = "/etc/scripts/tavik_helper.sh";
constexpr const char* kListCommand = "/etc/scripts/tavik_helper.sh list";
constexpr const char* kWanAddressCommand = "/etc/scripts/getip.sh wan";
constexpr const char* kLanAddressCommand = "/etc/scripts/getip.sh lan";

constexpr const char* kOwnerSelf = "BRENVIK";
constexpr const char* kOwnerOther = "OTHER";

constexpr int kHighestPort = 65535;
constexpr unsigned kPauseAfterRemoval = 1;  // seconds, for the router to apply it
constexpr std::size_t kLongestLine = 1024;  // what follows in a line is dropped
constexpr std::size_t kFieldsBeforeDescription = 5;

std::optional<std::string> readLine(std::FILE* stream) {
    int next = std::getc(stream);
    if (next == EOF) return std::nullopt;
    std::string line;
    for (; next != EOF && next != '\n'; next = std::getc(stream)) {
        if (line.size() < kLongestLine) line.push_back(static_cast<char>(next));
    }
    return line;
}

std::string trimmed(const std::string& text) {
    constexpr const char* kBlanks = " \t\r\n";
    const std::size_t first = text.find_first_not_of(kBlanks);
    if (first == std::string::npos) return "";
    return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

bool isAddress(const std::string& text) {
    in6_addr bytes{};
    return inet_pton(AF_INET, text.c_str(), &bytes) == 1 ||
           inet_pton(AF_INET6, text.c_str(), &bytes) == 1;
}

// The address a script prints in its first line; empty when it prints none. Anything but an
// address would travel on into shell commands and requests, so it counts as none.
std::string askForAddress(const char* command) {
    const PipeHandle answer(popen(command, "re"));
    const std::string address = answer ? trimmed(readLine(answer.get()).value_or("")) : "";
    return isAddress(address) ? address : "";
}

std::optional<int> parsePort(const std::string& text) {
    const char* const end = text.data() + text.size();
    int number = 0;
    const auto result = std::from_chars(text.data(), end, number);
    if (result.ec != std::errc() || result.ptr != end) return std::nullopt;
    if (number < 1 || number > kHighestPort) return std::nullopt;
    return number;
}

struct PortRange {
    int first = 0;
    int last = 0;
};

// FIRST or FIRST-LAST.
std::optional<PortRange> parsePortRange(const std::string& text) {
    const std::size_t dash = text.find('-');
    const std::optional<int> first = parsePort(trimmed(text.substr(0, dash)));
    const std::optional<int> last =
        dash == std::string::npos ? first : parsePort(trimmed(text.substr(dash + 1)));
    if (!first || !last || *first > *last) return std::nullopt;
    return PortRange{*first, *last};
}

// Cuts @p line at its first commas; the last part is the description, commas and all.
std::vector<std::string> splitFields(const std::string& line) {
    std::vector<std::string> fields;
    std::size_t start = 0;
    while (fields.size() < kFieldsBeforeDescription) {
        const std::size_t comma = line.find(',', start);
        if (comma == std::string::npos) return fields;
        fields.push_back(trimmed(line.substr(start, comma - start)));
        start = comma + 1;
    }
    fields.push_back(trimmed(line.substr(start)));
    return fields;
}

// OWNER,PROTOCOL,FIRST[-LAST],LANADDRESS,INTERNALPORT,DESCRIPTION
std::optional<_BrenvikPortIp> parseEntry(const std::string& line) {
    const std::vector<std::string> fields = splitFields(line);
    if (fields.size() <= kFieldsBeforeDescription) return std::nullopt;
    const std::string& owner = fields[0];
    const std::string& protocol = fields[1];
    const std::optional<PortRange> ports = parsePortRange(fields[2]);
    const std::string& address = fields[3];
    const std::optional<int> internalPort = parsePort(fields[4]);
    const bool known =
        (owner == kOwnerSelf || owner == kOwnerOther) && (protocol == "TCP" || protocol == "UDP");
    if (!known || !ports || !isAddress(address) || !internalPort) return std::nullopt;
    return _BrenvikPortIp{owner,   protocol,      ports->first, ports->last,
                          address, *internalPort, fields[5]};
}

// Runs the helper script with one argument, which the shell takes literally. 0 when no shell could
// be started, else 1; the script's own result is not known.
int runHelper(const char* action, const std::string& argument) {
    constexpr std::string_view kSpecialInQuotes = "\"$`\\";
    std::string command = std::string(kHelperScript) + " " + action + " \"";
    for (const char character : argument) {
        if (kSpecialInQuotes.find(character) != std::string_view::npos) command.push_back('\\');
        command.push_back(character);
    }
    command += "\"";
    return std::system(command.c_str()) == -1 ? 0 : 1;
}

}  // namespace

int Router::initIpAddrBrenvik() {
    const std::string wan = askForAddress(kWanAddressCommand);
    const std::string lan = askForAddress(kLanAddressCommand);
    if (!wan.empty()) externalIp = wan;
    if (!lan.empty()) localIp = lan;
    if (wan.empty()) {
        logError(
            "Router::initIpAddrBrenvik - Not connected to internet. Please check network connectivity.\n");
        return 0;
    }
    return 1;
}

int Router::mapPortBrenvik(int internalPort,
                           int externalPort,
                           const std::string& protocol,
                           const std::string& description) {
    if (externalPort < 1) return 0;
    const std::string own = getLocalIp();
    loadPortListBrenvik();
    for (const _BrenvikPortIp& entry : brenvikPorts) {
        const bool covers = entry.protocol == protocol && entry.firstExternal <= externalPort &&
                            externalPort <= entry.lastExternal;
        if (!covers) continue;
        if (entry.owner == kOwnerOther) return 0;
        if (entry.localIp == own) return 1;
    }
    return runHelper("add", protocol + "," + std::to_string(externalPort) + "," + own + "," +
                                std::to_string(internalPort) + "," + description);
}

int Router::unmapPortBrenvik(int internalPort, int externalPort, const std::string& protocol) {
    if (externalPort == 0) return 1;
    return runHelper("remove", protocol + "," + std::to_string(externalPort) + "," + getLocalIp() +
                                   "," + std::to_string(internalPort));
}

void Router::unmapAllPortBrenvik(const std::string& protocol) {
    for (const _BrenvikPortIp& entry : getPortListBrenvik(protocol)) {
        // A removal names one port; the router knows an entry with a range by its first.
        unmapPortBrenvik(entry.internalPort, entry.firstExternal, protocol);
        sleep(kPauseAfterRemoval);
    }
}

std::vector<_BrenvikPortIp> Router::getPortListBrenvik(const std::string& protocol) {
    loadPortListBrenvik();
    if (brenvikPorts.empty()) return {};
    const std::string own = getLocalIp();
    std::vector<_BrenvikPortIp> mine;
    for (const _BrenvikPortIp& entry : brenvikPorts) {
        if (entry.protocol == protocol && entry.localIp == own) mine.push_back(entry);
    }
    return mine;
}

void Router::loadPortListBrenvik() {
    brenvikPorts.clear();
    const PipeHandle list(popen(kListCommand, "re"));
    if (!list) return;
    while (const auto line = readLine(list.get())) {
        if (const auto entry = parseEntry(*line)) brenvikPorts.push_back(*entry);
    }
}

}  // namespace pelorus
