#include "connection/network_addrs.h"

#include "common/termination.h"
#include "connection_fixture.h"

namespace pelorus {
namespace {

class NetworkAddrsTest : public ConnectionTest {
protected:
    // The result of a discovery and which addresses have changed.
    std::string discover() {
        const int result = addresses.discoverNetworkAddrs();
        return std::to_string(result) + (addresses.hasExternalIPChanged() ? " external" : "") +
               (addresses.hasInternalIPChanged() ? " internal" : "") +
               (addresses.haveNetworkAddrsChanged() ? " changed" : "");
    }
    NetworkAddrs& addresses = *NetworkAddrs::getInstance();
};

TEST_F(NetworkAddrsTest, TellsWhichAddressChangedUntilItIsClearedOrPublished) {
    EXPECT_EQ(discover(), "0");  // nothing to compare with
    EXPECT_TRUE(gateway.calls().empty());
    addresses.setNetworkAddrs(kWanIp, "192.168.77.99");
    EXPECT_EQ(discover(), "1 internal changed");
    EXPECT_EQ(addresses.getLocalIp(), "192.168.77.99");  // only publishing records a new one
    addresses.setNetworkAddrs("44.128.0.9", kLanIp);
    EXPECT_FALSE(addresses.haveNetworkAddrsChanged());
    EXPECT_EQ(discover(), "1 external changed");
    addresses.init();
    EXPECT_EQ(discover() + addresses.getExternalIp() + addresses.getLocalIp(), "0");
}

TEST_F(NetworkAddrsTest, WithoutAGatewayTheServerIsAskedOncePerInterval) {
    gateway.upnp = false;
    addresses.setNetworkAddrs(kWanIp, kLanIp);
    clock.advance(720);
    EXPECT_EQ(discover(), "0");
    addresses.SetIntervalDuration(600);
    addresses.setNetworkAddrs(kWanIp, kLanIp);
    clock.advance(600);
    EXPECT_EQ(discover(), "0");
    EXPECT_EQ(web.count("/myip"), 0);
    clock.advance(1);
    web.answer("/myip", "not an address");
    EXPECT_EQ(discover() + discover(), "00");  // a failed query is repeated at the next chance
    web.answer("/myip", "44.128.0.55");
    EXPECT_EQ(discover(), "1 external changed");
    EXPECT_EQ(discover(), "0 external changed");
    EXPECT_EQ(web.count("/myip"), 3);
    EXPECT_EQ(log.count(LOG_ERR, "NetworkAddrs::discoverNetworkAddrs - getMyIP returned false\n"),
              2);
}

TEST_F(NetworkAddrsTest, WaitsAsOftenAsTheServerAsksUntilTerminated) {
    for (int answer = 0; answer < 2; ++answer) web.answerOnce("/remote_access_status/", kWait);
    web.answer("/myip", kWanIp);
    std::string ip;
    EXPECT_EQ(addresses.getMyIP(ip), 1);
    EXPECT_EQ(clock.pauses(), (std::vector<long>{300, 300}));

    TavikClient::getInstance()->resetServerSleepTime();
    web.answer("/remote_access_status/", kWait);
    clock.duringPause(3, [] { sigConnKilled = SIGTERM; });
    EXPECT_EQ(addresses.getMyIP(ip), 0);
    EXPECT_EQ(ip, kWanIp);
    EXPECT_EQ(web.count("/remote_access_status/"), 3 + 3);  // no more after the signal
    EXPECT_EQ(web.count("/myip"), 1);
}

}  // namespace
}  // namespace pelorus
