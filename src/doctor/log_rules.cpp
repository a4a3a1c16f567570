#include "doctor/log_rules.h"

#include <algorithm>
#include <unordered_map>

namespace pelorus::doctor {

LogRule& LogRule::happens(LogEvent what) {
    event = what;
    return *this;
}

LogRule& LogRule::sets(Sign sign, std::string_view fact) {
    set.push_back(sign);
    words = fact;
    return *this;
}

LogRule& LogRule::clears(std::vector<Sign> signs) {
    cleared = std::move(signs);
    return *this;
}

LogRule& LogRule::keeps(Kept what, std::size_t value) {
    kept = what;
    keptValue = value;
    return *this;
}

LogRule& LogRule::unless(Sign sign) {
    exception = sign;
    return *this;
}

LogRule& LogRule::onlyIf(std::size_t value, std::string_view is) {
    condition = {value, is};
    return *this;
}

namespace {

constexpr std::string_view kConversionEnds = "dsu";
// Some system loggers cut a line at 256 bytes, stamp and name included.
constexpr std::size_t kShortestCut = 200;

LogRule ruleFor(int severity, std::string_view text) {
    LogRule rule;
    rule.severity = severity;
    rule.text = text;
    rule.beginning = std::min(text.find('%'), text.size());
    return rule;
}

LogRule alert(std::string_view text) {
    return ruleFor(1, text);
}

LogRule error(std::string_view text) {
    return ruleFor(3, text);
}

LogRule warning(std::string_view text) {
    return ruleFor(4, text);
}

LogRule notice(std::string_view text) {
    return ruleFor(5, text);
}

LogRule info(std::string_view text) {
    return ruleFor(6, text);
}

const std::vector<Sign> kService{Sign::LOGGED_SERVICE_UNRESOLVED, Sign::LOGGED_SERVICE_UNREACHABLE,
                                 Sign::LOGGED_SERVICE_SILENT, Sign::LOGGED_SERVICE_CERTIFICATE};
const std::vector<Sign> kGateway{Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS,
                                 Sign::LOGGED_NO_ADDRESS};
const std::vector<Sign> kRefusals{Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER};
const std::vector<Sign> kTunnel{Sign::LOGGED_RELAY_DOES_NOT_COME_UP, Sign::LOGGED_TUNNEL_NO_OUTPUT,
                                Sign::LOGGED_TUNNEL_DIED};
const std::vector<Sign> kNames{Sign::LOGGED_NAMES_LEAD_ELSEWHERE, Sign::LOGGED_NAMES_UNRESOLVED};
const std::vector<Sign> kBackEnd{Sign::LOGGED_BACK_END_SILENT, Sign::LOGGED_BACK_END_REFUSES};

constexpr std::string_view kNoBackEnd = "the local back end does not answer";
constexpr std::string_view kBackEndRefuses = "the local back end refuses what it is told";
constexpr std::string_view kWait = "the service asked to wait {wait} s|the service asked to wait";
constexpr std::string_view kNoCredentials = "device id or authorisation is missing";
constexpr std::string_view kDiffer = "the public names do not lead to one address";
constexpr std::string_view kUnresolved = "a public name does not resolve";

using Rules = std::vector<LogRule>;

// clang-format off
Rules lifeRules() {
    return {
    alert("main - syslog severity level set to %d.").happens(LogEvent::ANNOUNCED),
    notice("main - %s daemon starting up, Version: [%s]").happens(LogEvent::STARTED),
    error("main - config file failed to load.").happens(LogEvent::START_FAILED)
        .sets(Sign::LOGGED_START_FAILED, "the settings could not be read at the start: {file}|the settings could not be read at the start"),
    error("GlobalConfig::loadConfig() - failed to open dynamic config settings file: %s").keeps(Kept::FILE),
    error("GlobalConfig::loadConfig() - failed to create temporary dynamic config file: %s").keeps(Kept::FILE),
    error("GlobalConfig::loadConfig() - failed to write temporary dynamic config file: %s").keeps(Kept::FILE),
    error("GlobalConfig::loadConfig() - failed to open config file: [%s].").keeps(Kept::FILE),
    error("GlobalConfig::loadConfigSettings() - failed to open config file: [%s].").keeps(Kept::FILE),
    error("GlobalConfig::loadConfig() - failed to open dynamic config settings file: [%s].").keeps(Kept::FILE),
    error("GlobalConfig::loadConfig() - failed to open temp dynamic config settings file: [%s].").keeps(Kept::FILE),
    error("sigTrap - Received SIGINT signal.").happens(LogEvent::SIGNALLED),
    error("sigTrap - Received SIGQUIT signal.").happens(LogEvent::SIGNALLED),
    error("sigTrap - Received SIGTERM signal.").happens(LogEvent::SIGNALLED),
    notice("DaemonControl::disableRemoteAccess - remote access is disabled.").happens(LogEvent::SWITCHED_OFF),
    info("DaemonControl::run - Remote access disabled.").happens(LogEvent::ENDED),
    error("GlobalConfig::getProperty() - failed to stat TEMP dynamic config file").happens(LogEvent::COPY_MISSING),
    info("Getting path for dynamic config file."),
    };
}

Rules cycleRules() {
    return {
    info("ConnectionManager::createConnection() - checking status & attempting direct connection.").happens(LogEvent::CYCLE)
        .clears({Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS}),
    info("DaemonControl::run - retry connection after %d secs.").happens(LogEvent::CYCLE_ENDS).clears({Sign::LOGGED_ATTEMPT}),
    info("DaemonControl::run - sleep %d secs.").happens(LogEvent::CYCLE_ENDS).clears({Sign::LOGGED_ATTEMPT}),
    info("ConnectionManager::createConnection() - Deviceid and DeviceAuth is empty. Idle Process.").happens(LogEvent::IDLE)
        .sets(Sign::LOGGED_CREDENTIALS_MISSING, kNoCredentials).clears({Sign::LOGGED_ATTEMPT}),
    error("TavikClient::initialize() - failed to read DEVICEID, DEVICEAUTH from dynamic config file").happens(LogEvent::IDLE)
        .sets(Sign::LOGGED_CREDENTIALS_MISSING, kNoCredentials).clears({Sign::LOGGED_ATTEMPT}),
    info("ConnectionManager::createConnection() - port-forwarding failed, [attempting relay connection].").happens(LogEvent::PORTS_LOST),
    info("TavikClient::updateLocalCommStatus - Update COMMUNICATION status : [%s].").happens(LogEvent::STATUS),
    info("ConnectionManager::createDirectConnection - Current Status in file system: [%s].").happens(LogEvent::STATUS_THERE)
        .clears({Sign::LOGGED_CREDENTIALS_MISSING, Sign::LOGGED_MANUAL_PORT_INVALID, Sign::LOGGED_MANUAL_RULED_OUT}),
    info("ConnectionManager::createConnection() - connection type changed to %d,").happens(LogEvent::TYPE),
    info("ConnectionManager::createConnection() - connection type %d un-changed.").happens(LogEvent::TYPE),
    };
}

Rules gatewayRules() {
    return {
    error("Router::initLocalIP() - failed to retrieve local IPv4 or IPv6")
        .sets(Sign::LOGGED_NO_ADDRESS, "no network interface of the device has an address"),
    info("Router::initLocalIP() - IPv4: [%s]").clears({Sign::LOGGED_NO_ADDRESS}),
    info("Router::upnp_discover - failed to get External IP address, ipStatus: %d")
        .sets(Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, "the gateway has no internet address, or does not tell it (UPnP status {1})"),
    error("Router::upnp_discover - UPnP Discover failed to return any response.").happens(LogEvent::UPNP_SILENT),
    info("Router::natpmp_discover - failed to get External IP address").happens(LogEvent::NATPMP_SILENT).unless(Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS)
        .sets(Sign::LOGGED_NO_GATEWAY, "no gateway answers UPnP or NAT-PMP"),
    info("Router::upnp_discover - Router's external IP address: %s").keeps(Kept::GATEWAY).clears(kGateway),
    info("Router::natpmp_discover - Router's external IP address: %s").keeps(Kept::GATEWAY).clears(kGateway)
        .happens(LogEvent::NATPMP_FOUND),
    notice("Router::upnp_discover - Router's external IP address has changed!").clears(kGateway),
    notice("Router::natpmp_discover - Router's external IP address has changed!").clears(kGateway).happens(LogEvent::NATPMP_FOUND),
    error("Router::initIpAddrBrenvik - Not connected to internet.").happens(LogEvent::ADDRESS_LOST)
        .sets(Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, "the router has no internet address"),
    info("ConnectionManager::createDirectConnection - Elapsed time %jd, portTestInterval %jd, allocatedHttpPort %d, allocatedHttpsPort %d.")
        .clears(kGateway),
    notice("ConnectionManager::createDirectConnection - Resetting HTTP allocated ports").happens(LogEvent::AUTOMATIC),
    info("ConnectionManager::forwardPort - forwarding internal port: %d").happens(LogEvent::AUTOMATIC)
        .clears({Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER, Sign::LOGGED_PORT_OPENED}),
    info("Router::mapPort() - success - external port: %d has been mapped").clears(kRefusals)
        .sets(Sign::LOGGED_PORT_OPENED, "port {1} was opened"),
    info("Router::mapPort() - internal port: %d is already mapped to another IP: %s").unless(Sign::LOGGED_PORT_OPENED)
        .sets(Sign::LOGGED_PORT_HELD_BY_OTHER, "the port wanted for internal port {1} leads to {2}|another device has the port wanted for internal port {1}"),
    info("Router::mapPort() - fail - failed to map external port: %d, to internal port: %d, status: %d").unless(Sign::LOGGED_PORT_OPENED)
        .sets(Sign::LOGGED_GATEWAY_REFUSES, "the gateway refuses port {1} (UPnP error {3})"),
    info("Router::mapPort() - fail - failed to map external port: %d, to internal port: %d").unless(Sign::LOGGED_PORT_OPENED)
        .sets(Sign::LOGGED_GATEWAY_REFUSES, "the gateway refuses port {1} (NAT-PMP)"),
    error("CMnatpmp::portMappingRequest  failed to map public port %d to localport %d, protocol %d, lifetime %u").onlyIf(4, "0"),
    error("CMnatpmp::portMappingRequest  failed to map public port %d to localport %d, protocol %d, lifetime %u").unless(Sign::LOGGED_PORT_OPENED)
        .sets(Sign::LOGGED_GATEWAY_REFUSES, "the gateway refuses port {1} (NAT-PMP)").happens(LogEvent::NATPMP_REFUSES),
    };
}

Rules testRules() {
    return {
    info("TavikClient::testPort - hard disk is asleep.")
        .sets(Sign::LOGGED_TEST_SKIPPED_DISK, "the port test was skipped because the disk is asleep"),
    error("TavikClient::checkHddStandByMode - failed to get open Ostrel sleep count file.")
        .sets(Sign::LOGGED_TEST_SKIPPED_DISK, "the port test was skipped: nothing tells how long the disk was unused"),
    info("TavikClient::testPort - server has requested sleep.")
        .sets(Sign::LOGGED_SERVICE_WAIT, kWait),
    info("TavikClient::testPort[1-3] - Port Test URL: [%s]").keeps(Kept::PORT)
        .clears({Sign::LOGGED_TEST_SKIPPED_DISK, Sign::LOGGED_SERVICE_WAIT, Sign::LOGGED_CREDENTIALS_MISSING}),
    notice("TavikClient::testPort[%d] - httpGet got %s, %d bytes from central server.").happens(LogEvent::TEST_ANSWER),
    error("TavikClient::testPort[%d] - httpGet for %s, no response from central server.").happens(LogEvent::TEST_UNANSWERED),
    error("TavikClient::testPort - Enforce connection as RELAY (double-NAT detected")
        .sets(Sign::LOGGED_SECOND_NAT, "the gateway says {gateway}, the service sees {service}|the service sees another address than the gateway's")
        .clears({Sign::LOGGED_TEST_FAILED}).happens(LogEvent::PORTS_LOST),
    info("TavikClient::testPort - Requested external IP: [%s] / Respond remote external IP: [%s].").keeps(Kept::GATEWAY),
    info("TavikClient::testPort - Response remote external IP: [%s].").keeps(Kept::SERVICE),
    error("TavikClient::testPort[%d] - port check failed, retrying in %d seconds, url:  [%s]").keeps(Kept::PORT, 3).happens(LogEvent::TEST_RETRIED),
    error("TavikClient::testPort - port map check failed.").happens(LogEvent::TEST_FAILED),
    info("TavikClient::testPort - port map check success.").clears({Sign::LOGGED_TEST_FAILED, Sign::LOGGED_SECOND_NAT, Sign::LOGGED_OTHER_DEVICE}),
    info("TavikClient::testPort - PORT TEST RESPONSE, GOT EXTERNAL IP: [%s], start:").keeps(Kept::TESTED),
    error("TavikClient::testPort - Port test response Device ID '%s' is different")
        .happens(LogEvent::PORTS_LOST).sets(Sign::LOGGED_OTHER_DEVICE, "another device answered the port test"),
    error("TavikClient::testPort - Port test response contains empty request device ID")
        .happens(LogEvent::PORTS_LOST).sets(Sign::LOGGED_OTHER_DEVICE, "what answered the port test did not say that it is this device"),
    error("TavikClient curlRcvData - Buffer overrun detected, read buffer too small")
        .sets(Sign::LOGGED_SERVICE_NONSENSE, "an answer was longer than any that the service gives"),
    error("ConnectionManager::manualPortForward - bad value for manually configured HTTP Port.")
        .sets(Sign::LOGGED_MANUAL_PORT_INVALID, "the manual HTTP port is not a port number").happens(LogEvent::MANUAL),
    error("ConnectionManager::manualPortForward - bad value for manually configured HTTPS Port.")
        .sets(Sign::LOGGED_MANUAL_PORT_INVALID, "the manual HTTPS port is not a port number").happens(LogEvent::MANUAL),
    info("ConnectionManager::manualPortForward - allocatedHttpPort %d").happens(LogEvent::MANUAL).clears({Sign::LOGGED_MANUAL_PORT_INVALID}),
    info("ConnectionManager::manualPortForward - relay mode is enforced, therefore don't manual forward ports.")
        .sets(Sign::LOGGED_MANUAL_RULED_OUT, "manual ports are not tested since a second router was found"),
    info("ConnectionManager::manualPortForward - Running port test for manually forwarded ports.")
        .clears({Sign::LOGGED_MANUAL_RULED_OUT, Sign::LOGGED_CREDENTIALS_MISSING}),
    };
}

Rules serviceRules() {
    return {
    error("TavikClient::httpGet  Error: [%s]").keeps(Kept::ERROR),
    info("TavikClient::pollServerForSleepTime - sleep time from server is %d secs.").keeps(Kept::WAIT).clears(kService),
    info("TavikClient::pollServerForSleepTime - central server gave permission to proceed.")
        .clears({Sign::LOGGED_SERVICE_UNRESOLVED, Sign::LOGGED_SERVICE_UNREACHABLE, Sign::LOGGED_SERVICE_SILENT,
                 Sign::LOGGED_SERVICE_WAIT}),
    info("TavikClient::pollServerForSleepTime - received garbage sleep time")
        .sets(Sign::LOGGED_SERVICE_NONSENSE, "the service's answer about waiting is not understood"),
    info("TavikClient::pollServerForSleepTime - malformed wait_time")
        .sets(Sign::LOGGED_SERVICE_NONSENSE, "the service's answer about waiting is not understood"),
    info("TavikClient::pollServerForSleepTime - missing action")
        .sets(Sign::LOGGED_SERVICE_NONSENSE, "the service's answer about waiting is not understood"),
    error("TavikClient::pollServerForSleepTime - httpGet for %s, failed to get response").happens(LogEvent::SERVICE_FAILED),
    info("TavikClient::getMyIP - server has requested sleep %d seconds.").keeps(Kept::WAIT)
        .sets(Sign::LOGGED_SERVICE_WAIT, kWait),
    error("TavikClient::getMyIP - httpGet failed to get response from central server").happens(LogEvent::SERVICE_FAILED),
    info("TavikClient::getMyIP - httpGet Response [%d bytes]").clears(kService),
    error("TavikClient::updateServerMapping - httpGet failed to get response from central server").happens(LogEvent::SERVICE_FAILED),
    notice("TavikClient::updateServerMapping - httpGet got %s, %d bytes.").happens(LogEvent::PUBLISHED).clears(kService),
    error("TavikClient::deleteServerMapping - httpGet failed to get response from central server").happens(LogEvent::SERVICE_FAILED),
    notice("TavikClient::deleteServerMapping - httpGet got %s, %d bytes.").happens(LogEvent::WITHDRAWN).clears(kService),
    error("TavikClient::updateRemoteCommStatus - httpGet failed to get response from central server").happens(LogEvent::SERVICE_FAILED),
    notice("TavikClient::updateRemoteCommStatus - httpGet got %s. %d bytes").clears(kService),
    error("ConnectionManager::createDirectConnection() - failed to update mapping info").happens(LogEvent::PUBLISHING_FAILED)
        .sets(Sign::LOGGED_PUBLISHING_FAILED, "the ports that passed their test could not be published"),
    error("ConnectionManager::manualPortForward - failed to update port mapping on server.").happens(LogEvent::PUBLISHING_FAILED)
        .sets(Sign::LOGGED_PUBLISHING_FAILED, "the manual ports could not be published"),
    };
}

Rules backEndRules() {
    return {
    error("TavikClient::updateLocalCommStatus - failed to get response from localhost").sets(Sign::LOGGED_BACK_END_SILENT, kNoBackEnd),
    error("TavikClient::updateServerMapping - failed to get response from localhost").sets(Sign::LOGGED_BACK_END_SILENT, kNoBackEnd),
    error("TavikClient::deleteServerMapping - failed to get response from localhost").sets(Sign::LOGGED_BACK_END_SILENT, kNoBackEnd),
    error("TavikClient::updateRemoteCommStatus - failed to get response from local server").sets(Sign::LOGGED_BACK_END_SILENT, kNoBackEnd),
    error("TavikClient::updateLocalCommStatus - failure response received from localhost")
        .sets(Sign::LOGGED_BACK_END_REFUSES, kBackEndRefuses).clears({Sign::LOGGED_BACK_END_SILENT}),
    error("TavikClient::updateServerMapping - failure response received from localhost")
        .sets(Sign::LOGGED_BACK_END_REFUSES, kBackEndRefuses).clears({Sign::LOGGED_BACK_END_SILENT}),
    error("TavikClient::deleteServerMapping - failure response received from localhost")
        .sets(Sign::LOGGED_BACK_END_REFUSES, kBackEndRefuses).clears({Sign::LOGGED_BACK_END_SILENT}),
    error("Response: %s").happens(LogEvent::BACK_END_SAID),
    info("TavikClient::updateLocalCommStatus - Successful update status.").clears(kBackEnd),
    info("ConnectionManager::createRelayConnection() - deleted port mappings from server.").clears(kBackEnd),
    notice("ConnectionManager::killConnection() - successfully deleted port mappings on central server.").clears(kBackEnd),
    };
}

Rules relayRules() {
    return {
    notice("VPNManager::openVPNConnection() - httpGet openvpn client relay servers").happens(LogEvent::RELAY_STARTS)
        .sets(Sign::LOGGED_ATTEMPT, "the tunnel's client was started, with no result yet")
        .clears({Sign::LOGGED_SERVICE_WAIT, Sign::LOGGED_CREDENTIALS_MISSING}),
    info("VPNManager::openVPNConnection() - openVPN has started successfully").happens(LogEvent::RELAY_UP).clears(kTunnel),
    info("VPNManager::openVPNConnection() - openVPN is already running").happens(LogEvent::RELAY_UP).clears(kTunnel),
    info("ConnectionManager::createRelayConnection() - openVPN process is running.").happens(LogEvent::RELAY_UP).clears(kTunnel),
    info("ConnectionManager::createRelayConnection() - server requested sleep, therefore openVPN will not be started")
        .sets(Sign::LOGGED_SERVICE_WAIT, kWait),
    error("VPNManager::openVPNConnection() - failed to get DEVICEID and/or DEVICEAUTH settings")
        .sets(Sign::LOGGED_CREDENTIALS_MISSING, kNoCredentials),
    error("VPNManager::openVPNConnection() - failed to open VPN Auth file for write!")
        .sets(Sign::LOGGED_TUNNEL_NO_OUTPUT, "the tunnel's credentials could not be written"),
    error("VPNManager::openVPNConnection() - failed to open openVPN stdout file!")
        .sets(Sign::LOGGED_TUNNEL_NO_OUTPUT, "the tunnel's client had no output ten seconds after its start"),
    error("VPNManager::openVPNConnection() - Failed to establish VPN connection, retries exceeded")
        .sets(Sign::LOGGED_RELAY_DOES_NOT_COME_UP, "the tunnel did not come up in four starts of its client"),
    error("ConnectionManager::createRelayConnection() - failed to create VPN connection.").happens(LogEvent::RELAY_FAILED)
        .clears({Sign::LOGGED_ATTEMPT}),
    warning("VPNManager::isVPNRunning() - unlink stale openVPN pid file %s").happens(LogEvent::TUNNEL_DIED),
    };
}

Rules nameRules() {
    return {
    error("ConnectionManager::checkDNS - nslookup 3-level and/or 4-level domain name IP addresses do not exist or do not match, 3-level [%s], 4-level [%s]")
        .onlyIf(1, "").happens(LogEvent::ADDRESS_LOST).sets(Sign::LOGGED_NAMES_UNRESOLVED, kUnresolved).clears({Sign::LOGGED_NAMES_LEAD_ELSEWHERE}),
    error("ConnectionManager::checkDNS - nslookup 3-level and/or 4-level domain name IP addresses do not exist or do not match, 3-level [%s], 4-level [%s]")
        .onlyIf(2, "").happens(LogEvent::ADDRESS_LOST).sets(Sign::LOGGED_NAMES_UNRESOLVED, kUnresolved).clears({Sign::LOGGED_NAMES_LEAD_ELSEWHERE}),
    error("ConnectionManager::checkDNS - nslookup 3-level and/or 4-level domain name IP addresses do not exist or do not match, 3-level [%s], 4-level [%s]")
        .happens(LogEvent::ADDRESS_LOST).sets(Sign::LOGGED_NAMES_LEAD_ELSEWHERE, kDiffer).clears({Sign::LOGGED_NAMES_UNRESOLVED}),
    error("ConnectionManager::checkDNS - nslookup 3-level hashed domain name IP address does not exist or does not match 3-level and 4-level, 3-level [%s], 4-level [%s], 3-level hashed [%s]")
        .onlyIf(3, "").happens(LogEvent::ADDRESS_LOST).sets(Sign::LOGGED_NAMES_UNRESOLVED, kUnresolved).clears({Sign::LOGGED_NAMES_LEAD_ELSEWHERE}),
    error("ConnectionManager::checkDNS - nslookup 3-level hashed domain name IP address does not exist or does not match 3-level and 4-level, 3-level [%s], 4-level [%s], 3-level hashed [%s]")
        .happens(LogEvent::ADDRESS_LOST).sets(Sign::LOGGED_NAMES_LEAD_ELSEWHERE, kDiffer).clears({Sign::LOGGED_NAMES_UNRESOLVED}),
    error("ConnectionManager::checkDNS - DNS check failed for 4-level device domain name, DNS IP address is %s, local value of IP address is %s")
        .happens(LogEvent::ADDRESS_LOST).clears({Sign::LOGGED_NAMES_UNRESOLVED})
        .sets(Sign::LOGGED_NAMES_LEAD_ELSEWHERE, "the public names lead to {1} instead of {2}|the public names lead to another address than the published one"),
    info("ConnectionManager::checkDNS - DNS matches local value for device domain names").clears(kNames),
    };
}
// clang-format on

// The length of the number that @p text begins with; 0 if there is none.
std::size_t numberLength(std::string_view text) {
    const std::size_t sign = !text.empty() && text.front() == '-' ? 1 : 0;
    const std::size_t end = std::min(text.find_first_not_of("0123456789", sign), text.size());
    return end == sign ? 0 : end;
}

// Both begin with the same letters as far as the first conversion. Most rules go by this alone.
bool begin(std::string_view text, const LogRule& rule) {
    return text.compare(0, rule.beginning, rule.text, 0, rule.beginning) == 0;
}

// What a line begins with, mostly the name of a function: few rules share it.
std::string_view subject(std::string_view text) {
    return text.substr(0, text.find_first_of(" (["));
}

using RulesBySubject = std::unordered_map<std::string_view, std::vector<const LogRule*>>;

// In the order of the table.
const RulesBySubject& rulesBySubject() {
    static const RulesBySubject sorted = [] {
        RulesBySubject rules;
        for (const LogRule& rule : logRules()) rules[subject(rule.text)].push_back(&rule);
        return rules;
    }();
    return sorted;
}

// Fills @p values from number @p count on. A text may have in it what stands behind it in the
// pattern, and is all that is left of a line that was cut.
bool fits(std::string_view text,
          std::string_view pattern,
          LogValues& values,
          bool mayBeCut,
          std::size_t count = 0) {
    const std::size_t conversion = pattern.find('%');
    const std::string_view plain = pattern.substr(0, conversion);
    if (text.compare(0, plain.size(), plain) != 0) return false;
    if (conversion == std::string_view::npos) return true;
    text.remove_prefix(plain.size());
    const std::size_t end = pattern.find_first_of(kConversionEnds, conversion);
    if (end == std::string_view::npos || count == values.size()) return false;
    const bool isText = pattern[end] == 's';
    pattern.remove_prefix(end + 1);
    std::size_t length = numberLength(text);
    if (!isText && length == 0) return false;
    const std::string_view next = pattern.substr(0, pattern.find('%'));
    if (isText) length = next.empty() ? text.size() : text.rfind(next);
    if (length != std::string_view::npos) {
        values[count] = text.substr(0, length);
        if (fits(text.substr(length), pattern, values, mayBeCut, count + 1)) return true;
    }
    values[count] = text;
    return isText && mayBeCut;
}

}  // namespace

Kept keptNamed(std::string_view name) {
    constexpr std::array<std::pair<std::string_view, Kept>, 7> kNamed{{{"gateway", Kept::GATEWAY},
                                                                       {"service", Kept::SERVICE},
                                                                       {"tested", Kept::TESTED},
                                                                       {"port", Kept::PORT},
                                                                       {"error", Kept::ERROR},
                                                                       {"wait", Kept::WAIT},
                                                                       {"file", Kept::FILE}}};
    for (const auto& [known, kept] : kNamed) {
        if (known == name) return kept;
    }
    return Kept::NOTHING;
}

const std::vector<LogRule>& logRules() {
    static const Rules rules = [] {
        Rules all;
        for (const auto& part : {lifeRules(), cycleRules(), gatewayRules(), testRules(),
                                 serviceRules(), backEndRules(), relayRules(), nameRules()}) {
            all.insert(all.end(), part.begin(), part.end());
        }
        return all;
    }();
    return rules;
}

const LogRule* findLogRule(std::string_view text, LogValues& values) {
    values = {};
    const auto rules = rulesBySubject().find(subject(text));
    if (rules == rulesBySubject().end()) return nullptr;
    for (const LogRule* const rule : rules->second) {
        if (!begin(text, *rule)) continue;
        values = {};
        if (!fits(text, rule->text, values, text.size() >= kShortestCut)) continue;
        const auto& [value, wanted] = rule->condition;
        if (value == 0 || values[value - 1] == wanted) return rule;
    }
    return nullptr;
}

}  // namespace pelorus::doctor
