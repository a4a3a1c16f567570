#include <limits>

#include "connection_fixture.h"

namespace pelorus {
namespace {

const std::string kOther = "44.1.1.1";
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
    int pauses;
};
class DnsNamesTest : public DnsCheckTest, public testing::WithParamInterface<Names> {};

TEST_P(DnsNamesTest, MustAllLeadToTheExternalAddress) {
    const auto& row = GetParam();
    manager().setResponseExternalIP(kOther);  // counts only without a gateway
    namesLeadTo(row.four, row.three, row.hashed);
    EXPECT_EQ(forcedCheck(PORTFORWARDED), row.fine);
    EXPECT_EQ(log.countPart(row.line), 1) << log.dump();
    EXPECT_EQ(clock.pauses(), std::vector<long>(static_cast<std::size_t>(row.pauses), 10));
}
INSTANTIATE_TEST_SUITE_P(Answers,
                         DnsNamesTest,
                         testing::Values(Names{"AllRight", kWanIp, kWanIp, kWanIp, true,
                                               "IP address is 44.128.0.20\n", 0},
                                         Names{"AllWrong", kOther, kOther, kOther, false,
                                               "local value of IP address is 44.128.0.20\n", 0},
                                         Names{"FourLevelMissing", "", kWanIp, kWanIp, false,
                                               "3-level [44.128.0.20], 4-level []\n", 3},
                                         Names{"ThreeLevelMissing", kWanIp, "", kWanIp, false,
                                               "3-level [], 4-level [44.128.0.20]\n", 3},
                                         Names{"ThreeLevelDiffers", kWanIp, kOther, kWanIp, false,
                                               "3-level [44.1.1.1], 4-level [44.128.0.20]\n", 0},
                                         Names{"HashedMissing", kWanIp, kWanIp, "", false,
                                               "4-level [44.128.0.20], 3-level hashed []\n", 3},
                                         Names{"HashedDiffers", kWanIp, kWanIp, kOther, false,
                                               "3-level hashed [44.1.1.1]\n", 0},
                                         Names{"NoneFound", "", "", "", false,
                                               "3-level [], 4-level []\n", 3}),
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
    EXPECT_EQ(log.countPart("failed to retrieve openVPN server external IP\n"), 1);
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\n");
    EXPECT_TRUE(forcedCheck(RELAYED));
    EXPECT_EQ(log.countPart("DNS matches local value"), 1);
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.2:1194\n");
    EXPECT_FALSE(forcedCheck(RELAYED));
}

TEST_F(DnsCheckTest, WithoutAGatewayTheAddressOfTheLastPortTestCounts) {
    gateway.speakUpnp(false);
    std::string ip = "as it was";
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(FAILED, ip), 0);
    EXPECT_EQ(ip, "as it was");
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 0);
    EXPECT_EQ(ip, "");
    manager().setResponseExternalIP(kOther);
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
    EXPECT_EQ(ip, kOther);
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
    clock.advance(1);
    manager().setDNSCheckInterval(std::numeric_limits<std::int64_t>::max());  // never due
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));
    EXPECT_EQ(net.lookups().size(), lookups);
}

TEST_F(DnsCheckTest, ForcedCheckWaitsForAConnectionThatHasNames) {
    EXPECT_TRUE(forcedCheck(FAILED));
    EXPECT_TRUE(manager().checkDNS(CONNECTING));
    EXPECT_TRUE(net.lookups().empty());
    EXPECT_FALSE(manager().checkDNS(PORTFORWARDED));  // still forced
    net.setHostname("other");
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));  // no longer
}

TEST_F(DnsCheckTest, MissingHostnameOrDeviceIdIsNoFailure) {
    net.setHostname("");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(log.countPart("cannot generate device domain names"), 1);
    net.failHostname();
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(log.countPart("failed to retrieve NAS hostname, errno = "), 1);
    setConfig("DEVICEID", "");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(log.countPart("failed to get DEVICEID from config file!\n"), 1);
    EXPECT_TRUE(net.lookups().empty());
}

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
    EXPECT_EQ(manager().buildDeviceDomainName(host.data(), "", four, three, hashed), 0);
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
