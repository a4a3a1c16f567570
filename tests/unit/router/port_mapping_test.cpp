#include "support/fake_files.h"
#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

class PortMappingTest : public RouterTest {
protected:
    bool map(int internalPort, int externalPort, const char* protocol = "TCP") {
        return router.mapPort(internalPort, externalPort, protocol, "Kavra", internalPort == 443);
    }
    Texts renewedAfter(time_t seconds) {
        clock.advance(seconds);
        gateway.clear();
        router.CheckExpiredMappings();
        return gateway.calls("map TCP");
    }
};

TEST_F(PortMappingTest, RefusalsAndMissingDiscoveryFail) {
    EXPECT_FALSE(map(8080, 10) || map(11, 11, "tcp"));
    once("Router::mapPort() - internal and ext");
    once("Router::mapPort() - must call Router");
    EXPECT_FALSE(router.unmapPort(80, 9091, "TCP") || router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(router.getMappedInternalPort(9091, "TCP"), 0);
    discovered();
    EXPECT_FALSE(map(10, 8080) || map(11, 11, "tcp"));
    once("Router::mapPort() - internal and ext");
    once("Router::mapPort() - protocol must be");
    EXPECT_FALSE(router.unmapAllPorts("udp", "Kavra") || router.unmapPort(80, 9091, "Tcp"));
    EXPECT_EQ(router.getMappedInternalPort(9091, "udp"), 0);
    EXPECT_FALSE(router.unmapPort(80, -12345, "TCP"));
    EXPECT_EQ(gateway.calls(), (Texts{"unmap TCP -1234"}));  // as the library holds a port
    once("Router::unmapPort() - fail - failed to unmap external port: -12345\n");
    gateway.refused.insert(9091);
    EXPECT_FALSE(map(80, 9091));
}

TEST_F(PortMappingTest, AnEntryOfAnotherHostKeepsItsPort) {
    discovered();
    const auto row = [&](int status, const char* client, const char* to, const std::string& owner) {
        log.clear();
        gateway.clear();
        // The description stays out of the log.
        gateway.lie = {status, client, to, support::kDeviceId};
        EXPECT_EQ(map(80, 9091), owner.empty()) << client;
        EXPECT_EQ(gateway.count("map TCP"), owner.empty() ? 1 : 0) << client;
        once(status == 0 ? "returned status[0], intClient[" : "returned status[501]\n");
        EXPECT_EQ(log.countPart("already mapped to another IP: " + owner), owner.empty() ? 0 : 1);
    };
    row(0, "192.168.77.10", "80", "");
    row(0, "192.168.77.10", "8080", "192.168.77.10");
    row(501, "192.168.77.7", "80", "192.168.77.7");
    row(0, "%s%n.%s%n%s%n.7777", "808080", "%s%n.%s%n%s%n.77\n");  // too long
    row(0, "192.168.77.0", "80", "");
    row(0, "host.lan", "80", "");
}

TEST_F(PortMappingTest, ALeaseIsRenewedAfterItsHalfUntilItIsUnmapped) {
    const std::string http = "map TCP 9091 -> 192.168.77.10:80 ";
    const std::string https = "map TCP 9444 -> 192.168.77.10:443 ";
    discovered();
    EXPECT_EQ(renewedAfter(0), Texts{});
    once("PORTFORWARDED HTTP: mapPort returncode[0], internalPort[0], new");
    EXPECT_TRUE(map(80, 9091) && map(443, 9444));
    EXPECT_EQ(renewedAfter(302400), Texts{});
    clock.advance(1);
    router.setReqPortMappingLifetime(600, 700);
    router.renewPortMapping("HTTPS");
    once("previous start[1700000000], previous lifetime[604800], new lifetime[600].\n");
    EXPECT_EQ(renewedAfter(0), Texts{http});
    EXPECT_EQ(renewedAfter(300), Texts{});
    EXPECT_EQ(renewedAfter(1), (Texts{http, https}));

    gateway.table.push_back({7000, "192.168.77.10", 22});
    EXPECT_TRUE(router.unmapPort(22, 7000, "TCP") && router.unmapPort(80, 9091, "TCP"));
    EXPECT_EQ(gateway.table, (Mappings{{9444, "192.168.77.10", 443}}));
    EXPECT_EQ(renewedAfter(301), Texts{https});
    EXPECT_TRUE(router.unmapPort(443, 9444, "TCP"));
    EXPECT_EQ(renewedAfter(301), Texts{});
    once("tracked_internal_port 443, req_internal_port 22, external_port 9444");
    once("destroyed HTTP port mapping. internal_port 80, external_port 9091");
    for (const char* part : {"destroyed HTTPS", "mismatch"}) once(part);
}

TEST_F(PortMappingTest, UnmappingAllRemovesOnlyEntriesOfThisDevice) {
    discovered();
    const Mappings others{{9003, "192.168.77.7", 80, "Kavra"},
                          {9002, "192.168.77.10", 80, "KavraSSL"},
                          {9003, "192.168.77.10", 80, "Kavra", "UDP"}};
    // The second entry moves into the place of the first and is met in the second pass.
    ASSERT_TRUE(map(80, 9100));
    gateway.table.push_back({9101, "192.168.77.10", 81, "Kavra"});
    for (const Mapping& mapping : others) gateway.table.push_back(mapping);
    gateway.clear();
    EXPECT_EQ(router.getMappedInternalPort(9101, "TCP"), 81);
    EXPECT_EQ(gateway.calls(), (Texts{"entry #0", "entry #1"}));
    EXPECT_FALSE(router.isPortMapped(9003, "TCP") || router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.table, others);
    EXPECT_EQ(renewedAfter(302401), (Texts{"map TCP 9100 -> 192.168.77.10:80 "}));
}

TEST_F(PortMappingTest, AnEndlessTableIsCutOff) {
    support::FakeProcess::get().startsThreads = false;  // the fakes answer at once
    discovered();
    ASSERT_TRUE(map(443, 9444));
    const std::string big(99, '9');
    gateway.lie = {0, "192.168.77.10.168.77.10", "80808080", big, "90919091", "TCPTCP", big, big};
    EXPECT_EQ(router.getMappedInternalPort(909190, "TCP"), -1);
    EXPECT_EQ(gateway.count("entry #"), 2 * 65536);
    gateway.clear();
    gateway.onCall([&](const std::string&) { clock.advance(10); });
    gateway.lie = {0, "192.168.77.10", "80", "Kavra", "7000", "TCP"};
    EXPECT_TRUE(router.unmapAllPorts("TCP", "Kavra"));
    EXPECT_EQ(gateway.count("entry #"), 2 * 4);  // a minute for each pass
    EXPECT_EQ(gateway.count("unmap TCP 7000"), 2 * 4);
    gateway.lie.reset();
    EXPECT_EQ(renewedAfter(302401), Texts{});
}

TEST_F(PortMappingTest, WithANatpmpGatewayAllCallsGoToNatpmp) {
    router.setReqPortMappingLifetime(600, 700);
    discovered("NAT-PMP");
    EXPECT_TRUE(map(443, 9444));
    EXPECT_EQ(renewedAfter(351).back(), "natpmp map TCP 9444 -> 443 for 700 s");
    EXPECT_EQ(log.countPart("Router::renewPortMapping"), 0);
    EXPECT_TRUE(router.unmapPort(443, 9444, "TCP") && router.unmapAllPorts("TCP", "Kavra"));
}

}  // namespace
}  // namespace pelorus
