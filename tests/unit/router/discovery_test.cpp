#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

using DiscoveryTest = RouterTest;

TEST_F(DiscoveryTest, UpnpIsPreferredAndChangesAreReportedUntilTheyAreRead) {
    net.interfacesFail = true;
    discovered("NAT-PMP");
    EXPECT_TRUE(router.isNatPMPGateway());
    net.interfacesFail = false;
    gateway.upnp = true;
    EXPECT_TRUE(router.discover() && !router.isNatPMPGateway());
    EXPECT_EQ(gateway.calls(), (Texts{"discover 2000 ms",
                                      "igd http://192.168.77.1:5000/rootDesc.xml", "external ip"}));
    EXPECT_EQ(log.countPart("external IP address has changed!"), 0);
    router.discover();  // nobody has read the changes yet
    EXPECT_TRUE(router.hasExternalIpChanged() && router.hasLocalIpChanged());
    EXPECT_TRUE(router.hasExternalIpChanged() && router.hasLocalIpChanged());
    router.discover();
    EXPECT_FALSE(router.hasExternalIpChanged() || router.hasLocalIpChanged());

    gateway.externalIp = "44.128.0.99";
    net.interfaces = {{"eth0", "192.168.77.11"}};
    router.discover();
    gateway.upnp = false;
    gateway.natpmp = false;
    net.interfaces = {};
    EXPECT_FALSE(router.discover() || router.isInitialized());
    EXPECT_TRUE(router.hasExternalIpChanged() && router.hasLocalIpChanged());
    EXPECT_EQ(router.getExternalIp() + router.getLocalIp(), "44.128.0.99192.168.77.11");
    once("external IP address has changed!");
}

TEST_F(DiscoveryTest, AGatewayIsUsedWhenItTellsItsAddress) {
    const auto row = [&](int state, int error, const std::string& ip, bool used, const char* line) {
        gateway.igdState = state;
        gateway.externalIpStatus = error;
        gateway.externalIp = ip;
        log.clear();
        Router asking;
        EXPECT_TRUE(asking.upnp_discover() == used && asking.isInitialized() == used) << line;
        EXPECT_EQ(log.countPart("found at: "), state == 0 ? 0 : 1) << line;
        once(line);
    };
    const std::string ip = "44.128.0.20";
    row(0, 0, ip, false, "Router::upnp_discover - invalid device type \n");
    row(1, 0, ip, true, " - IGD found at: http://192.168.77.1:5000/ctl/IPConn, local host IP");
    row(2, 0, ip, true, " - Unconnected IGD found at: http://192.168.77.1:5000/ctl/IPConn local");
    row(3, 0, ip, true, "Non-IGD UPnP device found at: http://192.168.77.1:5000/ctl/IPConn local");
    row(7, 0, ip, true, "Unknown device type found at: http://192.168.77.1:5000/ctl/IPConn local");
    row(1, 501, "", false, "failed to get External IP address, ipStatus: 501, value received:  \n");
    row(1, 0, "", false, "failed to get External IP address, ipStatus: 0, value received:  \n");
    row(1, 0, "%n%s%n%s%n%s%n%s%n", true, "external IP address: %n%s%n%s%n%s%n%s \n");
}

TEST_F(DiscoveryTest, OnlyRealGatewaysAreAsked) {
    const std::string target = gateway.devices[0].second;
    gateway.devices = {
        {std::string("http://192.168.77.3/") + support::kDeviceAuth, support::kSubdomain},
        {"http://192.168.77.4/a.xml", "urn:schemas-upnp-org:service:WANPPPConnection:1"},
        {"http://192.168.77.5/udhisapi.dll?content=1", target},
        {"http://192.168.77.6/b.xml", target + "0"},
        {"http://192.168.77.7/c.xml", "urn:schemas-upnp-org:service:WANIPConnection:1"}};
    EXPECT_TRUE(router.upnp_discover());
    EXPECT_EQ(gateway.calls("igd"),
              Texts{"igd http://192.168.77.4/a.xml http://192.168.77.7/c.xml"});
    once("http://192.168.77.3/*AUTH_REMOVED*\n st: *SUBDOMAIN_REMOVED*\n");
    gateway.devices = {{"http://192.168.77.5/udhisapi.dll", target}};
    EXPECT_FALSE(router.upnp_discover());
    EXPECT_EQ(gateway.count("igd"), 1);
}

TEST_F(DiscoveryTest, TheLocalAddressIsChosenAmongTheLanInterfaces) {
    const auto chosen = [&](const std::vector<support::FakeNet::Interface>& interfaces) {
        net.interfaces = interfaces;
        router.initLocalIp();
        return router.getLocalIp();
    };
    EXPECT_EQ(chosen({{"lo", "127.0.0.1", IFF_UP | IFF_RUNNING | IFF_LOOPBACK},
                      {"br-docker-2", "172.18.0.1"},
                      {"tun0", "10.8.0.2", IFF_UP | IFF_POINTOPOINT},
                      {"dummy0", "10.9.0.2", IFF_UP | IFF_NOARP},
                      {"eth9", "10.0.0.9", IFF_BROADCAST},
                      {"eth8", ""},
                      {"eth7", "link"}}),
              "");
    EXPECT_EQ(chosen({{"eth0", "fe80::1"}, {"eth1", "fe80::2"}}), "fe80::1");
    EXPECT_EQ(chosen({{"eth0", "10.0.0.5"}, {"eth0", "fe80::1"}}), "fe80::1");
    EXPECT_EQ(chosen({{"eth0", "10.0.0.5", IFF_RUNNING}, {"e1", "10.0.0.6", IFF_UP}}), "10.0.0.5");
    EXPECT_EQ(chosen({{"eth0", "fe80::1"}, {"eth0", "10.0.0.7"}}), "10.0.0.7");
    // Only an unknown address is asked of the maker's router.
    EXPECT_EQ(commands.lines().size(), 2U);
}

// clang-format off
struct Announced { const char* name; Texts locations; const char* ownAddress; Texts asked; int refused; };
class GatewayUrl : public RouterTest, public ::testing::WithParamInterface<Announced> {};
const char* const kAway = "http://192.168.77.3/";
INSTANTIATE_TEST_SUITE_P(, GatewayUrl, ::testing::Values(
    Announced{"OfAnotherHostIsTried", {kAway, "http://10.0.0.1:80", "http://0192.168.77.3/"}, "192.168.77.10", {"igd http://192.168.77.3/ http://10.0.0.1:80"}, 1},
    Announced{"OnLoopbackIsRefused", {"http://127.0.0.1/", "http://127.9.9.9:8080/a", "http://0.0.0.0/", "http://0.1.2.3/"}, "192.168.77.10", {}, 4},
    Announced{"OfThisDeviceIsRefused", {"http://192.168.77.10/", "http://192.168.77.10:81/b"}, "192.168.77.10", {}, 2},
    Announced{"WithoutADottedAddressIsRefused", {"http://localhost/", "http://2130706433/", "http://127.1/", "http://[::1]/", "http://192.168.77.3@127.0.0.1/", "ftp://192.168.77.3/", "192.168.77.3", ""}, "192.168.77.10", {}, 8},
    Announced{"BeyondTheEighthIsNotTried", Texts(150, kAway), "192.168.77.10", {"igd http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/ http://192.168.77.3/"}, 0},
    Announced{"BeyondTheHundredthDeviceIsNotLookedAt", Texts(150, "http://127.0.0.1/"), "192.168.77.10", {}, 100},
    Announced{"ThatLeadsBackToThisDeviceForControlIsRefused", {kAway}, "192.168.77.1", {"igd http://192.168.77.3/"}, 1}), RowName{});
// clang-format on

TEST_P(GatewayUrl, IsJudged) {
    const Announced& row = GetParam();
    const std::string target = gateway.devices[0].second;
    gateway.devices.clear();
    for (const std::string& location : row.locations)
        gateway.devices.emplace_back(location, target);
    net.interfaces = {{"eth9", "link"}, {"eth0", row.ownAddress}};
    const bool found = router.upnp_discover();
    EXPECT_EQ(gateway.calls("igd"), row.asked);
    EXPECT_EQ(log.countPart("Router::upnp_discover - gateway ignored, its "), row.refused);
    // Only where none was refused, or others were left, is the control service asked anything.
    EXPECT_EQ(gateway.count("external ip"), found ? 1 : 0);
    EXPECT_EQ(found, !row.asked.empty() && std::string(row.ownAddress) != "192.168.77.1");
}

}  // namespace
}  // namespace pelorus
