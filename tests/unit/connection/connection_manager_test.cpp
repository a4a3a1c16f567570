#include "connection_fixture.h"

namespace pelorus {
namespace {

class StateMachineTest : public ConnectionTest {};

struct MissingCredential {
    const char* name;
    const char* key;
};
class MissingCredentialTest : public ConnectionTest,
                              public testing::WithParamInterface<MissingCredential> {};

TEST_P(MissingCredentialTest, IdlesAndSendsNothing) {
    setConfig(GetParam().key, "");
    EXPECT_EQ(manager().createConnection(), FAILED);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(gateway.calls().empty());
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createConnection() - Deviceid and DeviceAuth is empty. Idle Process.\n");
    // It starts to work as soon as the value is there.
    setConfig(GetParam().key, "appeared-7741");
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
}
INSTANTIATE_TEST_SUITE_P(Keys,
                         MissingCredentialTest,
                         testing::Values(MissingCredential{"NoDeviceId", "DEVICEID"},
                                         MissingCredential{"NoDeviceAuth", "DEVICEAUTH"}),
                         RowName{});

TEST_F(StateMachineTest, SteadyConnectionStretchesThePortTestInterval) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 3; ++unchanged) cycle();
    expectNotLogged("increased port test interval");
    cycle();
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createConnection() - connection type 1 un-changed. connTypeUnchangedCount 3, forceDNSCheck=false\n");
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createConnection() - connection type un-changed, increased port test interval to 360.\n");
    for (int unchanged = 0; unchanged < 4; ++unchanged) cycle();
    expectLogged(
        LOG_INFO,
        "ConnectionManager::createConnection() - connection type un-changed, increased port test interval to 480.\n");
    for (int unchanged = 0; unchanged < 40; ++unchanged) cycle();
    EXPECT_EQ(log.countPart("increased port test interval to 960"), 7);  // its upper end
    EXPECT_EQ(log.countPart("increased port test interval to 1080"), 0);
}

TEST_F(StateMachineTest, ChangeOfTypeResetsTheIntervalAndForcesANameCheck) {
    givenForwardedPorts();
    for (int unchanged = 0; unchanged < 4; ++unchanged) cycle();
    relayWorks();
    gateway.speakUpnp(false);
    web.answer("/test?", kNotReached);
    forget();
    EXPECT_EQ(cycle(), RELAYED);
    EXPECT_EQ(
        log.countPart(
            "connection type changed to 2, port test interval reset to 240, last port test time set to "),
        1);
    manager().checkConnection(RELAYED);
    EXPECT_EQ(
        log.countPart(
            "ConnectionManager::checkDNS - forceDNSCheck or exceeded nslookup check interval, forceDNSCheck 1"),
        1);
}

TEST_F(StateMachineTest, FailureOfBothKindsLeavesTheCountersAlone) {
    gateway.speakUpnp(false);
    writeFile("client.out", "");
    EXPECT_EQ(manager().createConnection(), FAILED);
    EXPECT_EQ(log.countPart("connection type changed"), 0);
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
}

TEST_F(StateMachineTest, WaitingForTheNextPortTestIsNoReasonForARelay) {
    for (int port = 9444; port <= 9543; ++port) gateway.refusePort(port);
    manager().killConnection(PORTFORWARDED);
    ASSERT_EQ(cycle(), FAILED);  // the HTTP port was tested, HTTPS refused, the relay is down
    setConfig("COMMUNICATION_STATUS", "connecting");
    forget();
    EXPECT_EQ(cycle(), CONNECTING);
    EXPECT_EQ(commands.count("start-client"), 0);
    EXPECT_TRUE(web.urls().empty());
}

TEST_F(StateMachineTest, LifetimesAreUnknownUntilThereIsAGatewayObject) {
    unsigned upnp = 0;
    unsigned natpmp = 0;
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 4294967295U);
    EXPECT_EQ(natpmp, 4294967295U);
    expectLogged(LOG_WARNING,
                 "ConnectionManager::getReqPortMappingLifetime - UPnP lifetimes not set yet\n");
    manager().setReqPortMappingLifetime(600, 700);
    manager().getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 600U);
    EXPECT_EQ(natpmp, 700U);
}

TEST_F(StateMachineTest, WrongNamesTearEverythingDownAndForceATestInTheSameCycle) {
    givenForwardedPorts();
    diskIsAsleep();
    for (const char* name : {"nas.devicedevice-7350142.kavra.example",
                             "nas-devicedevice-7350142.kavra.example", support::kSubdomain}) {
        net.setName(name, {"44.128.0.99"});
    }
    manager().checkConnection(PORTFORWARDED);
    EXPECT_TRUE(mappedPorts().empty());
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(events(), (Texts{"failed/portforwarded"}));
    expectLoggedInOrder(
        {"ConnectionManager::checkConnection - nslookup failed or does not match local value, kill existing connections.\n",
         "ConnectionManager::killConnection() - unmapping all ports\n",
         "VPNManager::closeVPNConnection() - openVPN process is not running, so return true.\n",
         "ConnectionManager::setForceConnect = 1\n"});
    forget();
    EXPECT_EQ(manager().createConnection(), PORTFORWARDED);
    EXPECT_EQ(testedPorts(), (std::vector<int>{9091}));
    EXPECT_EQ(commands.count("hdparm"), 0);  // forced: the disk is not asked
}

}  // namespace
}  // namespace pelorus
