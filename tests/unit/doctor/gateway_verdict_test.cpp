#include "doctor/gateway_verdict.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

#include "doctor/address_class.h"
#include "doctor/gateway_probe.h"

namespace pelorus::doctor {

namespace {

using State = GatewayAnswer::State;

std::set<Sign> signsOf(const Findings& findings) {
    std::set<Sign> signs;
    for (const auto& seen : findings.signs()) signs.insert(seen.sign);
    return signs;
}

TEST(AddressClass, FollowsTheRegistry) {
    const std::pair<const char*, AddressClass> rows[] = {
        {"", AddressClass::NONE},
        {"0.0.0.0", AddressClass::NONE},
        {"256.1.1.1", AddressClass::NONE},
        {"1.2.3", AddressClass::NONE},
        {"fe80::1", AddressClass::NONE},
        {"10.255.255.255", AddressClass::HOME},
        {"11.0.0.0", AddressClass::PUBLIC},
        {"172.15.0.1", AddressClass::PUBLIC},
        {"172.16.0.1", AddressClass::HOME},
        {"172.32.0.1", AddressClass::PUBLIC},
        {"192.168.77.1", AddressClass::HOME},
        {"100.63.255.255", AddressClass::PUBLIC},
        {"100.64.3.9", AddressClass::SHARED},
        {"100.127.255.255", AddressClass::SHARED},
        {"100.128.0.0", AddressClass::PUBLIC},
        {"127.0.0.1", AddressClass::RESERVED},
        {"169.254.7.1", AddressClass::RESERVED},
        {"192.0.0.2", AddressClass::SHARED},
        {"192.0.0.8", AddressClass::RESERVED},
        {"255.255.255.255", AddressClass::RESERVED},
        {"44.128.0.20", AddressClass::PUBLIC},
    };
    for (const auto& [address, kind] : rows) EXPECT_EQ(classOf(address), kind) << address;
}

struct Answers {
    std::string name;
    GatewayAnswer upnp, natpmp;
    std::set<Sign> signs;
    std::string check;
};

GatewayAnswer found(const std::string& address, bool connected = true) {
    return {State::FOUND, "192.168.1.1", address, connected, ""};
}

GatewayAnswer unusable(const std::string& device) {
    return {State::SILENT, "", "", true, device};
}

const GatewayAnswer kSilent = unusable("");
const GatewayAnswer kUnknown{};

class Gateway : public ::testing::TestWithParam<Answers> {};

TEST_P(Gateway, IsJudged) {
    Findings findings;
    judgeGateway(GetParam().upnp, GetParam().natpmp, {"192.168.1.1"}, findings);
    EXPECT_EQ(signsOf(findings), GetParam().signs);
    ASSERT_EQ(findings.checks().size(), 1U);
    EXPECT_EQ(findings.checks()[0].text, GetParam().check);
}

const Answers kAnswers[] = {
    {"PublicThroughBoth",
     found("44.128.0.20"),
     found("44.128.0.20"),
     {Sign::GATEWAY_FOUND, Sign::GATEWAY_ADDRESS_PUBLIC},
     "gateway 192.168.1.1 (UPnP and NAT-PMP): address 44.128.0.20 is public"},
    {"PrivateThroughNatpmp",
     kUnknown,
     found("10.0.0.2"),
     {Sign::GATEWAY_FOUND, Sign::GATEWAY_ADDRESS_PRIVATE},
     "gateway 192.168.1.1 (NAT-PMP): address 10.0.0.2 is private"},
    {"UpnpWithoutAddressNatpmpWith",
     found(""),
     found("44.128.0.20"),
     {Sign::GATEWAY_FOUND, Sign::GATEWAY_ADDRESS_PUBLIC},
     "gateway 192.168.1.1 (UPnP and NAT-PMP): address 44.128.0.20 is public"},
    {"ZeroAddress",
     found("0.0.0.0"),
     {State::FOUND, "192.168.1.9", "44.128.0.20", true, ""},
     {Sign::GATEWAY_FOUND, Sign::GATEWAY_WITHOUT_ADDRESS},
     "gateway 192.168.1.1 (UPnP): says its address is 0.0.0.0"},
    {"Unconnected",
     found("44.128.0.20", false),
     kSilent,
     {Sign::GATEWAY_FOUND, Sign::GATEWAY_ADDRESS_PUBLIC},
     "gateway 192.168.1.1 (UPnP): says that it is not connected, address 44.128.0.20 is public"},
    {"NoAddressOfAnAccessPoint",
     {State::FOUND, "192.168.1.2", "", true, ""},
     kSilent,
     {Sign::NO_GATEWAY_ANSWERS},
     "gateway: 192.168.1.2 announces itself, but does not act as a gateway"},
    {"NatpmpRefused",
     kSilent,
     unusable("192.168.1.1"),
     {Sign::NO_GATEWAY_ANSWERS},
     "gateway: no gateway answers to UPnP, and 192.168.1.1 refuses NAT-PMP"},
    {"OneSilentOneCutShort", kUnknown, kSilent, {}, "gateway: it did not answer in time"},
};

INSTANTIATE_TEST_SUITE_P(Answers, Gateway, ::testing::ValuesIn(kAnswers), [](const auto& row) {
    return row.param.name;
});

TEST(Gateway, IsTheOneOfTheDefaultRoute) {
    const std::pair<std::vector<std::string>, bool> rows[]{{{}, false},
                                                           {{"192.168.1.1"}, false},
                                                           {{"192.168.1.9"}, true},
                                                           {{"192.168.1.9", "192.168.1.1"}, false}};
    for (const auto& [routed, isElsewhere] : rows) {
        Findings findings;
        judgeGateway(found("44.128.0.20"), kSilent, routed, findings);
        EXPECT_EQ(findings.has(Sign::GATEWAY_ELSEWHERE), isElsewhere);
    }
}

TEST(Gateway, IsSilentUnlessItAnswers) {
    const GatewayAnswer elsewhere{State::FOUND, "192.168.1.2", "44.128.0.20", true, ""};
    const struct {
        GatewayAnswer upnp, natpmp;
        bool isSilent;
    } rows[]{{kSilent, kSilent, true},
             {elsewhere, kSilent, true},
             {elsewhere, found("44.128.0.20"), false},
             {kSilent, unusable("192.168.1.1"), false}};
    for (const auto& row : rows) {
        Findings findings;
        judgeSilentGateway(row.upnp, row.natpmp, {"192.168.1.1"}, findings);
        EXPECT_EQ(findings.has(Sign::GATEWAY_SILENT), row.isSilent) << &row - rows;
    }
}

struct Table {
    std::string name;
    std::vector<TableEntry> entries;
    std::vector<PublishedPort> published;
    std::set<Sign> signs;
};

const TableEntry kOurs{9091, "TCP", "192.168.1.5", 80, "Kavra"};
const TableEntry kOursForHttps{9444, "TCP", "192.168.1.5", 443, "KavraSSL"};
const TableEntry kNeighbour{9091, "TCP", "192.168.1.9", 80, "Kavra"};
const TableEntry kForHttpElsewhere{9091, "TCP", "192.168.1.5", 8080, "web"};
const TableEntry kByName{9091, "TCP", "nas.lan", 80, ""};

PublishedPort http(const std::optional<TableEntry>& entry) {
    return {9091, 80, true, entry};
}

class Mappings : public ::testing::TestWithParam<Table> {};

TEST_P(Mappings, AreJudged) {
    const Table& row = GetParam();
    Findings findings;
    judgeTable({row.entries, {"192.168.1.5"}, 80, 443, row.published}, findings);
    EXPECT_EQ(signsOf(findings), row.signs);
}

const std::set<Sign> kAllLost{Sign::OUR_MAPPINGS_MISSING, Sign::NO_PORT_MAPPED};

const Table kTables[] = {
    {"NothingMappedNothingPublished", {}, {}, {}},
    {"Ours", {kOurs}, {http(kOurs), {9444, 443, true, kOursForHttps}}, {}},
    {"Lost", {kOursForHttps}, {http({})}, kAllLost},
    {"ListedOnly", {kOurs}, {http({})}, {}},
    {"ListedOnlyAndByName", {kByName}, {http({})}, {}},
    {"OnlyHttpsLost", {}, {http(kOurs), {9444, 443, true, {}}}, {Sign::OUR_MAPPINGS_MISSING}},
    {"BothLost", {}, {http({}), {9444, 443, true, {}}}, kAllLost},
    {"OursToAnotherPort", {}, {http(kForHttpElsewhere)}, kAllLost},
    {"NotToldAndNotInTheTable", {}, {{9091, 80, false, {}}}, {}},
    {"ToAHostByName", {kByName}, {http(kByName)}, {}},
    {"HeldByAnother", {kNeighbour}, {}, {Sign::PORT_HELD_BY_OTHER}},
    {"TakenAway",
     {},
     {http(kNeighbour), {9444, 443, true, kOursForHttps}},
     {Sign::PORT_HELD_BY_OTHER, Sign::OUR_MAPPINGS_MISSING}},
    {"OfAnotherProtocol", {{9091, "UDP", "192.168.1.9", 80, ""}}, {}, {}},
};

INSTANTIATE_TEST_SUITE_P(Tables, Mappings, ::testing::ValuesIn(kTables), [](const auto& row) {
    return row.param.name;
});

TEST(Mappings, OfAGatewayThatIsTooSlowAreNotSeen) {
    Findings found, none, some;
    judgeUnfinishedTable(found, none);
    EXPECT_TRUE(none.checks().empty());
    found.set("gateway", "192.168.1.1");
    judgeUnfinishedTable(found, some);
    EXPECT_EQ(some.checks().size(), 1U);
    found.finish();
    judgeUnfinishedTable(found, none);
    EXPECT_TRUE(none.checks().empty());
}

TEST(Mappings, NameWhoHoldsThePort) {
    Findings findings;
    judgeTable({{kNeighbour}, {"192.168.1.5"}, 80, 443, {}}, findings);
    EXPECT_EQ(findings.signs().at(0).text, "the gateway maps port 9091 to 192.168.1.9 (Kavra)");
}

}  // namespace

}  // namespace pelorus::doctor
