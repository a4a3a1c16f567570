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
    EXPECT_EQ(requestsAtStart, 3U);
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    EXPECT_EQ(web.count("http://127.0.0.1:8080/delforward?8080"), 1);
    EXPECT_EQ(web.count("/lanip?"), 1);  // the LAN address is new
    EXPECT_EQ(statusWords(), (Texts{"relayed"}));
    EXPECT_EQ(events(), (Texts{"connecting/relayed", "connected/relayed"}));
}

TEST_F(RelayConnectionTest, RelayForgetsThePortsAndLeavesTheirMappings) {
    givenForwardedPorts();
    ASSERT_EQ(manager().createDirectConnection(), PORTFORWARDED);  // maps nothing
    relayWorks();
    web.answer("/forward?", FakeWeb::noAnswer());  // the tunnel starts all the same
    EXPECT_EQ(manager().createRelayConnection(), RELAYED);
    EXPECT_EQ(mappedPorts(), (Ports{9091, 9444}));
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("allocatedHttpPort 0, allocatedHttpsPort 0."), 1);
}

TEST_F(RelayConnectionTest, RunningTunnelIsKeptAndEndsAForcedAttempt) {
    clientRuns();
    manager().setForceConnect(true);
    EXPECT_EQ(manager().createRelayConnection(), RELAYED);
    EXPECT_EQ(commands.count("start-client"), 0);
    EXPECT_TRUE(records().empty());
    EXPECT_EQ(statusWords(), (Texts{"relayed"}));
    expectLogged(LOG_INFO, "ConnectionManager::setForceConnect = 0\n");
}

TEST_F(RelayConnectionTest, TunnelThatDoesNotComeUpIsReported) {
    writeFile("client.out", "");
    manager().setForceConnect(true);
    log.clear();
    EXPECT_EQ(manager().createRelayConnection(), FAILED);
    EXPECT_EQ(statusWords(), (Texts{"failed"}));
    EXPECT_EQ(events(), (Texts{"connecting/relayed", "failed/relayed"}));
    EXPECT_EQ(log.countPart("setForceConnect"), 0);
}

TEST_F(RelayConnectionTest, ServerThatAsksForAWaitKeepsEverythingAsItIs) {
    askToWait();
    EXPECT_EQ(manager().createRelayConnection(), FAILED);
    EXPECT_TRUE(records().empty());
    EXPECT_TRUE(statusWords().empty());
    EXPECT_EQ(commands.count("start-client"), 0);
}

TEST_F(RelayConnectionTest, NothingIsDoneWhileBothPortsAreMapped) {
    ASSERT_EQ(manager().createDirectConnection(), PORTFORWARDED);
    forget();
    EXPECT_EQ(manager().createRelayConnection(), PORTFORWARDED);
    EXPECT_TRUE(web.urls().empty());
    EXPECT_TRUE(commands.lines().empty());
}

class KillConnectionTest : public ConnectionTest {};

TEST_F(KillConnectionTest, DirectRemovesOwnMappingsAndTheRecordOnly) {
    const FakeGateway::Mapping ssh{5000, kLanIp, 22, "ssh"};
    const FakeGateway::Mapping theirs{9093, "192.168.77.66", 80, "Kavra"};
    for (const auto& mapping : {FakeGateway::Mapping{9091, kLanIp, 8080, "Kavra"}, ssh, theirs,
                                FakeGateway::Mapping{9444, kLanIp, 8443, "KavraSSL"}}) {
        gateway.add(mapping);
    }
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(gateway.mappings(), (std::vector<FakeGateway::Mapping>{ssh, theirs}));
    EXPECT_EQ(records(), (Texts{"NULL&192.168.77.10&0&0"}));
    EXPECT_EQ(log.countPart("successfully deleted port mappings on central server.\n"), 1);
    EXPECT_EQ(web.count("/lanip?"), 1);  // the gateway object is new, so the address is
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(web.count("/lanip?"), 1);
}

TEST_F(KillConnectionTest, PortsOfTheConnectionAreForgotten) {
    givenForwardedPorts();
    manager().killConnection(PORTFORWARDED);
    manager().createDirectConnection();
    EXPECT_EQ(log.countPart("allocatedHttpPort 0, allocatedHttpsPort 0."), 1);
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
}

TEST_F(KillConnectionTest, OtherTypesDoNothing) {
    for (const auto type : {NONE, CONNECTING, FAILED}) manager().killConnection(type);
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(KillConnectionTest, MakersRouterRemovesThroughItsScript) {
    givenMakersRouter(
        "", "BRENVIK,TCP,9091,192.168.77.1,80,Kavra\nOTHER,TCP,9092,192.168.77.66,80,x\n");
    manager().killConnection(PORTFORWARDED);
    EXPECT_EQ(commands.count(" remove "), 1);
    EXPECT_EQ(commands.count("tavik_helper.sh remove \"TCP,9091,192.168.77.1,80\""), 1);
    EXPECT_TRUE(gateway.calls().empty());
}

}  // namespace
}  // namespace pelorus
