#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

using support::expectLogged;
using support::expectLogIs;
using support::FakeGateway;

class PortMappingTest : public RouterTest {
protected:
    bool map(int internalPort, int externalPort, bool isHttps = false) {
        port = externalPort;
        return router.mapPort(internalPort, port, "TCP", isHttps ? "KavraSSL" : "Kavra", isHttps);
    }
    int port = 0;
};

TEST_F(PortMappingTest, MapsAFreePortWithoutALease) {
    discovered();
    EXPECT_TRUE(map(443, 9444, true));
    EXPECT_EQ(gateway.mappings(), (Mappings{{9444, "192.168.77.10", 443, "KavraSSL"}}));
    EXPECT_EQ(gateway.calls(),
              (Texts{"entry TCP 9444", "map TCP 9444 -> 192.168.77.10:443 KavraSSL"}));
    expectLogIs(
        {{LOG_INFO, "Router::mapPort() - UPNP_GetSpecificPortMappingEntry returned status[714]\n"},
         {LOG_DEBUG, "Router::mapPort() - lifetime 0\n"},
         {LOG_INFO,
          "Router::mapPort() - success - external port: 9444 has been mapped to internal port: "
          "443  \n"},
         {LOG_INFO,
          "Router::mapPort  set HTTPS PMTracker params. internal_port 443, external_port 9444, "
          "lifetime 604800\n"},
         {LOG_INFO,
          "Router::mapPort - get after setting HTTPS PMTracker params.   internalPort[443], "
          "mappedExternalPort[9444], lifetime[604800]\n"}});
}

struct Refusal {
    const char* name;
    bool discovered;
    int internalPort;
    int externalPort;
    const char* protocol;
    std::string message;
};

class RefusedMapping : public PortMappingTest, public ::testing::WithParamInterface<Refusal> {};

TEST_P(RefusedMapping, IsNotAskedOfTheGateway) {
    const Refusal& row = GetParam();
    if (row.discovered) discovered();
    port = row.externalPort;
    EXPECT_FALSE(router.mapPort(row.internalPort, port, row.protocol, "Kavra", false));
    expectLogIs({{LOG_ERR, "Router::mapPort() - " + row.message + "\n"}});
    EXPECT_EQ(gateway.calls(), Texts{});
}

const std::string kTooLow = "internal and external ports must be greater than 10";
const std::string kBadProtocol = "protocol must be either 'TCP' or 'UDP' ";

INSTANTIATE_TEST_SUITE_P(
    ,
    RefusedMapping,
    ::testing::Values(
        Refusal{"LowInternalPort", true, 10, 8080, "TCP", kTooLow},
        Refusal{"LowExternalPortEvenBeforeDiscovery", false, 8080, 10, "TCP", kTooLow},
        Refusal{"NotDiscovered", false, 11, 11, "tcp",
                "must call Router:: discover() to load port map before calling this function "},
        Refusal{"LowerCaseProtocol", true, 11, 11, "tcp", kBadProtocol},
        Refusal{"EmptyProtocol", true, 11, 11, "", kBadProtocol}),
    [](const auto& row) { return row.param.name; });

struct Entry {
    const char* name;
    int status;
    std::string client;
    std::string internalPort;
    bool mapped;
    std::string message;  // what is logged about the entry, empty for nothing
};

class ExistingEntry : public PortMappingTest, public ::testing::WithParamInterface<Entry> {};

TEST_P(ExistingEntry, DecidesWhetherThePortIsFree) {
    const Entry& row = GetParam();
    discovered();
    FakeGateway::Reply reply;
    reply.status = row.status;
    reply.client = row.client;
    reply.internalPort = row.internalPort;
    gateway.lieAboutEntry(reply);
    EXPECT_EQ(map(80, 9091), row.mapped);
    EXPECT_EQ(gateway.count("map TCP"), row.mapped ? 1 : 0);
    EXPECT_EQ(log.countPart("already mapped"), row.message.empty() ? 0 : 1);
    if (!row.message.empty()) {
        expectLogged(LOG_INFO, "Router::mapPort() - internal port: 80 is " + row.message + "\n");
    }
}

INSTANTIATE_TEST_SUITE_P(
    ,
    ExistingEntry,
    ::testing::Values(Entry{"OwnIsRefreshed", 0, "192.168.77.10", "80", true,
                            "already mapped to external port: 9091"},
                      Entry{"OwnWithAnotherPortIsForeign", 0, "192.168.77.10", "8080", false,
                            "already mapped to another IP: 192.168.77.10"},
                      Entry{"OwnWithoutAPortIsForeign", 0, "192.168.77.10", "", false,
                            "already mapped to another IP: 192.168.77.10"},
                      Entry{"ForeignIsKept", 0, "192.168.77.7", "80", false,
                            "already mapped to another IP: 192.168.77.7"},
                      Entry{"CountsWhateverTheStatus", 501, "192.168.77.7", "80", false,
                            "already mapped to another IP: 192.168.77.7"},
                      Entry{"LongerThanItsRoomIsForeign", 0, "%s%n.%s%n%s%n.7777", "8080808080",
                            false, "already mapped to another IP: %s%n.%s%n%s%n.77"},
                      Entry{"OverlongNumberIsForeign", 0, "1.99999999999999", "80", false,
                            "already mapped to another IP: 1.99999999999999"},
                      Entry{"NoHostOfItsOwnIsOverwritten", 0, "192.168.77.0", "80", true, ""},
                      Entry{"NameIsOverwritten", 0, "nobody", "80", true, ""},
                      Entry{"NoClientIsFree", 0, "", "80", true, ""}),
    [](const auto& row) { return row.param.name; });

TEST_F(PortMappingTest, TellsWhatTheGatewaySaysOfAPort) {
    discovered();
    gateway.add({9091, "192.168.77.10", 80, std::string("%s of ") + support::kDeviceId});
    EXPECT_TRUE(map(80, 9091));
    expectLogged(LOG_INFO,
                 "Router::mapPort() - UPNP_GetSpecificPortMappingEntry returned status[0], "
                 "intClient[192.168.77.10], intPort[80], desc[%s of *ID_REMOVED*], enabled[1], "
                 "leaseDuration[0]\n");
}

TEST_F(PortMappingTest, UnmappingForgetsTheTrackerOfTheInternalPort) {
    discovered();
    ASSERT_TRUE(map(80, 9091));
    ASSERT_TRUE(map(443, 9444, true));
    gateway.add({7000, "192.168.77.10", 22});
    log.clear();
    EXPECT_TRUE(router.unmapPort(22, 7000, "TCP"));
    EXPECT_TRUE(router.unmapPort(80, 9091, "TCP"));
    EXPECT_TRUE(router.unmapPort(443, 9444, "TCP"));
    EXPECT_TRUE(gateway.mappings().empty());
    const std::string head = "Router::unmapPort()";
    expectLogIs(
        {{LOG_INFO, head + " - success - external port: 7000 has been unmapped\n"},
         {LOG_INFO,
          head + "  internal ports mismatch when destroying port mapping. tracked_internal_port "
                 "443, req_internal_port 22, external_port 9444, lifetime 604800\n"},
         {LOG_INFO, head + " - success - external port: 9091 has been unmapped\n"},
         {LOG_INFO,
          head + "  destroyed HTTP port mapping. internal_port 80, external_port 9091, lifetime "
                 "604800\n"},
         {LOG_INFO, head + " - success - external port: 9444 has been unmapped\n"},
         {LOG_INFO, head + "  destroyed HTTPS port mapping. internal_port 443, external_port 9444, "
                           "lifetime 604800\n"}});
}

TEST_F(PortMappingTest, ARefusedMappingIsAFailure) {
    discovered();
    gateway.refusePort(9091);
    EXPECT_FALSE(map(80, 9091));
    EXPECT_EQ(log.lines().back().text,
              "Router::mapPort() - fail - failed to map external port: 9091, to internal port: "
              "80, status: 718\n");
}

TEST_F(PortMappingTest, UnmappingFailures) {
    EXPECT_FALSE(router.unmapPort(80, 9091, "TCP"));
    expectLogIs({{LOG_INFO, "Router::unmapPort() - router discovery failed or was not done \n"}});
    discovered();
    EXPECT_FALSE(router.unmapPort(80, 9091, "Tcp"));
    EXPECT_FALSE(router.unmapPort(80, 9091, "TCP"));
    expectLogIs({{LOG_ERR, "Router::unmapPort() - protocol must be either 'TCP' or 'UDP' \n"},
                 {LOG_INFO, "Router::unmapPort() - fail - failed to unmap external port: 9091\n"}});
    EXPECT_EQ(gateway.calls(), (Texts{"unmap TCP 9091"}));
}

TEST_F(PortMappingTest, UnmappingAllRemovesOwnEntriesOnlyAndReportsFailure) {
    discovered();
    const Mappings others{{9001, "192.168.77.7", 80, "Kavra"},
                          {9002, "192.168.77.10", 80, "KavraSSL"},
                          {9003, "192.168.77.10", 80, "Kavra", "UDP"}};
    gateway.add({9100, "192.168.77.10", 80, "Kavra"});
    gateway.add({9101, "192.168.77.10", 81, "Kavra"});
    for (const Mapping& mapping : others) gateway.add(mapping);
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.mappings(), others);
    // The second entry moves into the place of the first and is met in the second pass.
    const std::string mismatch =
        "Router::unmapPort()  internal ports mismatch when destroying port mapping. "
        "tracked_internal_port 0, req_internal_port 0, external_port 0, lifetime 0\n";
    expectLogIs(
        {{LOG_INFO, "Router::unmapAllPorts() - un-mapping port: 9100 for IP: 192.168.77.10 \n"},
         {LOG_INFO, "Router::unmapPort() - success - external port: 9100 has been unmapped\n"},
         {LOG_INFO, mismatch},
         {LOG_INFO, "Router::unmapAllPorts() - un-mapping port: 9101 for IP: 192.168.77.10 \n"},
         {LOG_INFO, "Router::unmapPort() - success - external port: 9101 has been unmapped\n"},
         {LOG_INFO, mismatch},
         {LOG_INFO, "Router::unmapAllPorts() - fail\n"}});
}

TEST_F(PortMappingTest, UnmappingAllKeepsTheTrackers) {
    discovered();
    ASSERT_TRUE(map(80, 9091));
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    gateway.clear();
    clock.advance(302401);
    router.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls("map TCP"), (Texts{"map TCP 9091 -> 192.168.77.10:80 "}));
}

TEST_F(PortMappingTest, ATableWithoutEndEndsAtTheHighestIndex) {
    discovered();
    FakeGateway::Reply reply;
    reply.client = "192.168.77.7";
    reply.description = "%s%n";
    gateway.lieAboutTable(reply);
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.count("entry #"), 2 * 65536);
    EXPECT_EQ(gateway.calls().back(), "entry #65535");
    gateway.clear();
    EXPECT_EQ(router.getMappedInternalPort(9091, "TCP"), -1);
    EXPECT_EQ(gateway.count("entry #"), 2 * 65536);
}

TEST_F(PortMappingTest, AnEntryLongerThanItsRoomIsNotOurs) {
    discovered();
    FakeGateway::Reply reply;
    reply.client = "192.168.77.10.168.77.10";
    reply.externalPort = "90919091";
    reply.internalPort = "80808080";
    reply.protocol = "TCPTCP";
    reply.description = std::string(200, 'K');
    reply.enabled = "11111";
    reply.lease = std::string(40, '9');
    gateway.lieAboutTable(reply);
    EXPECT_EQ(router.getMappedInternalPort(909190, "TCP"), -1);
}

TEST_F(PortMappingTest, FindsTheInternalPortOfThisDevice) {
    discovered();
    gateway.add({9091, "192.168.77.10", 22, "", "UDP"});
    gateway.add({9090, "192.168.77.7", 80});
    gateway.add({9091, "192.168.77.10", 80});
    EXPECT_EQ(router.getMappedInternalPort(9091, "TCP"), 80);
    EXPECT_EQ(gateway.calls(), (Texts{"entry #0", "entry #1", "entry #2"}));
    EXPECT_TRUE(router.isPortMapped(9091, "TCP"));
    EXPECT_EQ(router.getMappedInternalPort(9090, "TCP"), -1);
    EXPECT_FALSE(router.isPortMapped(9090, "TCP"));
}

TEST_F(PortMappingTest, TheTableCannotBeAskedBeforeDiscovery) {
    const std::string mustDiscover =
        "must call Router:: discover() to load port map before calling this function \n";
    EXPECT_EQ(router.getMappedInternalPort(9091, "TCP"), 0);
    EXPECT_TRUE(router.isPortMapped(9091, "TCP"));
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    expectLogIs({{LOG_ERR, "Router::getMappedInternalPort - " + mustDiscover},
                 {LOG_ERR, "Router::getMappedInternalPort - " + mustDiscover},
                 {LOG_ERR, "Router::unmapAllPorts() - " + mustDiscover}});
    discovered();
    EXPECT_EQ(router.getMappedInternalPort(9091, "udp"), 0);
    EXPECT_FALSE(router.unmapAllPorts("udp", "Kavra"));
    expectLogIs({{LOG_ERR, "Router::getMappedInternalPort - " + kBadProtocol + "\n"},
                 {LOG_ERR, "Router::unmapAllPorts() - " + kBadProtocol + "\n"}});
    EXPECT_EQ(gateway.calls(), Texts{});
}

TEST_F(PortMappingTest, RenewsAfterHalfAWeekWithoutTheDescription) {
    discovered();
    ASSERT_TRUE(map(443, 9444, true));
    ASSERT_TRUE(map(80, 9091));
    clock.advance(302400);
    gateway.clear();
    log.clear();
    router.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls(), Texts{});
    expectLogIs({});

    clock.advance(1);
    router.setReqPortMappingLifetime(600, 700);
    router.renewPortMapping("HTTPS");
    EXPECT_EQ(gateway.calls("map TCP"), (Texts{"map TCP 9444 -> 192.168.77.10:443 "}));
    const long start = support::VirtualClock::kStart;
    EXPECT_EQ(log.lines().front().text, "Router::renewPortMapping - pastHalfway() returned TRUE\n");
    EXPECT_EQ(log.lines().back().text,
              "Router::renewPortMapping - Renew port mapping PORTFORWARDED HTTPS: mapPort "
              "returncode[1], internalPort[443], new externalPort[9444], now[" +
                  std::to_string(start + 302401) + "], previous start[" + std::to_string(start) +
                  "], previous lifetime[604800], new lifetime[600].\n");
    gateway.clear();
    router.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls("map TCP"), (Texts{"map TCP 9091 -> 192.168.77.10:80 "}));
}

TEST_F(PortMappingTest, AnIdleTrackersRenewalStopsAtThePortCheck) {
    discovered();
    router.renewPortMapping("HTTP");
    EXPECT_EQ(gateway.calls(), Texts{});
    expectLogIs({{LOG_INFO, "Router::renewPortMapping - pastHalfway() returned TRUE\n"},
                 {LOG_ERR, "Router::mapPort() - " + kTooLow + "\n"},
                 {LOG_INFO,
                  "Router::renewPortMapping - Renew port mapping PORTFORWARDED HTTP: mapPort "
                  "returncode[0], internalPort[0], new externalPort[0], now[1700000000], previous "
                  "start[0], previous lifetime[0], new lifetime[604800].\n"}});
}

TEST_F(PortMappingTest, NatpmpGetsTheCallsAndTheGrantComesBack) {
    discoveredThroughNatpmp();
    FakeGateway::Grant grant;
    grant.publicPort = 40000;
    gateway.grant(grant);
    EXPECT_TRUE(map(443, 9444, true));
    EXPECT_EQ(port, 40000);
    EXPECT_EQ(log.lines().back().text,
              "Router::mapPort() - success - external port: 40000 has been mapped to internal "
              "port: 443  \n");
    EXPECT_TRUE(router.unmapPort(443, 40000, "TCP"));
    EXPECT_EQ(log.lines().back().text,
              "Router::unmapPort() - success - external port: 40000 has been unmapped\n");
    EXPECT_TRUE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(log.lines().back().text, "Router::unmapAllPorts() - success\n");
    clock.advance(1);
    gateway.clear();
    router.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls("natpmp map"), Texts(2, "natpmp map TCP 0 -> 0 for 172800 s"));
    EXPECT_EQ(log.countPart("Router::renewPortMapping"), 0);
}

TEST_F(PortMappingTest, NatpmpFailuresAreToldToo) {
    discoveredThroughNatpmp();
    gateway.refuseAllPorts();
    gateway.refuseRemovals();
    EXPECT_FALSE(map(80, 9091));
    EXPECT_EQ(log.lines().back().text,
              "Router::mapPort() - fail - failed to map external port: 9091, to internal port: "
              "80\n");
    EXPECT_FALSE(router.unmapPort(80, 9091, "TCP"));
    EXPECT_EQ(log.lines().back().text,
              "Router::unmapPort() - fail - failed to unmap external port: 9091\n");
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(log.lines().back().text, "Router::unmapAllPorts() - fail\n");
}

}  // namespace
}  // namespace pelorus
