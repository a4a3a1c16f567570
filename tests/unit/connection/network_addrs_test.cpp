#include "connection/network_addrs.h"

#include "common/termination.h"
#include "connection_fixture.h"

namespace pelorus {
namespace {

class NetworkAddrsTest : public ConnectionTest {
protected:
    NetworkAddrs& addresses = *NetworkAddrs::getInstance();
};

TEST_F(NetworkAddrsTest, TellsWhichAddressChangedUntilItIsClearedOrPublished) {
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);  // nothing to compare with
    EXPECT_TRUE(gateway.calls().empty());
    addresses.setNetworkAddrs(kWanIp, "192.168.77.99");
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 1);
    EXPECT_FALSE(addresses.hasExternalIPChanged());
    EXPECT_TRUE(addresses.hasInternalIPChanged());
    EXPECT_TRUE(addresses.haveNetworkAddrsChanged());
    EXPECT_EQ(addresses.getLocalIp(), "192.168.77.99");  // only publishing records a new one

    addresses.setNetworkAddrs("44.128.0.9", kLanIp);
    EXPECT_FALSE(addresses.haveNetworkAddrsChanged());
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 1);
    EXPECT_TRUE(addresses.hasExternalIPChanged());
    EXPECT_FALSE(addresses.hasInternalIPChanged());
    EXPECT_TRUE(addresses.haveNetworkAddrsChanged());

    addresses.init();
    EXPECT_FALSE(addresses.haveNetworkAddrsChanged());
    EXPECT_EQ(addresses.getExternalIp() + addresses.getLocalIp(), "");
}

TEST_F(NetworkAddrsTest, WithoutAGatewayTheServerIsAskedOncePerInterval) {
    gateway.speakUpnp(false);
    addresses.SetIntervalDuration(600);
    addresses.setNetworkAddrs(kWanIp, kLanIp);
    clock.advance(600);
    EXPECT_EQ(addresses.discoverNetworkAddrs(), 0);
    EXPECT_EQ(web.count("/myip"), 0);
    clock.advance(1);
    std::string found;
    for (const int asked : {1, 2, 3, 3}) {  // a failed query is repeated at the next chance
        web.answer("/myip", asked < 3 ? "not an address" : "44.128.0.55");
        found += std::to_string(addresses.discoverNetworkAddrs());
        EXPECT_EQ(web.count("/myip"), asked);
    }
    EXPECT_EQ(found, "0010");
    EXPECT_TRUE(addresses.hasExternalIPChanged());
    for (const char* line : {"NetworkAddrs::getMyIP - failed to retrieve external IP address\n",
                             "NetworkAddrs::discoverNetworkAddrs - getMyIP returned false\n"}) {
        EXPECT_EQ(log.count(LOG_ERR, line), 2) << log.dump();
    }
}

TEST_F(NetworkAddrsTest, WaitsAsOftenAsTheServerAsks) {
    const std::string wait = "<action>wait</action><wait_time>30</wait_time>";
    for (int answer = 0; answer < 2; ++answer) web.answerOnce("/remote_access_status/", wait);
    web.answer("/myip", kWanIp);
    std::string ip;
    EXPECT_EQ(addresses.getMyIP(ip), 1);
    EXPECT_EQ(ip, kWanIp);
    EXPECT_EQ(clock.pauses(), (std::vector<long>{30, 30}));
}

TEST_F(NetworkAddrsTest, TerminationEndsAWaitThatTheServerNeverEnds) {
    web.answer("/remote_access_status/", kWait);
    clock.duringPause(3, [] { sigConnKilled = SIGTERM; });
    std::string ip = "untouched";
    EXPECT_EQ(addresses.getMyIP(ip), 0);
    EXPECT_EQ(ip, "untouched");
    EXPECT_EQ(clock.pauses().size(), 3U);
    EXPECT_EQ(web.count("/myip"), 0);
}

}  // namespace
}  // namespace pelorus
