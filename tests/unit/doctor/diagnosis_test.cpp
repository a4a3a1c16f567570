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
        evidence.settings["COMMUNICATION_STATUS"] = seen.statusWord;
        evidence.statusWord = seen.statusWord;
    }
    for (const Sign sign : seen.signs) evidence.add(sign, Source::NOW, "fact");
    return evidence;
}

// What the lab's scenarios do not show, or only together with other things.
const std::vector<Seen> kSeen{
    {"healthy",
     "portforwarded",
     {S::DAEMON_RUNS, S::SERVICE_REACHED, S::NAMES_RIGHT},
     Reach::DIRECT,
     "",
     0},
    {"nothing can be read", nullptr, {S::DAEMON_RUNS}, Reach::UNKNOWN, "", 3},
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
    {"no internet behind the gateway",
     "failed",
     {S::DAEMON_RUNS, S::GATEWAY_WITHOUT_ADDRESS, S::SERVICE_UNRESOLVED},
     Reach::NOT_REACHED,
     "gateway-without-address",
     2},
    {"shared address that the service sees through",
     "relayed",
     {S::TUNNEL_RUNS, S::GATEWAY_ADDRESS_SHARED, S::LOGGED_SECOND_NAT},
     Reach::RELAYED,
     "second-nat",
     1},
    {"back end",
     "portforwarded",
     {S::DAEMON_RUNS, S::BACK_END_SILENT},
     Reach::DIRECT,
     "back-end-silent",
     0},
    {"no openvpn",
     "failed",
     {S::DAEMON_RUNS, S::RELAY_CLIENT_MISSING, S::NO_GATEWAY_ANSWERS},
     Reach::NOT_REACHED,
     "relay-client-missing",
     2},
    {"no openvpn, and none needed",
     "portforwarded",
     {S::DAEMON_RUNS, S::RELAY_CLIENT_MISSING},
     Reach::DIRECT,
     "",
     0},
    {"dead tunnel",
     "relayed",
     {S::DAEMON_RUNS, S::TUNNEL_GONE},
     Reach::NOT_REACHED,
     "tunnel-died",
     2},
    {"lost mapping",
     "portforwarded",
     {S::DAEMON_RUNS, S::OUR_MAPPINGS_MISSING},
     Reach::DIRECT,
     "mapping-lost",
     0},
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
        const std::string first =
            diagnosis.causes.empty() ? "" : std::string{diagnosis.causes.front().cause->name};
        EXPECT_EQ(first, seen.cause) << seen.name;
        EXPECT_EQ(exitStatus(diagnosis), seen.status) << seen.name;
    }
}

}  // namespace
}  // namespace pelorus::doctor
