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

TEST_F(ConnectionManagerTest, SteadyConnectionStretchesThePortTestInterval) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 31; ++unchanged) cycle();
    EXPECT_EQ(logged("increased port test interval to "),
              (Texts{"360.\n", "480.\n", "600.\n", "720.\n", "840.\n", "960.\n", "960.\n"}));
}

TEST_F(ConnectionManagerTest, ChangeOfTypeResetsTheIntervalAndForcesANameCheck) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 5; ++unchanged) cycle();
    relayWorks();
    gateway.speakUpnp(false);
    web.answer("/test?", kNotReached);
    forget();
    EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(log.countPart("changed to 2, port test interval reset to 240,"), 1);
    manager().checkConnection(RELAYED);
    EXPECT_EQ(log.countPart("nslookup check interval, forceDNSCheck 1,"), 1);
    cycle();
    EXPECT_EQ(log.countPart("connection type 2 un-changed. connTypeUnchangedCount 0,"), 1);
}

TEST_F(ConnectionManagerTest, WaitingForTheNextPortTestIsNoReasonForARelay) {
    manager().killConnection(PORTFORWARDED);
    web.answer("/test?", kNotReached);
    ASSERT_EQ(cycle(), FAILED);
    setConfig("COMMUNICATION_STATUS", "connecting");
    forget();
    EXPECT_EQ(story(cycle()), " = connecting");
    EXPECT_EQ(logged(" connection type changed"), Texts{});
}

TEST_F(ConnectionManagerTest, LifetimesAreUnknownUntilThereIsAGatewayObject) {
    unsigned upnp = 0;
    unsigned natpmp = 0;
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 4294967295U);
    EXPECT_EQ(natpmp, 4294967295U);
    manager().setReqPortMappingLifetime(600, 700);
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 600U);
    EXPECT_EQ(natpmp, 700U);
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
    EXPECT_EQ(
        story(FAILED),
        "failed/portforwarded, status failed, unmap 9091, unmap 9444, record NULL&LAN&0&0, withdraw 8080, stop, force 1 = failed");
    EXPECT_EQ(story(manager().createConnection()),
              kSearch + kPublish + ", status portforwarded, force 0" + kKept);
}

}  // namespace
}  // namespace pelorus
