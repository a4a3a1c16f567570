#include <csignal>

#include "common/stop_budget.h"
#include "common/termination.h"
#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

class PortMappingTest : public RouterTest {
protected:
    bool map(int internalPort, int externalPort, bool isHttps = false) {
        port = externalPort;
        return router.mapPort(internalPort, port, "TCP", isHttps ? "KavraSSL" : "Kavra", isHttps);
    }
    void mapBoth() { ASSERT_TRUE(map(80, 9091) && map(443, 9444, true)); }
    void wait(time_t seconds) {
        clock.advance(seconds);
        gateway.clear();
        router.CheckExpiredMappings();
    }
    int port = 0;
};

TEST_F(PortMappingTest, RefusalsAndMissingDiscoveryFail) {
    const auto refusal = [&](int internalPort, int externalPort, const char* protocol) {
        EXPECT_FALSE(router.mapPort(internalPort, externalPort, protocol, "Kavra", false));
        return log.lines().back().text.substr(0, 36);
    };
    EXPECT_EQ(refusal(8080, 10, "TCP"), "Router::mapPort() - internal and ext");
    EXPECT_EQ(refusal(11, 11, "tcp"), "Router::mapPort() - must call Router");
    EXPECT_FALSE(router.unmapPort(80, 9091, "TCP") || router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(router.getMappedInternalPort(9091, "TCP"), 0);
    EXPECT_TRUE(router.isPortMapped(9091, "TCP"));
    discovered();
    EXPECT_EQ(refusal(10, 8080, "TCP"), "Router::mapPort() - internal and ext");
    EXPECT_EQ(refusal(11, 11, "tcp"), "Router::mapPort() - protocol must be");
    EXPECT_EQ(router.getMappedInternalPort(9091, "udp"), 0);
    EXPECT_FALSE(router.unmapAllPorts("udp", "Kavra") || router.unmapPort(80, 9091, "Tcp"));
    EXPECT_FALSE(router.unmapPort(80, -12345, "TCP"));
    EXPECT_EQ(gateway.calls(), (Texts{"unmap TCP -1234"}));  // as the library holds a port
    expectLogged(LOG_INFO, "Router::unmapPort() - fail - failed to unmap external port: -12345\n");
    gateway.refusePort(9091);
    EXPECT_FALSE(map(80, 9091));
    once("port: 9091, to internal port: 80, status: 718\n");
}

// clang-format off
struct Entry { const char* name; int status; std::string client, internalPort; const char* holder; };
class ExistingEntry : public PortMappingTest, public ::testing::WithParamInterface<Entry> {};
INSTANTIATE_TEST_SUITE_P(, ExistingEntry, ::testing::Values(
    Entry{"OwnIsRefreshed", 0, "192.168.77.10", "80", nullptr},
    Entry{"OwnWithAnotherPortIsForeign", 0, "192.168.77.10", "8080", "192.168.77.10"},
    Entry{"CountsWhateverTheStatus", 501, "192.168.77.7", "80", "192.168.77.7"},
    Entry{"OverlongTextsAreForeign", 0, "%s%n.%s%n%s%n.7777", "808080", "%s%n.%s%n%s%n.77"},
    Entry{"NetworkAddressIsOverwritten", 0, "192.168.77.0", "80", nullptr},
    Entry{"NameIsOverwritten", 0, "nobody", "80", nullptr}), RowName{});
// clang-format on

TEST_P(ExistingEntry, DecidesWhetherThePortIsFree) {
    const Entry& row = GetParam();
    discovered();
    // The description stays out of the log.
    gateway.lie = {row.status, row.client, row.internalPort, support::kDeviceId};
    EXPECT_EQ(map(80, 9091), row.holder == nullptr);
    EXPECT_EQ(gateway.count("map TCP"), row.holder == nullptr ? 1 : 0);
    once(row.status == 0 ? "returned status[0], intClient[" : "returned status[501]\n");
    const std::string line = "internal port: 80 is already mapped to another IP: ";
    EXPECT_EQ(log.countPart(line), row.holder == nullptr ? 0 : 1);
    if (row.holder != nullptr)
        expectLogged(LOG_INFO, "Router::mapPort() - " + line + row.holder + "\n");
}

TEST_F(PortMappingTest, UnmappingForgetsTheLeaseOfTheInternalPort) {
    discovered();
    mapBoth();
    once(
        "setting HTTPS PMTracker params.   internalPort[443], mappedExternalPort[9444], lifetime[604800]");
    gateway.add({7000, "192.168.77.10", 22});
    EXPECT_TRUE(router.unmapPort(22, 7000, "TCP"));
    EXPECT_TRUE(router.unmapPort(80, 9091, "TCP"));
    EXPECT_EQ(gateway.mappings(), (Mappings{{9444, "192.168.77.10", 443, "KavraSSL"}}));
    once("tracked_internal_port 443, req_internal_port 22, external_port 9444");
    once("destroyed HTTP port mapping. internal_port 80, external_port 9091");
    wait(302401);
    EXPECT_EQ(gateway.calls("map TCP"), (Texts{"map TCP 9444 -> 192.168.77.10:443 "}));
    EXPECT_TRUE(router.unmapPort(443, 9444, "TCP"));
    once("destroyed HTTPS port mapping. internal_port 443, external_port 9444");
    once("destroyed HTTPS");
    once("mismatch");
}

TEST_F(PortMappingTest, UnmappingAllRemovesOnlyEntriesOfThisDevice) {
    discovered();
    const Mappings others{{9003, "192.168.77.7", 80, "Kavra"},
                          {9002, "192.168.77.10", 80, "KavraSSL"},
                          {9003, "192.168.77.10", 80, "Kavra", "UDP"}};
    // The second entry moves into the place of the first and is met in the second pass.
    ASSERT_TRUE(map(80, 9100));
    gateway.add({9101, "192.168.77.10", 81, "Kavra"});
    for (const Mapping& mapping : others) gateway.add(mapping);
    gateway.clear();
    EXPECT_EQ(router.getMappedInternalPort(9101, "TCP"), 81);
    EXPECT_EQ(gateway.calls(), (Texts{"entry #0", "entry #1"}));
    EXPECT_EQ(router.getMappedInternalPort(9002, "TCP"), 80);
    EXPECT_FALSE(router.isPortMapped(9003, "TCP"));
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.mappings(), others);
    wait(302401);
    EXPECT_EQ(gateway.calls("map TCP"), (Texts{"map TCP 9100 -> 192.168.77.10:80 "}));
}

TEST_F(PortMappingTest, AnEndlessTableIsCutOff) {
    discovered();
    ASSERT_TRUE(map(443, 9444, true));
    gateway.lie = {0, "192.168.77.10.168.77.10", "80808080", std::string(200, 'K')};
    gateway.lie->externalPort = "90919091";
    gateway.lie->protocol = "TCPTCP";
    gateway.lie->enabled = gateway.lie->lease = std::string(40, '9');
    EXPECT_EQ(router.getMappedInternalPort(909190, "TCP"), -1);
    EXPECT_EQ(gateway.count("entry #"), 2 * 65536);
    EXPECT_EQ(gateway.calls().back(), "entry #65535");
    gateway.clear();
    gateway.onCall([&](const std::string&) { clock.advance(10); });
    gateway.lie = {0, "192.168.77.10", "80", "Kavra", "7000", "TCP"};
    EXPECT_TRUE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.count("entry #"), 2 * 4);  // a minute for each pass
    EXPECT_EQ(gateway.count("unmap TCP 7000"), 2 * 4);
    EXPECT_EQ(log.countPart("destroyed HTTP"), 0);
    wait(302401);
    EXPECT_EQ(gateway.calls(), Texts{});
}

TEST_F(PortMappingTest, AnEndlessTableEndsWithTheStopBudget) {
    discovered();
    gateway.lie = {0, "192.168.77.20", "80", "another", "7000", "TCP"};
    gateway.onCall([&](const std::string& call) {
        if (call == "entry #5") sigConnKilled = SIGTERM;
        if (call == "entry #8") renewStopBudget(0);
    });
    router.unmapAllPorts("TCP", "Kavra");
    EXPECT_EQ(gateway.calls().back(), "entry #8");
    EXPECT_EQ(gateway.calls().size(), 9U);
}

TEST_F(PortMappingTest, RenewsAfterHalfAWeek) {
    discovered();
    router.renewPortMapping("HTTP");  // tracks nothing, so the port is refused
    EXPECT_EQ(gateway.calls(), Texts{});
    once("PORTFORWARDED HTTP: mapPort returncode[0], internalPort[0], new");
    mapBoth();
    wait(302400);
    EXPECT_EQ(gateway.calls(), Texts{});
    clock.advance(1);
    router.setReqPortMappingLifetime(600, 700);
    router.renewPortMapping("HTTPS");
    once("previous lifetime[604800], new lifetime[600].\n");
    router.CheckExpiredMappings();  // the first one starts a new half, the other is still due
    EXPECT_EQ(gateway.calls("map TCP"),
              (Texts{"map TCP 9444 -> 192.168.77.10:443 ", "map TCP 9091 -> 192.168.77.10:80 "}));
    wait(300);
    EXPECT_EQ(gateway.calls(), Texts{});
    wait(1);
    EXPECT_EQ(gateway.count("map TCP"), 2);
}

TEST_F(PortMappingTest, NatpmpGetsTheCalls) {
    router.setReqPortMappingLifetime(600, 700);
    discoveredThroughNatpmp();
    gateway.grant({40000});
    EXPECT_TRUE(map(443, 9444, true));
    EXPECT_EQ(port, 40000);
    wait(351);
    EXPECT_EQ(gateway.calls("40000"), (Texts{"natpmp map TCP 40000 -> 443 for 700 s"}));
    EXPECT_EQ(log.countPart("Router::renewPortMapping"), 0);
    EXPECT_TRUE(router.unmapPort(443, 40000, "TCP") && router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.count("natpmp map TCP 0 -> 443 for 0 s"), 1);
    gateway.refuseAllPorts();
    gateway.keepMappings = true;
    EXPECT_FALSE(map(80, 9091) || router.unmapPort(80, 9091, "TCP"));
    EXPECT_FALSE(router.unmapAllPorts("TCP", "Kavra"));
    once("port: 9091, to internal port: 80\n");
}

}  // namespace
}  // namespace pelorus
