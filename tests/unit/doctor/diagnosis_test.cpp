#include "doctor/diagnosis.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace pelorus::doctor {
namespace {

using S = Sign;

struct Seen {
    const char* name;
    const char* statusWord;  // of the settings; null: they could not be read
    std::vector<Sign> signs;
    Reach reach;
    std::string cause;  // the first; empty for none
    int status;
};

Evidence evidenceOf(const Seen& seen) {
    Evidence evidence;
    if (seen.statusWord != nullptr) {
        evidence.statusWord = seen.statusWord;
    } else {
        evidence.unreadSettings = "the settings need root";
    }
    for (const Sign sign : seen.signs) {
        evidence.add(sign, sign < S::LOGGED_START_FAILED ? Source::NOW : Source::LOG, "fact");
    }
    return evidence;
}

std::string_view firstCause(const Diagnosis& diagnosis) {
    return diagnosis.causes.empty() ? "" : diagnosis.causes.front().cause->name;
}

// What the lab's scenarios do not show, or only together with other things.
const std::vector<Seen> kSeen{
    {"trouble that may not matter, without settings",
     nullptr,
     {S::DAEMON_RUNS, S::NO_GATEWAY_ANSWERS, S::TUNNEL_DEVICE_MISSING},
     Reach::UNKNOWN,
     "",
     3},
    {"no word yet", "", {S::DAEMON_RUNS}, Reach::NOT_REACHED, "", 2},
    {"a failed test without settings",
     nullptr,
     {S::DAEMON_RUNS, S::LOGGED_TEST_FAILED},
     Reach::UNKNOWN,
     "port-filtered",
     3},
    {"no route",
     "portforwarded",
     {S::DAEMON_RUNS, S::NO_DEFAULT_ROUTE},
     Reach::NOT_REACHED,
     "no-network",
     2},
    {"no route in the usual table, but the service is reached",
     "portforwarded",
     {S::DAEMON_RUNS, S::NO_DEFAULT_ROUTE, S::SERVICE_REACHED},
     Reach::DIRECT,
     "",
     0},
    {"no address in the log",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_NO_ADDRESS},
     Reach::NOT_REACHED,
     "no-network",
     2},
    {"an address since the log",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_NO_ADDRESS, S::HAS_ADDRESS},
     Reach::NOT_REACHED,
     "settling",
     2},
    {"shared address that the service sees through",
     "relayed",
     {S::TUNNEL_RUNS, S::GATEWAY_ADDRESS_SHARED, S::LOGGED_SECOND_NAT},
     Reach::RELAYED,
     "second-nat",
     1},
    {"back end that does not take the ports",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_PUBLISHING_FAILED, S::LOGGED_BACK_END_SILENT},
     Reach::NOT_REACHED,
     "back-end-silent",
     2},
    {"direct by hand, but the service does not reach it",
     "portforwarded",
     {S::DAEMON_RUNS, S::MANUAL_MODE, S::PORT_TEST_FAILS},
     Reach::NOT_REACHED,
     "manual-ports-closed",
     2},
    {"the service sees another address, and no port was tested",
     "portforwarded",
     {S::DAEMON_RUNS, S::SERVICE_SEES_OTHER_ADDRESS},
     Reach::NOT_REACHED,
     "second-nat",
     2},
    {"the service sees another address, but reaches the port",
     "portforwarded",
     {S::DAEMON_RUNS, S::SERVICE_SEES_OTHER_ADDRESS, S::PORT_TEST_PASSES},
     Reach::DIRECT,
     "",
     0},
    {"a failed test that passes now",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_TEST_FAILED, S::LOGGED_OTHER_DEVICE, S::PORT_TEST_PASSES},
     Reach::NOT_REACHED,
     "settling",
     2},
    {"a test without an answer that fails now",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_TEST_UNANSWERED, S::PORT_TEST_FAILS},
     Reach::NOT_REACHED,
     "port-filtered",
     2},
    {"direct, but the gateway's address is shared by now",
     "portforwarded",
     {S::DAEMON_RUNS, S::GATEWAY_ADDRESS_SHARED},
     Reach::NOT_REACHED,
     "shared-address",
     2},
    {"direct, and an access point says that its address is private",
     "portforwarded",
     {S::DAEMON_RUNS, S::GATEWAY_ADDRESS_PRIVATE, S::GATEWAY_ELSEWHERE},
     Reach::DIRECT,
     "",
     0},
    {"direct, but the line is down",
     "portforwarded",
     {S::DAEMON_RUNS, S::GATEWAY_WITHOUT_ADDRESS, S::SERVICE_UNRESOLVED},
     Reach::NOT_REACHED,
     "gateway-without-address",
     2},
    {"direct, and a slow gateway",
     "portforwarded",
     {S::DAEMON_RUNS, S::NO_GATEWAY_ANSWERS, S::GATEWAY_SILENT, S::SERVICE_REACHED},
     Reach::DIRECT,
     "",
     0},
    {"direct, but nothing answers, within or without",
     "portforwarded",
     {S::DAEMON_RUNS, S::NO_GATEWAY_ANSWERS, S::SERVICE_UNRESOLVED, S::RELAY_CLIENT_MISSING},
     Reach::NOT_REACHED,
     "service-unresolved",
     2},
    {"direct, a deaf gateway, and the service is down",
     "portforwarded",
     {S::DAEMON_RUNS, S::NO_GATEWAY_ANSWERS, S::SERVICE_UNREACHABLE},
     Reach::DIRECT,
     "service-unreachable",
     0},
    {"direct, but the mappings are gone, and the relay would fail",
     "portforwarded",
     {S::DAEMON_RUNS, S::OUR_MAPPINGS_MISSING, S::NO_PORT_MAPPED, S::RELAY_CLIENT_MISSING},
     Reach::NOT_REACHED,
     "mapping-lost",
     2},
    {"direct, and one of two ports is silent",
     "portforwarded",
     {S::DAEMON_RUNS, S::WEB_SERVER_SILENT},
     Reach::DIRECT,
     "web-server-silent",
     0},
    {"a second router by the log, and no address told now",
     "relayed",
     {S::TUNNEL_RUNS, S::GATEWAY_WITHOUT_ADDRESS, S::SERVICE_REACHED, S::LOGGED_SECOND_NAT},
     Reach::RELAYED,
     "second-nat",
     1},
    {"direct by hand behind a shared address",
     "portforwarded",
     {S::DAEMON_RUNS, S::MANUAL_MODE, S::GATEWAY_ADDRESS_SHARED, S::WEB_SERVER_SILENT,
      S::NO_WEB_SERVER},
     Reach::DIRECT,
     "",
     0},
    {"relayed by the client's word, but the tunnel is down",
     "relayed",
     {S::TUNNEL_RUNS, S::NO_TUNNEL_INTERFACE, S::TUNNEL_UNANSWERED, S::NO_GATEWAY_ANSWERS},
     Reach::NOT_REACHED,
     "relay-does-not-come-up",
     2},
    {"a tunnel that had trouble, and is up",
     "relayed",
     {S::TUNNEL_RUNS, S::NO_TUNNEL_INTERFACE, S::TUNNEL_UNANSWERED, S::TUNNEL_SAYS_UP},
     Reach::RELAYED,
     "",
     1},
    {"a tunnel in trouble whose interface was not looked at",
     "relayed",
     {S::TUNNEL_RUNS, S::TUNNEL_UNANSWERED},
     Reach::RELAYED,
     "",
     1},
    {"credentials since the log",
     "",
     {S::DAEMON_RUNS, S::LOGGED_CREDENTIALS_MISSING, S::HAS_CREDENTIALS},
     Reach::NOT_REACHED,
     "settling",
     2},
    {"a disk that is in use again",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_TEST_SKIPPED_DISK, S::DISK_IN_USE, S::DISK_ACTIVE},
     Reach::NOT_REACHED,
     "settling",
     2},
    {"a disk that was in use, and may sleep again",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_TEST_SKIPPED_DISK, S::DISK_IN_USE},
     Reach::NOT_REACHED,
     "disk-asleep",
     2},
    {"a tunnel that the log does not know",
     "relayed",
     {S::TUNNEL_RUNS, S::TUNNEL_SAYS_UP, S::LOGGED_BACK_END_REFUSES},
     Reach::RELAYED,
     "back-end-refuses",
     1},
    {"over by now",
     "failed",
     {S::DAEMON_RUNS, S::LOGGED_SERVICE_UNREACHABLE, S::SERVICE_REACHED},
     Reach::NOT_REACHED,
     "settling",
     2},
};

TEST(Diagnosis, NamesTheCauseThatTheSignsCarry) {
    for (const Seen& seen : kSeen) {
        const Diagnosis diagnosis = diagnose(evidenceOf(seen));
        EXPECT_EQ(diagnosis.reach, seen.reach) << seen.name;
        EXPECT_EQ(firstCause(diagnosis), seen.cause) << seen.name;
        EXPECT_EQ(exitStatus(diagnosis), seen.status) << seen.name;
    }
}

TEST(Diagnosis, DoesNotDisproveWithoutTheSettingsWhatTheLogSays) {
    Evidence evidence = evidenceOf({"", nullptr, {S::GATEWAY_ADDRESS_PRIVATE}, {}, "", 0});
    evidence.history = {{Reach::DIRECT, {}, "203.0.113.7", ""}};
    EXPECT_EQ(diagnose(evidence).reach, Reach::DIRECT);
    evidence.unreadSettings.clear();
    EXPECT_EQ(diagnose(evidence).reach, Reach::NOT_REACHED);
}

TEST(Diagnosis, BelievesTheGatewayThatHasTheAddressTheServiceSaw) {
    for (const auto& [address, cause] :
         {std::pair{"203.0.113.7", ""}, std::pair{"203.0.113.70", "second-nat"}}) {
        Evidence evidence;
        evidence.statusWord = "relayed";
        evidence.gatewayAddress = address;
        evidence.add(S::GATEWAY_ADDRESS_PUBLIC, Source::NOW, "address is public");
        evidence.add(S::LOGGED_SECOND_NAT, Source::LOG,
                     "the gateway says 10.0.0.2, the service sees 203.0.113.7");
        EXPECT_EQ(firstCause(diagnose(evidence)), cause) << address;
    }
}

TEST(Diagnosis, TakesAGatewayThatSaysZeroForNoSecondRouter) {
    for (const auto& [signs, cause] :
         {std::pair{std::vector<Sign>{S::TUNNEL_RUNS}, "gateway-hides-address"},
          std::pair{std::vector<Sign>{S::TUNNEL_RUNS, S::GATEWAY_ADDRESS_PUBLIC}, ""}}) {
        Evidence evidence = evidenceOf({"", "relayed", signs, {}, "", 0});
        evidence.add(S::LOGGED_SECOND_NAT, Source::LOG,
                     "the gateway says 0.0.0.0, the service sees 203.0.113.7");
        EXPECT_EQ(firstCause(diagnose(evidence)), cause);
    }
}

TEST(Diagnosis, NoticesThatTheGatewayHasAnotherAddress) {
    const struct {
        const char* address;
        std::vector<Sign> signs;
        const char* cause;
    } rows[]{{"44.128.0.20", {}, ""},
             {"44.128.0.30", {}, "address-changed"},
             {"44.128.0.30", {S::PORT_TEST_PASSES}, ""},
             {"44.128.0.30", {S::MANUAL_MODE}, ""},
             {"44.128.0.30", {S::GATEWAY_ELSEWHERE}, ""}};
    for (const auto& row : rows) {
        Evidence evidence = evidenceOf({"", "portforwarded", row.signs, {}, "", 0});
        evidence.settings["EXTERNAL_IP"] = "44.128.0.20";
        evidence.gatewayAddress = row.address;
        evidence.add(S::GATEWAY_ADDRESS_PUBLIC, Source::NOW, "address is public");
        EXPECT_EQ(firstCause(diagnose(evidence)), row.cause) << row.address;
    }
}

// The log begins at 100, now is 500.
TEST(Diagnosis, SaysSinceWhenAtLeast) {
    const auto at = [](int seconds) { return Time{std::chrono::seconds{seconds}}; };
    const Period first{Reach::RELAYED, at(100), "", ""};
    const Period later{Reach::RELAYED, at(200), "", "the tunnel came up"};
    const struct {
        const char* name;
        std::vector<Period> history;
        std::optional<Time> tunnelSince, since;
        bool isAtLeast;
    } rows[]{{"the log tells", {{Reach::DIRECT, at(100), "", ""}, later}, at(50), at(200), false},
             {"the log begins in the middle", {first}, {}, at(100), true},
             {"the tunnel is older", {first}, at(50), at(50), true},
             {"the tunnel is younger", {later}, at(300), at(200), false},
             {"the log is silent", {}, at(300), at(300), true},
             {"the clock was set back", {}, at(501), {}, false},
             {"nothing tells", {}, {}, {}, false}};
    for (const auto& row : rows) {
        Evidence evidence;
        evidence.now = at(500);
        evidence.logBegin = at(100);
        evidence.add(Sign::TUNNEL_RUNS, Source::NOW, "tunnel client up");
        evidence.history = row.history;
        evidence.tunnelSince = row.tunnelSince;
        const Diagnosis diagnosis = diagnose(evidence);
        EXPECT_EQ(diagnosis.since, row.since) << row.name;
        EXPECT_EQ(diagnosis.isSinceAtLeast, row.isAtLeast) << row.name;
    }
}

TEST(Diagnosis, TheHistoryOfADaemonThatIsGoneEndsWithItsLog) {
    const auto at = [](int seconds) { return Time{std::chrono::seconds{seconds}}; };
    const struct {
        Sign sign;
        Reach last;
        std::size_t periods;
        bool hasStart;
    } rows[]{{S::DAEMON_GONE, Reach::DIRECT, 2, false},
             {S::DAEMON_GONE, Reach::NOT_RUNNING, 1, false},
             {S::DAEMON_RUNS, Reach::DIRECT, 1, true}};
    for (const auto& row : rows) {
        Evidence evidence;
        evidence.now = at(500);
        evidence.logEnd = at(300);
        evidence.daemon.since = at(50);
        evidence.history = {{row.last, at(100), "203.0.113.7", ""}};
        evidence.add(row.sign, Source::NOW, "fact");
        const Diagnosis diagnosis = diagnose(evidence);
        EXPECT_EQ(diagnosis.daemon.since.has_value(), row.hasStart);
        ASSERT_EQ(diagnosis.history.size(), row.periods);
        if (row.periods == 1) continue;
        EXPECT_EQ(diagnosis.history.back().reach, Reach::NOT_RUNNING);
        EXPECT_EQ(diagnosis.history.back().since, at(300));
        ASSERT_TRUE(diagnosis.before);
        EXPECT_EQ(diagnosis.before->reach, row.last);
    }
}

TEST(Diagnosis, WithoutALogThereIsNoEndOfIt) {
    Evidence evidence;
    evidence.fromElsewhere = true;
    EXPECT_FALSE(diagnose(evidence).fromElsewhere);
    evidence.hasLog = true;
    EXPECT_TRUE(diagnose(evidence).fromElsewhere);
}

}  // namespace
}  // namespace pelorus::doctor
