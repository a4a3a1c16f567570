#include "doctor/log_signs.h"

#include <gtest/gtest.h>

#include <map>
#include <vector>

#include "doctor/diagnosis.h"
#include "doctor/log_story.h"

namespace pelorus::doctor {
namespace {

// What the rows below call the daemon's lines.
const std::map<std::string, const char*> kLines{
    {"start", "main - pelorus daemon starting up, Version: [1.7.0], PID: [64], SID: [64]"},
    {"cycle",
     "ConnectionManager::createConnection() - checking status & attempting direct connection."},
    {"pause", "DaemonControl::run - retry connection after 120 secs."},
    {"no network", "Router::initLocalIP() - failed to retrieve local IPv4 or IPv6"},
    {"no internet", "Router::initIpAddrBrenvik - Not connected to internet."},
    {"by hand", "ConnectionManager::manualPortForward - allocatedHttpPort 0, manualHttpPort 8081"},
    {"no UPnP", "Router::upnp_discover - UPnP Discover failed to return any response."},
    {"no NAT-PMP", "Router::natpmp_discover - failed to get External IP address"},
    {"gateway", "Router::upnp_discover - Router's external IP address: 203.0.113.7"},
    {"search", "ConnectionManager::forwardPort - forwarding internal port: 80"},
    {"opened", "Router::mapPort() - success - external port: 9091 has been mapped to internal: 80"},
    {"held", "Router::mapPort() - internal port: 80 is already mapped to another IP: 192.168.1.9"},
    {"refused",
     "Router::mapPort() - fail - failed to map external port: 9091, to internal port: 80, status: "
     "718"},
    {"refused by NAT-PMP",
     "CMnatpmp::portMappingRequest  failed to map public port 9091 to localport 80, protocol 2, "
     "lifetime 3600, errno 0"},
    {"passed",
     "TavikClient::testPort[1] - httpGet got <status>Success</status>, 24 bytes from central "
     "server."},
    {"failed",
     "TavikClient::testPort[1] - httpGet got <status>failure</status>, 24 bytes from central "
     "server."},
    {"test failed", "TavikClient::testPort - port map check failed."},
    {"second NAT", "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected"},
    {"other device",
     "TavikClient::testPort - Port test response Device ID 'x' is different than y"},
    {"disk sleeps", "TavikClient::testPort - hard disk is asleep."},
    {"timeout", "TavikClient::httpGet  Error: [Timeout was reached]"},
    {"unresolved", "TavikClient::httpGet  Error: [Couldn't resolve host name]"},
    {"unanswered",
     "TavikClient::testPort[1] - httpGet for https://x, no response from central server."},
    {"missing action", "TavikClient::pollServerForSleepTime - missing action from central server."},
    {"published",
     "TavikClient::updateServerMapping - httpGet got <status>Success</status>, 24 bytes."},
    {"unpublished",
     "ConnectionManager::createDirectConnection() - failed to update mapping info for x"},
    {"withdrawn",
     "TavikClient::deleteServerMapping - httpGet got <status>Success</status>, 24 bytes."},
    {"not withdrawn",
     "TavikClient::deleteServerMapping - failed to get response from localhost for url: [x]"},
    {"back end silent",
     "TavikClient::updateLocalCommStatus - failed to get response from localhost for url: [x]"},
    {"back end refuses",
     "TavikClient::updateLocalCommStatus - failure response received from localhost for url: [x]"},
    {"no name",
     "ConnectionManager::checkDNS - nslookup 3-level and/or 4-level domain name IP addresses do "
     "not exist or do not match, 3-level [], 4-level []"},
    {"relay starts",
     "VPNManager::openVPNConnection() - httpGet openvpn client relay servers and other settings."},
    {"relay up", "VPNManager::openVPNConnection() - openVPN has started successfully"},
};

constexpr int kHour = 3600, kDay = 24 * kHour;

using Words = std::vector<const char*>;
using Logged = std::vector<std::pair<int, Words>>;  // seconds, and what is logged then

Evidence told(const Logged& log, LogStory::Ports ports = LogStory::Ports::AUTOMATIC) {
    LogStory story{ports};
    Evidence evidence;
    for (const auto& [second, words] : log) {
        evidence.now = Time{std::chrono::seconds{second}};
        for (const char* const word : words) story.take({evidence.now, kLines.at(word)});
    }
    story.finish(evidence);
    return evidence;
}

std::string causesOf(const Evidence& evidence) {
    std::string names;
    for (const NamedCause& named : findCauses(evidence, Reach::NOT_REACHED)) {
        names.append(names.empty() ? "" : ", ").append(named.cause->name);
    }
    return names;
}

const Words kSearchFails{"cycle", "gateway", "failed", "test failed", "pause"};
const Words kNoGateway{"cycle", "no UPnP", "no NAT-PMP", "pause"};
const Words kTimeouts{"timeout", "unanswered", "timeout", "unanswered", "test failed"};

TEST(LogSigns, TheLastAttemptCounts) {
    const struct {
        const char* name;
        Logged log;
        std::string causes;
    } rows[]{
        {"another device answered, then a filter",
         {{0, {"cycle", "passed", "other device", "pause"}}, {kDay, kSearchFails}},
         "port-filtered"},
        {"publishing failed, then a second router",
         {{0, {"cycle", "unpublished", "pause"}}, {120, {"cycle", "second NAT", "pause"}}},
         "second-nat"},
        {"no answer to a test, then no gateway",
         {{0, {"cycle"}}, {0, kTimeouts}, {9, {"withdrawn", "pause"}}, {120, kNoGateway}},
         "no-gateway-protocol"},
        {"no service, then no gateway",
         {{0, {"cycle", "unresolved", "unanswered", "pause"}}, {120, kNoGateway}},
         "no-gateway-protocol"},
        {"an answer that is not understood, then no gateway",
         {{0, {"cycle", "missing action", "pause"}}, {120, kNoGateway}},
         "no-gateway-protocol"},
        {"a second router, then no gateway",
         {{0, {"cycle", "second NAT", "pause"}}, {120, kNoGateway}},
         "no-gateway-protocol"},
        {"a second router, and a gateway that was silent once",
         {{0, {"cycle", "second NAT", "pause"}}, {120, kNoGateway}, {240, {"cycle", "gateway"}}},
         "second-nat"},
        {"both in one attempt, without cycles",
         {{0, {"second NAT"}}, {300, {"no UPnP"}}},
         "second-nat, no-gateway-protocol"},
        {"and in two", {{0, {"second NAT"}}, {400, {"no UPnP"}}}, "no-gateway-protocol"},
        {"a filter, and the disk sleeps since",
         {{0, kSearchFails}, {kDay, {"cycle", "gateway", "disk sleeps", "pause"}}},
         "port-filtered, disk-asleep"},
        {"one port is held by another device, the others are refused",
         {{0, {"cycle", "gateway", "held", "refused", "pause"}}},
         "gateway-refuses"},
        {"one port is filtered, the others are refused",
         {{0, {"cycle", "search", "opened", "failed", "test failed", "refused", "pause"}}},
         "port-filtered"},
        {"the port for HTTP passes, those for HTTPS are refused",
         {{0, {"cycle", "search", "opened", "passed", "search", "refused", "pause"}}},
         "gateway-refuses"},
        {"one port is filtered, the next one refused, without cycles",
         {{0, {"failed", "test failed", "refused by NAT-PMP"}}},
         "port-filtered"},
        {"NAT-PMP was there, the port closes, and no search follows",
         {{0, {"start", "no UPnP", "passed", "published"}},
          {kDay, {"no UPnP", "failed", "test failed", "withdrawn", "relay starts"}},
          {2 * kDay, {"no UPnP"}}},
         "no-gateway-protocol"},
        {"NAT-PMP is there, and the search finds filtered ports only",
         {{0, {"start", "no UPnP", "passed", "published"}},
          {kDay, {"no UPnP", "failed", "test failed", "no UPnP", "failed", "test failed"}},
          {kDay, {"withdrawn", "relay starts"}}},
         "port-filtered, settling"},
        {"no UPnP, and NAT-PMP refuses",
         {{0, {"no UPnP", "refused by NAT-PMP"}}},
         "gateway-refuses"},
        {"a start, and nothing since", {{0, {"start"}}, {1000, {"search"}}}, ""},
        {"one port is refused, the next one filtered",
         {{0, {"refused by NAT-PMP", "failed", "test failed"}}},
         "port-filtered"},
        {"and the next one after it not answered",
         {{0, {"refused by NAT-PMP", "timeout", "unanswered", "test failed"}}},
         "service-silent"},
        {"no network once",
         {{0, {"no network"}}, {kDay, {"passed", "failed", "test failed"}}},
         "port-filtered"},
        {"no network once, of which nothing more is logged",
         {{0, {"no network"}}, {kDay, {"disk sleeps"}}},
         "disk-asleep"},
        {"no internet once", {{0, {"no internet"}}, {60, {"passed", "second NAT"}}}, "second-nat"},
        {"no name once, a day ago", {{0, {"no name"}}, {26 * kHour, {"second NAT"}}}, "second-nat"},
        {"no name since the look of today",
         {{0, {"no name"}}, {24 * kHour, {"no name"}}, {40 * kHour, {"second NAT"}}},
         "second-nat, names-unresolved"},
        {"no name, and the look after a change of the type is not logged",
         {{0, {"start", "relay starts"}},
          {kDay, {"no name"}},
          {kDay + 20, {"published"}},
          {kDay + kHour, {"passed"}}},
         ""},
        {"no name, and no look since, as the type is the same",
         {{0, {"start", "published"}},
          {kDay, {"no name"}},
          {kDay + 20, {"published"}},
          {kDay + kHour, {"passed"}}},
         "names-unresolved"},
        {"the back end was silent at the start, and took the record later",
         {{0, {"timeout", "back end silent"}},
          {5, {"published"}},
          {300, {"failed", "test failed"}}},
         "port-filtered"},
        {"the back end refused at the start, and dropped the record later",
         {{0, {"back end refuses"}}, {5, {"withdrawn", "second NAT"}}},
         "second-nat"},
        {"the back end is still silent",
         {{0, {"back end silent"}}, {5, {"withdrawn", "timeout", "not withdrawn", "second NAT"}}},
         "back-end-silent, second-nat"},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(causesOf(told(row.log)), row.causes) << row.name;
    }
}

// Ports forwarded by hand are tested whether or not there is a gateway.
TEST(LogSigns, AGatewayReplacesNoTestOfPortsForwardedByHand) {
    Evidence evidence = told({{0, {"cycle", "failed", "test failed", "pause"}}, {120, kNoGateway}},
                             LogStory::Ports::MANUAL);
    evidence.add(Sign::MANUAL_MODE, Source::SETTINGS, "ports are forwarded by hand");
    EXPECT_EQ(causesOf(evidence), "manual-ports-closed, no-gateway-protocol");
}

TEST(LogSigns, AFactHasTheTimeOfTheLastLineThatShowsIt) {
    const Evidence evidence = told({{0, {"second NAT"}}, {100, {"second NAT"}}});
    EXPECT_EQ(evidence.signs.at(Sign::LOGGED_SECOND_NAT).when, Time{std::chrono::seconds{100}});
}

TEST(LogSigns, AChangeHasTheReasonOfItsOwnAttempt) {
    const struct {
        const char* name;
        Logged log;
        std::string cause;  // of the last period
    } rows[]{
        {"no name long ago",
         {{0, {"start", "no name", "published"}},
          {kDay, {"passed", "second NAT", "withdrawn", "relay starts"}},
          {kDay + 400, {"second NAT"}}},
         "a second router: the service sees another address than the gateway's"},
        {"no gateway until the ports passed again",
         {{0, {"start", "passed", "published"}},
          {kDay, {"no UPnP", "failed", "test failed", "passed", "published"}},
          {kDay + 200, {"second NAT", "withdrawn", "relay starts", "relay up"}}},
         "a second router: the service sees another address than the gateway's"},
        {"no name, then a filter",
         {{0, {"start", "no name", "failed", "test failed", "relay starts", "relay up"}}},
         "the service could not reach the port"},
        {"one port is held, the others are refused",
         {{0, {"start", "held", "refused", "relay starts", "relay up"}}},
         "the gateway refuses port 9091 (UPnP error 718)"},
        {"no gateway, and a failed test of ports forwarded by hand",
         {{0, {"start", "by hand", "no UPnP", "failed", "test failed"}},
          {9, {"relay starts", "relay up"}}},
         "the service could not reach the port"},
        {"a back end that was silent before it dropped the record",
         {{0, {"start", "back end silent"}},
          {5, {"second NAT", "withdrawn", "relay starts", "relay up"}}},
         "a second router: the service sees another address than the gateway's"},
        {"a test without an answer, after which the service is there again",
         {{0, {"start", "passed", "published"}},
          {kDay, kTimeouts},
          {kDay + 9, {"withdrawn", "relay starts", "relay up"}}},
         "no answer from the service: Timeout was reached"},
        {"the next port is tested, and the service answers",
         {{0, {"start", "passed", "published"}},
          {kDay, kTimeouts},
          {kDay + 9, {"failed", "test failed", "withdrawn", "relay starts", "relay up"}}},
         "the service could not reach the port"},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(told(row.log).history.back().cause, row.cause) << row.name;
    }
}

}  // namespace
}  // namespace pelorus::doctor
