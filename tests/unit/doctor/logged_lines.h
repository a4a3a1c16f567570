// Lines that the daemon logs, and what the doctor makes of them.
#ifndef PELORUS_UNIT_DOCTOR_LOGGED_LINES_H
#define PELORUS_UNIT_DOCTOR_LOGGED_LINES_H

#include <string>
#include <utility>
#include <vector>

#include "doctor/log_story.h"

namespace pelorus::doctor {

inline constexpr const char *
    kStart = "main - pelorus daemon starting up, Version: [1.7.0], PID: [64], SID: [64]",
   *kNoUpnp = "Router::upnp_discover - UPnP Discover failed to return any response.",
   *kNoNatpmp = "Router::natpmp_discover - failed to get External IP address",
   *kTunnelStarts =
       "VPNManager::openVPNConnection() - httpGet openvpn client relay servers and other settings.",
   *kTunnelUp = "VPNManager::openVPNConnection() - openVPN has started successfully",
   *kPause = "DaemonControl::run - retry connection after 120 secs.",
   *kPassed =
       "TavikClient::testPort[1] - httpGet got <port_test><status>Success</status>"
       "<external_ip>203.0.113.7</external_ip></port_test>, 90 bytes from central server.",
   *kFailedAnswer =
       "TavikClient::testPort[1] - httpGet got <port_test><status>failure</status></port_test>, 52 "
       "bytes from central server.",
   *kSecondNatAnswer =
       "TavikClient::testPort[1] - httpGet got <port_test><status>failure</status><remote_external_ip>"
       "203.0.113.7</remote_external_ip><external_ip>100.64.3.9</external_ip></port_test>, 90 bytes "
       "from central server.",
   *kSecondNat =
       "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected: Server-returned "
       "external IP != router's external IP).",
   *kPublished =
       "TavikClient::updateServerMapping - httpGet got <status>Success</status>, 24 bytes.",
   *kRefused =
       "CMnatpmp::portMappingRequest  failed to map public port 9536 to localport 443, protocol 2, "
       "lifetime 3600, errno 0",
   *kNoPort = "ConnectionManager::manualPortForward - bad value for manually configured HTTP Port.",
   *kStatusDirect =
       "TavikClient::updateLocalCommStatus - Update COMMUNICATION status : [portforwarded].",
   *kStatusFailed = "TavikClient::updateLocalCommStatus - Update COMMUNICATION status : [failed].",
   *kTestFailed = "TavikClient::testPort - port map check failed.",
   *kRelayFailed = "ConnectionManager::createRelayConnection() - failed to create VPN connection.",
   *kStaleTunnel = "VPNManager::isVPNRunning() - unlink stale openVPN pid file /run/openvpn.pid",
   *kCopyMissing = "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [x]",
   *kSigterm = "sigTrap - Received SIGTERM signal.",
   *kOff = "DaemonControl::disableRemoteAccess - remote access is disabled.",
   *kSecondNatFact = "the gateway says 100.64.3.9, the service sees 203.0.113.7";

using Lines = std::vector<std::pair<int, const char*>>;  // seconds, and what is logged then

inline Time at(int seconds) {
    return Time{std::chrono::seconds{seconds}};
}

inline Evidence told(const Lines& lines, int now, bool fromElsewhere = false) {
    LogStory story{fromElsewhere ? LogStory::Ports::UNKNOWN : LogStory::Ports::AUTOMATIC};
    for (const auto& [second, text] : lines) story.take({at(second), text});
    Evidence evidence;
    evidence.fromElsewhere = fromElsewhere;
    evidence.now = at(now);
    story.finish(evidence);
    return evidence;
}

// "0 RELAYED: cause|...".
inline std::string historyOf(const Evidence& evidence) {
    constexpr const char* kNames[]{"direct", "relayed", "not reached", "off", "not running", "?"};
    std::string text;
    for (const Period& period : evidence.history) {
        text += std::to_string(period.since.time_since_epoch().count()) + " " +
                kNames[static_cast<int>(period.reach)] +
                (period.address.empty() ? "" : " " + period.address) + ": " + period.cause + "|";
    }
    return text;
}

}  // namespace pelorus::doctor

#endif
