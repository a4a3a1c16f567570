#include "connection_fixture.h"

namespace pelorus {
namespace {

class ConnectionManagerTest : public ConnectionTest {};

TEST_F(ConnectionManagerTest, WithoutCredentialsItIdlesAndSendsNothing) {
    for (const char* key : {"DEVICEID", "DEVICEAUTH"}) {
        setConfig(key, "");
        EXPECT_EQ(story(manager().createConnection()), " = failed");
        setConfig(key, "appeared-7741");
    }
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
}

TEST_F(ConnectionManagerTest, SteadyTypeStretchesThePortTestIntervalAndANewOneResetsIt) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 31; ++unchanged) cycle();
    EXPECT_EQ(story(PORTFORWARDED),
              "disk, test 9091, interval 360, disk, test 9091, interval 480, disk, test 9091, "
              "interval 600, interval 720, disk, test 9091, interval 840, interval 960, disk, "
              "test 9091, interval 960 = forwarded");
    clientRuns();
    gateway.speakUpnp(false);
    failTest(9091);
    for (int relayed = 0; relayed < 5; ++relayed) EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(story(RELAYED),
              "test :9091 x3, status failed, elapsed 0, status relayed, force 0, elapsed 121, "
              "force 0, elapsed 241, force 0, elapsed 361, force 0, elapsed 481, force 0, "
              "interval 360 = 9091 9444 relayed");
    EXPECT_FALSE(manager().checkDNS(RELAYED)) << "a new type forces a check; no name is known";
}

TEST_F(ConnectionManagerTest, LifetimesAreUnknownUntilThereIsAGatewayObject) {
    const auto lifetimes = [this] {
        std::pair<unsigned, unsigned> asked;
        manager().getReqPortMappingLifetime(asked.first, asked.second);
        return asked;
    };
    EXPECT_EQ(lifetimes(), std::pair(4294967295U, 4294967295U));
    manager().setReqPortMappingLifetime(600, 700);
    EXPECT_EQ(lifetimes(), std::pair(600U, 700U));
}

TEST_F(ConnectionManagerTest, WrongNamesTearEverythingDownAndForceATestInTheSameCycle) {
    givenForwardedPorts();
    diskIsAsleep();
    clientRuns();
    for (const char* name : {"nas.devicedevice-7350142.kavra.example",
                             "nas-devicedevice-7350142.kavra.example", support::kSubdomain}) {
        net.setName(name, {"44.128.0.99"});
    }
    manager().checkConnection(PORTFORWARDED);
    EXPECT_EQ(story(FAILED),
              "failed, status failed, unmap 9091 9444, withdraw LAN, stop, force 1 = failed");
    EXPECT_EQ(story(manager().createConnection()),
              "connecting, map 9091, test 9091, map 9444 SSL, publish WAN LAN 9091 9444, up"
              " = forwarded");
}

}  // namespace
}  // namespace pelorus
