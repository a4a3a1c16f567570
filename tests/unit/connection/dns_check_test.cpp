#include <limits>

#include "connection_fixture.h"

namespace pelorus {
namespace {

const std::string kFourLevel = "nas.devicedevice-7350142.kavra.example";
const std::string kThreeLevel = "nas-devicedevice-7350142.kavra.example";

class DnsCheckTest : public ConnectionTest {
protected:
    void namesLeadTo(const std::string& four, const std::string& three, const std::string& hashed) {
        if (!four.empty()) net.setName(kFourLevel, {four});
        if (!three.empty()) net.setName(kThreeLevel, {three});
        if (!hashed.empty()) net.setName(support::kSubdomain, {hashed});
    }
    bool forcedCheck(ConnectionType type) {
        manager().setForceDNSCheck(true);
        log.clear();
        return manager().checkDNS(type);
    }
};

struct Names {
    const char* name;
    std::string four;
    std::string three;
    std::string hashed;
    bool fine;
    const char* line;
    std::vector<long> pauses;
};
class DnsNamesTest : public DnsCheckTest, public testing::WithParamInterface<Names> {};

TEST_P(DnsNamesTest, MustAllLeadToTheExternalAddress) {
    const auto& row = GetParam();
    namesLeadTo(row.four, row.three, row.hashed);
    EXPECT_EQ(forcedCheck(PORTFORWARDED), row.fine);
    EXPECT_EQ(log.countPart(row.line), 1) << log.dump();
    EXPECT_EQ(clock.pauses(), row.pauses);
}
INSTANTIATE_TEST_SUITE_P(
    Answers,
    DnsNamesTest,
    testing::Values(
        Names{
            "AllRight",
            kWanIp,
            kWanIp,
            kWanIp,
            true,
            "ConnectionManager::checkDNS - DNS matches local value for device domain names, IP address is 44.128.0.20\n",
            {}},
        Names{
            "AllWrong",
            "44.1.1.1",
            "44.1.1.1",
            "44.1.1.1",
            false,
            "ConnectionManager::checkDNS - DNS check failed for 4-level device domain name, DNS IP address is 44.1.1.1, local value of IP address is 44.128.0.20\n",
            {}},
        Names{"FourLevelMissing",
              "",
              kWanIp,
              kWanIp,
              false,
              "do not exist or do not match, 3-level [44.128.0.20], 4-level []\n",
              {10, 10, 10}},
        Names{"ThreeLevelDiffers",
              kWanIp,
              "44.1.1.1",
              kWanIp,
              false,
              "do not exist or do not match, 3-level [44.1.1.1], 4-level [44.128.0.20]\n",
              {}},
        Names{"HashedMissing",
              kWanIp,
              kWanIp,
              "",
              false,
              "3-level [44.128.0.20], 4-level [44.128.0.20], 3-level hashed []\n",
              {10, 10, 10}},
        Names{"HashedDiffers",
              kWanIp,
              kWanIp,
              "44.1.1.1",
              false,
              "3-level [44.128.0.20], 4-level [44.128.0.20], 3-level hashed [44.1.1.1]\n",
              {}}),
    RowName{});

TEST_F(DnsCheckTest, OnlyNamesWithoutAnAddressAreLookedUpAgain) {
    namesLeadTo(kWanIp, "", kWanIp);
    clock.duringPause(2, [this] { net.setName(kThreeLevel, {kWanIp}); });
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(net.lookups(),
              (Texts{kFourLevel, kThreeLevel, support::kSubdomain, kThreeLevel, kThreeLevel}));
}

TEST_F(DnsCheckTest, UnusedHashedNameIsNeitherLookedUpNorCompared) {
    setConfig("SUBDOMAIN", "");
    namesLeadTo(kWanIp, kWanIp, "");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(net.lookups(), (Texts{kFourLevel, kThreeLevel}));
}

TEST_F(DnsCheckTest, RelayedNamesMustLeadToTheRelay) {
    namesLeadTo(kRelayIp, kRelayIp, kRelayIp);
    EXPECT_TRUE(forcedCheck(RELAYED));  // its address is not known: no evidence against the names
    expectLogged(
        LOG_ERR,
        "ConnectionManager::checkDNS - failed to retrieve local value of the device domain IP address\n");
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\n");
    EXPECT_TRUE(forcedCheck(RELAYED));
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.2:1194\n");
    EXPECT_FALSE(forcedCheck(RELAYED));
}

TEST_F(DnsCheckTest, WithoutAGatewayTheAddressOfTheLastPortTestCounts) {
    gateway.speakUpnp(false);
    manager().setResponseExternalIP("44.1.1.1");
    namesLeadTo("44.1.1.1", "44.1.1.1", "44.1.1.1");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
}

TEST_F(DnsCheckTest, RunsWhenItsIntervalHasPassedAndEveryCheckRestartsIt) {
    manager().setDNSCheckInterval(1000);
    manager().setPrevDNSCheckTime(clock.now());
    clock.advance(999);
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));
    EXPECT_TRUE(net.lookups().empty());
    clock.advance(1);
    EXPECT_FALSE(manager().checkDNS(PORTFORWARDED));  // no name is known
    const auto lookups = net.lookups().size();
    EXPECT_GT(lookups, 0U);
    clock.advance(999);
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));
    EXPECT_EQ(net.lookups().size(), lookups);
}

TEST_F(DnsCheckTest, LongestIntervalIsNeverDue) {
    manager().setDNSCheckInterval(std::numeric_limits<long>::max());
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));
    EXPECT_TRUE(net.lookups().empty());
}

TEST_F(DnsCheckTest, ForcedCheckWaitsForAConnectionThatHasNames) {
    EXPECT_TRUE(forcedCheck(FAILED));
    EXPECT_TRUE(manager().checkDNS(CONNECTING));
    EXPECT_TRUE(net.lookups().empty());
    EXPECT_FALSE(manager().checkDNS(PORTFORWARDED));  // still forced
    net.setHostname("other");
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));  // no longer
}

struct NoEvidence {
    const char* name;
    void (*arrange)(support::FakeNet& net);
    const char* line;
};
class NoEvidenceTest : public DnsCheckTest, public testing::WithParamInterface<NoEvidence> {};

TEST_P(NoEvidenceTest, IsNoFailure) {
    GetParam().arrange(net);
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_TRUE(net.lookups().empty());
    EXPECT_EQ(log.countPart(GetParam().line), 1) << log.dump();
}
INSTANTIATE_TEST_SUITE_P(
    Missing,
    NoEvidenceTest,
    testing::Values(
        NoEvidence{"HostnameCannotBeHad", [](support::FakeNet& net) { net.failHostname(); },
                   "ConnectionManager::checkDNS - failed to retrieve NAS hostname, errno = "},
        NoEvidence{
            "HostnameIsEmpty", [](support::FakeNet& net) { net.setHostname(""); },
            "ConnectionManager::checkDNS - cannot generate device domain names, NAS hostname = , deviceid = *ID_REMOVED*\n"}),
    RowName{});

struct Domain {
    const char* name;
    const char* server;
    const char* fourLevel;
};
class DomainTest : public ConnectionTest, public testing::WithParamInterface<Domain> {};

TEST_P(DomainTest, ComesFromTheServerUrl) {
    setConfig("SERVER_BASE_URL", GetParam().server);
    std::string four;
    std::string three;
    std::string hashed;
    std::string host = "nas";
    EXPECT_EQ(manager().buildDeviceDomainName(host.data(), "7", four, three, hashed), 1);
    EXPECT_EQ(four, GetParam().fourLevel);
    EXPECT_EQ(hashed, support::kSubdomain);
    EXPECT_EQ(manager().buildDeviceDomainName(nullptr, "7", four, three, hashed), 0);
    expectLogged(
        LOG_ERR,
        "ConnectionManager::buildDeviceDomainName - NAS hostname and/or deviceID are empty.  Hostname=NULL, deviceID=*ID_REMOVED*\n");
}
INSTANTIATE_TEST_SUITE_P(
    Servers,
    DomainTest,
    testing::Values(Domain{"Usual", "https://cloud.other.example", "nas.device7.other.example"},
                    Domain{"FirstDotCounts", "https://cloud.a.b:8443/x", "nas.device7.a.b:8443/x"},
                    Domain{"NoDot", "https://cloud", "nas.device7.kavra.example"},
                    Domain{"Empty", "", "nas.device7.kavra.example"}),
    RowName{});

}  // namespace
}  // namespace pelorus
