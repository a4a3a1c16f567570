#include <limits>

#include "connection_fixture.h"

namespace pelorus {
namespace {

const std::string kOther = "44.1.1.1";
const std::string kFourLevel = "nas.devicedevice-7350142.kavra.example";
const std::string kThreeLevel = "nas-devicedevice-7350142.kavra.example";

class DnsCheckTest : public ConnectionTest {
protected:
    /// An empty address: the name is not known.
    void namesLeadTo(const std::string& four, const std::string& three, const std::string& hashed) {
        net.reset();
        if (!four.empty()) net.setName(kFourLevel, {four});
        if (!three.empty()) net.setName(kThreeLevel, {three});
        if (!hashed.empty()) net.setName(support::kSubdomain, {hashed});
    }
    bool forcedCheck(ConnectionType type) {
        manager().setForceDNSCheck(true);
        return manager().checkDNS(type);
    }
};

struct Names {
    std::string four, three, hashed;
    bool fine;
    time_t waited;
};

TEST_F(DnsCheckTest, NamesMustAllLeadToTheExternalAddress) {
    const std::string wan = kWanIp;
    manager().setResponseExternalIP(kOther);  // counts only without a gateway
                                              // clang-format off
    for (const auto& row : std::vector<Names>{
             {"", "", "", false, 30}, {"", wan, wan, false, 30}, {wan, "", wan, false, 30},
             {wan, wan, "", false, 30}, {kOther, kOther, kOther, false, 0}, {wan, kOther, wan, false, 0},
             {wan, wan, kOther, false, 0}, {wan, wan, wan, true, 0}}) {
        // clang-format on
        namesLeadTo(row.four, row.three, row.hashed);
        const time_t before = clock.now();
        EXPECT_EQ(forcedCheck(PORTFORWARDED), row.fine);
        EXPECT_EQ(log.countPart("DNS matches local value"), row.fine ? 1 : 0) << log.dump();
        EXPECT_EQ(clock.now() - before, row.waited);
    }
}

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
    namesLeadTo("44.128.0.1", "44.128.0.1", "44.128.0.1");
    EXPECT_TRUE(forcedCheck(RELAYED));  // its address is not known: no evidence against the names
    EXPECT_EQ(log.countPart("failed to retrieve openVPN server external IP\n"), 1);
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\n");
    EXPECT_TRUE(forcedCheck(RELAYED));
    EXPECT_EQ(log.countPart("DNS matches local value"), 1);
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.2:1194\n");
    EXPECT_FALSE(forcedCheck(RELAYED));
}

TEST_F(DnsCheckTest, WithoutAGatewayTheAddressOfTheLastPortTestCounts) {
    std::string ip = "as it was";
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(FAILED, ip), 0);
    EXPECT_EQ(ip, "as it was");
    gateway.speakUpnp(false);
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 0);
    EXPECT_EQ(ip, "");
    EXPECT_EQ(log.countPart("most recent remote external IP in test port response is empty"), 1);
    gateway.speakUpnp(true);
    manager().createDirectConnection();
    gateway.speakUpnp(false);
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
    EXPECT_EQ(ip, kWanIp);
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

TEST_F(DnsCheckTest, DomainBeginsAtTheFirstDotOfTheServer) {
    std::string host = "nas";
    std::string names[3];
    const auto build = [&](const std::string& server, char* hostname, const std::string& id) {
        setConfig("SERVER_BASE_URL", server);
        const int built =
            manager().buildDeviceDomainName(hostname, id, names[0], names[1], names[2]);
        return built == 1 ? names[0] : "";
    };
    EXPECT_EQ(build("https://cloud.a.b:8443/x", host.data(), "7"), "nas.device7.a.b:8443/x");
    EXPECT_EQ(build("https://cloud", host.data(), "7"), "nas.device7.kavra.example");
    EXPECT_EQ(build("", host.data(), "7"), "nas.device7.kavra.example");
    EXPECT_EQ(build("", nullptr, "7"), "");
    EXPECT_EQ(build("", host.data(), ""), "");
}

}  // namespace
}  // namespace pelorus
