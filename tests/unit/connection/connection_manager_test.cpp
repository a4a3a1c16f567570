#include "connection_fixture.h"

namespace pelorus {
namespace {

class ConnectionManagerTest : public ConnectionTest {};

TEST_F(ConnectionManagerTest, WithoutCredentialsItIdlesAndSendsNothing) {
    for (const char* key : {"DEVICEID", "DEVICEAUTH"}) {
        setConfig(key, "");
        EXPECT_EQ(manager().createConnection(), FAILED);
        setConfig(key, "appeared-7741");
    }
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
}

TEST_F(ConnectionManagerTest, SteadyConnectionStretchesThePortTestInterval) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 3; ++unchanged) cycle();
    EXPECT_EQ(log.countPart("increased port test interval"), 0);
    for (int unchanged = 0; unchanged < 5; ++unchanged) cycle();
    EXPECT_EQ(log.countPart("un-changed. connTypeUnchangedCount 3, forceDNSCheck=false"), 2);
    EXPECT_EQ(log.countPart("increased port test interval to 360."), 1);
    EXPECT_EQ(log.countPart("increased port test interval to 480."), 1);
    for (int unchanged = 0; unchanged < 40; ++unchanged) cycle();
    EXPECT_EQ(log.countPart("increased port test interval to 960."), 7);  // its upper end
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
    EXPECT_EQ(log.countPart("un-changed"), 0);
    setConfig("COMMUNICATION_STATUS", "connecting");
    forget();
    EXPECT_EQ(cycle(), CONNECTING);
    EXPECT_EQ(log.countPart("connection type changed"), 0);
    EXPECT_EQ(commands.count("start-client"), 0);
    EXPECT_TRUE(web.urls().empty());
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

TEST_F(ConnectionManagerTest, EveryTypeHasItsStatusWord) {
    Texts words;
    for (const auto type : {NONE, PORTFORWARDED, RELAYED, CONNECTING, FAILED}) {
        words.push_back(ConnectionManager::convertEnumConnectionType(type));
    }
    EXPECT_EQ(words, (Texts{"disabled", "portforwarded", "relayed", "connecting", "failed"}));
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
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(events(), (Texts{"failed/portforwarded"}));
    EXPECT_EQ(commands.count("kill -15 "), 1);
    forget();
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (Ports{9091}));
    EXPECT_EQ(commands.count("hdparm"), 0);  // forced: the disk is not asked
}

}  // namespace
}  // namespace pelorus
