#include "connection_fixture.h"

namespace pelorus {
namespace {

const std::string kFourLevel = "nas.devicedevice-7350142.kavra.example";
const std::string kThreeLevel = "nas-devicedevice-7350142.kavra.example";

class DnsCheckTest : public ConnectionTest {
protected:
    // Where the three names lead: 'W' here, 'R' to the relay, 'O' elsewhere, '-' nowhere.
    void namesLeadTo(const std::string& places) {
        const std::string names[] = {kFourLevel, kThreeLevel, support::kSubdomain};
        std::map<char, std::string> ips{{'W', kWanIp}, {'R', "44.128.0.1"}, {'O', "44.1.1.1"}};
        net.reset();
        for (std::size_t i = 0; i < 3; ++i) {
            if (places[i] != '-') net.names[names[i]] = {ips[places[i]]};
        }
    }
    bool forcedCheck(ConnectionType type) {
        manager().setForceDNSCheck(true);
        return manager().checkDNS(type);
    }
};

TEST_F(DnsCheckTest, NamesMustAllLeadToTheExternalAddress) {
    manager().setResponseExternalIP("44.1.1.1");  // counts only without a gateway
    for (const std::string places : {"---", "-WW", "W-W", "WW-", "OOO", "WOW", "WWO", "WWW"}) {
        namesLeadTo(places);
        const time_t before = clock.now();
        EXPECT_EQ(forcedCheck(PORTFORWARDED), places == "WWW") << places;
        EXPECT_EQ(clock.now() - before, places.find('-') < 3 ? 30 : 0) << places;
    }
}

TEST_F(DnsCheckTest, OnlyUsedNamesWithoutAnAddressAreLookedUpAgain) {
    namesLeadTo("W-W");
    clock.duringPause(2, [this] { net.names[kThreeLevel] = {kWanIp}; });
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(net.lookups,
              (Texts{kFourLevel, kThreeLevel, support::kSubdomain, kThreeLevel, kThreeLevel}));
    setConfig("SUBDOMAIN", "");
    namesLeadTo("WW-");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(net.lookups, (Texts{kFourLevel, kThreeLevel}));
}

TEST_F(DnsCheckTest, RelayedNamesMustLeadToTheRelay) {
    namesLeadTo("RRR");
    EXPECT_TRUE(forcedCheck(RELAYED));  // its address is not known: no evidence against the names
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.1:1194\n");
    EXPECT_TRUE(forcedCheck(RELAYED));
    writeFile("client.out", "Peer Connection Initiated with [AF_INET]44.128.0.2:1194\n");
    EXPECT_FALSE(forcedCheck(RELAYED));
}

TEST_F(DnsCheckTest, WithoutAGatewayTheAddressOfTheLastPortTestCounts) {
    std::string ip = "as it was";
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(FAILED, ip), 0);
    EXPECT_EQ(ip, "as it was");
    gateway.upnp = false;
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 0);
    EXPECT_EQ(ip, "");
    gateway.upnp = true;
    manager().createDirectConnection();
    gateway.upnp = false;
    EXPECT_EQ(manager().fetchLocalDeviceDomainIPAddr(PORTFORWARDED, ip), 1);
    EXPECT_EQ(ip, kWanIp);
}

TEST_F(DnsCheckTest, RunsWhenItsIntervalHasPassedAndEveryCheckRestartsIt) {
    const auto fineAfter = [this](time_t pause) {
        clock.advance(pause);
        return manager().checkDNS(PORTFORWARDED);  // not fine when it is due: no name is known
    };
    manager().setPrevDNSCheckTime(clock.now());
    EXPECT_TRUE(fineAfter(24 * 3600 - 1));
    EXPECT_FALSE(fineAfter(1));
    manager().setDNSCheckInterval(1000);
    EXPECT_TRUE(fineAfter(999));
    manager().setDNSCheckInterval(INT64_MAX);  // never due
    EXPECT_TRUE(fineAfter(1));
}

TEST_F(DnsCheckTest, ForcedCheckWaitsForAConnectionThatHasNames) {
    EXPECT_TRUE(forcedCheck(FAILED));
    EXPECT_TRUE(manager().checkDNS(CONNECTING));
    EXPECT_TRUE(net.lookups.empty());
    EXPECT_FALSE(manager().checkDNS(PORTFORWARDED));  // still forced
    net.hostname = "other";
    EXPECT_TRUE(manager().checkDNS(PORTFORWARDED));  // no longer
}

TEST_F(DnsCheckTest, MissingHostnameOrDeviceIdIsNoFailure) {
    std::string names[3];
    EXPECT_EQ(manager().buildDeviceDomainName(nullptr, "7", names[0], names[1], names[2]), 0);
    net.hostname = "";
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    net.hostnameFails = true;
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(log.countPart("failed to retrieve NAS hostname, errno = "), 1);
    setConfig("DEVICEID", "");
    EXPECT_TRUE(forcedCheck(PORTFORWARDED));
    EXPECT_EQ(log.countPart("failed to get DEVICEID from config file!\n"), 1);
    EXPECT_TRUE(net.lookups.empty());
}

TEST_F(DnsCheckTest, DomainBeginsAtTheFirstDotOfTheServer) {
    const std::map<std::string, std::string> domains{{"https://cloud.a.b:8443/x", ".a.b:8443/x"},
                                                     {"https://cloud", ".kavra.example"},
                                                     {"", ".kavra.example"}};
    for (const auto& [server, domain] : domains) {
        setConfig("SERVER_BASE_URL", server);
        net.reset();
        forcedCheck(PORTFORWARDED);
        EXPECT_EQ(net.lookups.front(), "nas.devicedevice-7350142" + domain);
    }
}

}  // namespace
}  // namespace pelorus
