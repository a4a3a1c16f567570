#include "connection_fixture.h"

namespace pelorus {
namespace {

class RelayConnectionTest : public ConnectionTest {};

TEST_F(RelayConnectionTest, WithdrawsTheRecordBeforeTheTunnelStarts) {
    relayWorks();
    std::size_t requestsAtStart = 0;
    support::FakeCommands::Answer update;
    update.action = [&](const std::string&) { requestsAtStart = web.urls().size(); };
    setConfig("UPDATE_CONF_WITH_SERVER_CMD", "fetch-relays");
    commands.answer("fetch-relays", update);
    gateway.speakUpnp(false);
    EXPECT_EQ(manager().createConnection(), RELAYED);
    const std::string device = support::kDeviceId;
    EXPECT_EQ(web.urls(),
              (Texts{"http://cloud.kavra.example/api/1.0/rest/remote_access_status/" + device,
                     "https://cloud.kavra.example/forward?" + device + "&NULL&192.168.77.10&0&0&" +
                         support::kDeviceAuth,
                     "http://127.0.0.1:80/delforward?80", "http://127.0.0.1:80/setstatus?relayed",
                     "https://cloud.kavra.example/lanip?" + device + "&" + support::kDeviceAuth +
                         "&192.168.77.10",
                     "http://127.0.0.1:80/setlanip?192.168.77.10"}));
    EXPECT_EQ(requestsAtStart, 3U);
    EXPECT_EQ(events(), (Texts{"connecting/relayed", "connected/relayed"}));
    expectLogged(
        LOG_NOTICE,
        "ConnectionManager::createRelayConnection() - local IP address has changed! Updating server with new address.\n");
}

TEST_F(RelayConnectionTest, UnreachableServerDoesNotKeepTheTunnelFromStarting) {
    relayWorks();
    web.answer("/forward?", FakeWeb::noAnswer());
    EXPECT_EQ(manager().createRelayConnection(), RELAYED);
    expectLogged(
        LOG_ERR,
        "ConnectionManager:createRelayConnection() - failed to delete port mapping info.\n");
}

TEST_F(RelayConnectionTest, TunnelThatDoesNotComeUpIsReported) {
    writeFile("client.out", "");
    EXPECT_EQ(manager().createRelayConnection(), FAILED);
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(events(), (Texts{"connecting/relayed", "failed/relayed"}));
    expectLogged(LOG_ERR,
                 "ConnectionManager::createRelayConnection() - failed to create VPN connection.\n");
}

TEST_F(RelayConnectionTest, ServerThatAsksForAWaitKeepsEverythingAsItIs) {
    web.answer("/remote_access_status/", "<action>wait</action><wait_time>300</wait_time>");
    EXPECT_EQ(manager().createRelayConnection(), FAILED);
    EXPECT_TRUE(records().empty());
    EXPECT_TRUE(statusWords().empty());
    EXPECT_EQ(commands.count("start-client"), 0);
}

TEST_F(RelayConnectionTest, NothingIsDoneWhileBothPortsAreMapped) {
    givenForwardedPorts();
    forget();
    manager().setForceConnect(true);  // so that the mapped flags of this attempt are set
    gateway.setExternalIp("44.128.0.33");
    ASSERT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    forget();
    EXPECT_EQ(manager().createRelayConnection(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(commands.lines().empty());
}

class KillConnectionTest : public ConnectionTest {};

TEST_F(KillConnectionTest, DirectRemovesOwnMappingsAndTheRecordOnly) {
    gateway.add({9091, kLanIp, 80, "Kavra"});
    gateway.add({9092, kLanIp, 80, "Kavra"});
    gateway.add({9444, kLanIp, 443, "KavraSSL"});
    gateway.add({5000, kLanIp, 22, "ssh"});
    gateway.add({9093, "192.168.77.66", 80, "Kavra"});
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(gateway.mappings(),
              (std::vector<FakeGateway::Mapping>{{5000, kLanIp, 22, "ssh"},
                                                 {9093, "192.168.77.66", 80, "Kavra"}}));
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    EXPECT_EQ(web.count("/lanip?"), 1);  // the gateway object is new, so the address is
    expectLogged(
        LOG_NOTICE,
        "ConnectionManager::killConnection() - successfully deleted port mappings on central server.\n");
}

TEST_F(KillConnectionTest, WithoutAGatewayNothingIsChanged) {
    gateway.speakUpnp(false);
    manager().killConnection(PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(commands.lines().empty());
}

TEST_F(KillConnectionTest, GatewayThatWentAwayLaterStillLosesTheRecord) {
    givenForwardedPorts();
    gateway.speakUpnp(false);
    manager().createDirectConnection();
    forget();
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(commands.lines(), (Texts{"/etc/scripts/tavik_helper.sh list"}));
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
}

TEST_F(KillConnectionTest, UnknownInternalPortLeavesTheRecord) {
    setConfig("INTERNAL_HTTP_PORT", "");
    manager().killConnection(PORTFORWARDED);
    EXPECT_TRUE(records().empty());
    expectLogged(
        LOG_ERR,
        "ConnectionManager::killConnection() - failed to get internal port number from dynamicconfig.ini.\n");
}

TEST_F(KillConnectionTest, FailedWithdrawalIsSaid) {
    web.answer("/delforward", "no");
    manager().killConnection(PORTFORWARDED);
    expectLogged(LOG_ERR,
                 "ConnectionManager::killConnection() - failed to delete port mapping info.\n");
}

TEST_F(KillConnectionTest, OtherTypesDoNothing) {
    for (const auto type : {NONE, CONNECTING, FAILED}) manager().killConnection(type);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(gateway.calls().empty());
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(KillConnectionTest, MakersRouterRemovesThroughItsScript) {
    setConfig("DEVICETYPE", "5");
    commands.answer("getip.sh lan", "192.168.77.1\n");
    commands.answer("tavik_helper.sh list",
                    "BRENVIK,TCP,9091,192.168.77.1,80,Kavra\nOTHER,TCP,9092,192.168.77.66,80,x\n");
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(commands.count(" remove "), 1);
    EXPECT_EQ(commands.count("tavik_helper.sh remove \"TCP,9091,192.168.77.1,80\""), 1);
    EXPECT_TRUE(gateway.calls().empty());
}

}  // namespace
}  // namespace pelorus
