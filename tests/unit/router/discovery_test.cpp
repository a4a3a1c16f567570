#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

class DiscoveryTest : public RouterTest {};

TEST_F(DiscoveryTest, UpnpIsPreferredToNatpmp) {
    net.failInterfaces();
    discoveredThroughNatpmp();
    EXPECT_TRUE(router.isNatPMPGateway());
    net.failInterfaces(false);
    gateway.speakUpnp(true);
    EXPECT_TRUE(router.discover());
    EXPECT_FALSE(router.isNatPMPGateway());
    EXPECT_EQ(log.countPart("external IP address has changed!"), 0);
    EXPECT_EQ(gateway.calls(), (Texts{"discover 2000 ms",
                                      "igd http://192.168.77.1:5000/rootDesc.xml", "external ip"}));

    gateway.speakUpnp(false);
    gateway.speakNatpmp(false);
    net.setInterfaces({});
    EXPECT_FALSE(router.discover());
    EXPECT_FALSE(router.isInitialized());
    EXPECT_EQ(router.getExternalIp() + router.getLocalIp(), "44.128.0.20192.168.77.10");
    expectLogged(LOG_ERR, "Router::upnp_discover - UPnP Discover failed to return any response.\n");
    expectLogged(LOG_INFO, "Router::natpmp_discover - failed to get External IP address\n");
}

// clang-format off
struct Answer { const char* name; int state, ipStatus; std::string ip; bool success; const char* logged; };
class GatewayAnswer : public RouterTest, public ::testing::WithParamInterface<Answer> {};
INSTANTIATE_TEST_SUITE_P(, GatewayAnswer, ::testing::Values(
    Answer{"NoUsableDeviceIsAFailure", 0, 0, "44.128.0.20", false, "invalid device type \n"},
    Answer{"AConnectedGatewayIsUsed", 1, 0, "44.128.0.20", true, "IGD found at: http://192.168.77.1:5000/ctl/IPConn, local host IP address: 192.168.77.10 \n"},
    Answer{"AnUnconnectedGatewayIsUsed", 2, 0, "44.128.0.20", true, "Unconnected IGD found at: http://192.168.77.1:5000/ctl/IPConn local host IP address: 192.168.77.10, proceeding anyway \n"},
    Answer{"AnotherDeviceIsUsed", 3, 0, "44.128.0.20", true, "Non-IGD UPnP device found at: http://192.168.77.1:5000/ctl/IPConn local hostIP address: 192.168.77.10 , proceeding anyway \n"},
    Answer{"AnUnknownKindIsUsed", 7, 0, "44.128.0.20", true, "Unknown device type found at: http://192.168.77.1:5000/ctl/IPConn local address: 192.168.77.10, proceeding anyway \n"},
    Answer{"ARefusedAddressIsAFailure", 1, 501, "", false, "failed to get External IP address, ipStatus: 501, value received:  \n"},
    Answer{"AnEmptyAddressIsAFailure", 1, 0, "", false, "failed to get External IP address, ipStatus: 0, value received:  \n"},
    Answer{"AnEndlessAddressIsCut", 1, 0, "%n%s%n%s%n%s%n%s%n%s%n%s", true, "Router's external IP address: %n%s%n%s%n%s%n%s \n"}), RowName{});
// clang-format on

TEST_P(GatewayAnswer, IsJudged) {
    const Answer& row = GetParam();
    gateway.igdState = row.state;
    gateway.externalIpStatus = row.ipStatus;
    gateway.setExternalIp(row.ip);
    EXPECT_EQ(router.upnp_discover(), row.success);
    EXPECT_EQ(router.isInitialized(), row.success);
    EXPECT_EQ(log.countPart("found at: "), row.state == 0 ? 0 : 1);
    expectLogged(LOG_INFO, std::string("Router::upnp_discover - ") + row.logged);
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
              (Texts{"igd http://192.168.77.4/a.xml http://192.168.77.7/c.xml"}));
    once("http://192.168.77.3/*AUTH_REMOVED*\n st: *SUBDOMAIN_REMOVED*\n");
    gateway.devices = {{"http://192.168.77.5/udhisapi.dll", target}};
    EXPECT_FALSE(router.upnp_discover());
    EXPECT_EQ(gateway.count("igd"), 1);
}

TEST_F(DiscoveryTest, AChangeIsReportedUntilTheDiscoveryAfterItsReading) {
    router.discover();
    router.discover();  // nobody read the change in between
    EXPECT_TRUE(router.hasExternalIpChanged() && router.hasExternalIpChanged());
    EXPECT_TRUE(router.hasLocalIpChanged());
    router.discover();
    EXPECT_FALSE(router.hasExternalIpChanged() || router.hasLocalIpChanged());

    gateway.setExternalIp("44.128.0.99");
    net.setInterfaces({{"eth0", "192.168.77.11"}});
    router.discover();
    router.discover();
    EXPECT_TRUE(router.hasExternalIpChanged() && router.hasLocalIpChanged());
    EXPECT_EQ(log.countPart("external IP address has changed!"), 2);
}

TEST_F(DiscoveryTest, TheLocalAddressIsChosenAmongTheLanInterfaces) {
    const auto chosen = [&](const std::vector<support::FakeNet::Interface>& interfaces) {
        net.setInterfaces(interfaces);
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
    support::expectLogIs(
        {{LOG_ERR, "Router::initLocalIP() - failed to retrieve local IPv4 or IPv6\n"},
         {LOG_ERR,
          "Router::initIpAddrBrenvik - Not connected to internet. Please check network connectivity.\n"}});
    commands.clear();
    EXPECT_EQ(chosen({{"eth0", "fe80::1"}, {"eth1", "fe80::2"}}), "fe80::1");
    once("Address Family: [AF_INET6][10]   Address: [fe80::1]");
    EXPECT_EQ(chosen({{"eth0", "10.0.0.5"}, {"eth0", "fe80::1"}}), "fe80::1");
    EXPECT_EQ(chosen({{"eth0", "10.0.0.5", IFF_RUNNING}, {"eth1", "10.0.0.6", IFF_UP}}),
              "10.0.0.5");
    EXPECT_EQ(chosen({{"eth0", "fe80::1"}, {"eth0", "10.0.0.7"}}), "10.0.0.7");
    // Only an unknown address is asked of the maker's router.
    EXPECT_EQ(commands.lines(), Texts{});
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
    net.setInterfaces({{"eth9", "link"}, {"eth0", row.ownAddress}});
    const bool found = router.upnp_discover();
    EXPECT_EQ(gateway.calls("igd"), row.asked);
    EXPECT_EQ(log.countPart("Router::upnp_discover - gateway ignored, its "), row.refused);
    // Only where none was refused, or others were left, is the control service asked anything.
    EXPECT_EQ(gateway.count("external ip"), found ? 1 : 0);
    EXPECT_EQ(found, !row.asked.empty() && std::string(row.ownAddress) != "192.168.77.1");
}

}  // namespace
}  // namespace pelorus
