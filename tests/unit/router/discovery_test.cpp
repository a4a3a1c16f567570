#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

using support::expectLogged;
using support::expectLogIs;
using support::expectNotLogged;
using support::LogLine;

const std::string kGatewayUrl = "http://192.168.77.1:5000/rootDesc.xml";
const std::string kGatewayTarget = "urn:schemas-upnp-org:device:InternetGatewayDevice:1";

class DiscoveryTest : public RouterTest {};

TEST_F(DiscoveryTest, FindsTheGatewayThroughUpnp) {
    EXPECT_FALSE(router.isInitialized());
    EXPECT_TRUE(router.discover());
    EXPECT_TRUE(router.isInitialized());
    EXPECT_FALSE(router.isNatPMPGateway());
    EXPECT_EQ(router.getExternalIp(), "44.128.0.20");
    EXPECT_EQ(router.getLocalIp(), "192.168.77.10");
    EXPECT_EQ(gateway.calls(), (Texts{"discover 2000 ms", "igd " + kGatewayUrl, "external ip"}));
    expectLogIs(
        {{LOG_DEBUG,
          "Router::initLocalIp() - Address Name: [eth0]   Address Family: [AF_INET][2]   Address: "
          "[192.168.77.10]  Flags: [0x000041]\n"},
         {LOG_INFO,
          "Router::initLocalIP() - IPv4: [192.168.77.10]  IPv6: []  setting localIP to: "
          "[192.168.77.10] \n"},
         {LOG_INFO, "Router::upnp_discover - List of UPNP devices found on the network :\n"},
         {LOG_INFO, " desc: " + kGatewayUrl + "\n st: " + kGatewayTarget + "\n\n"},
         {LOG_INFO,
          "Router::upnp_discover - IGD found at: http://192.168.77.1:5000/ctl/IPConn, local host "
          "IP address: 192.168.77.10 \n"},
         {LOG_NOTICE, "Router::upnp_discover - Router's external IP address has changed!\n"},
         {LOG_INFO, "Router::upnp_discover - Router's external IP address: 44.128.0.20 \n"},
         {LOG_INFO, "Router::upnp_discover - FreeUPNPUrls.\n"},
         {LOG_INFO, "Router::upnp_discover - finished discovery, success = true \n"}});
}

TEST_F(DiscoveryTest, FallsBackToNatpmp) {
    gateway.speakUpnp(false);
    gateway.speakNatpmp(true);
    net.failInterfaces();
    EXPECT_TRUE(router.discover());
    EXPECT_TRUE(router.isInitialized());
    EXPECT_TRUE(router.isNatPMPGateway());
    expectLogIs(
        {{LOG_ERR, "Router::initLocalIP() - failed to get local NIC info.\n"},
         {LOG_ERR, "Router::upnp_discover - UPnP Discover failed to return any response.\n"},
         {LOG_INFO, "CMnatpmp::retrieveExternalIP  fetched external IP address 44.128.0.20\n"},
         {LOG_NOTICE, "Router::natpmp_discover - Router's external IP address has changed!\n"},
         {LOG_INFO, "Router::natpmp_discover - Router's external IP address: 44.128.0.20 \n"}});

    gateway.speakUpnp(true);
    EXPECT_TRUE(router.discover());
    EXPECT_FALSE(router.isNatPMPGateway());
}

TEST_F(DiscoveryTest, AFailedDiscoveryKeepsTheAddressesAndEndsTheMapping) {
    discovered();
    gateway.speakUpnp(false);
    net.setInterfaces({});
    EXPECT_FALSE(router.discover());
    EXPECT_FALSE(router.isInitialized());
    EXPECT_EQ(router.getExternalIp(), "44.128.0.20");
    EXPECT_EQ(router.getLocalIp(), "192.168.77.10");
    expectLogged(LOG_ERR, "Router::initLocalIP() - failed to retrieve local IPv4 or IPv6\n");
    expectLogged(LOG_INFO, "Router::natpmp_discover - failed to get External IP address\n");
    int port = 9091;
    EXPECT_FALSE(router.mapPort(80, port, "TCP", "Kavra", false));
}

struct Answer {
    const char* name;
    int state;
    int ipStatus;
    std::string ip;
    bool success;
    LogLine line;
};

class GatewayAnswer : public RouterTest, public ::testing::WithParamInterface<Answer> {};

TEST_P(GatewayAnswer, IsJudged) {
    const Answer& row = GetParam();
    gateway.setIgdState(row.state);
    gateway.failExternalIp(row.ipStatus);
    gateway.setExternalIp(row.ip);
    EXPECT_EQ(router.upnp_discover(), row.success);
    EXPECT_EQ(router.isInitialized(), row.success);
    EXPECT_EQ(gateway.count("external ip"), row.state == 0 ? 0 : 1);
    expectLogged(row.line.priority, row.line.text);
    EXPECT_EQ(log.lines().back().text,
              std::string("Router::upnp_discover - finished discovery, success = ") +
                  (row.success ? "true" : "false") + " \n");
    EXPECT_EQ(log.countPart("FreeUPNPUrls"), row.state == 0 ? 0 : 1);
}

INSTANTIATE_TEST_SUITE_P(
    ,
    GatewayAnswer,
    ::testing::Values(
        Answer{"NoUsableDeviceIsAFailure",
               0,
               0,
               "44.128.0.20",
               false,
               {LOG_INFO, "Router::upnp_discover - invalid device type \n"}},
        Answer{"AnUnconnectedGatewayIsUsed",
               2,
               0,
               "44.128.0.20",
               true,
               {LOG_INFO,
                "Router::upnp_discover - Unconnected IGD found at: "
                "http://192.168.77.1:5000/ctl/IPConn local host IP address: 192.168.77.10, "
                "proceeding anyway \n"}},
        Answer{"AnotherDeviceIsUsed",
               3,
               0,
               "44.128.0.20",
               true,
               {LOG_INFO,
                "Router::upnp_discover - Non-IGD UPnP device found at: "
                "http://192.168.77.1:5000/ctl/IPConn local hostIP address: 192.168.77.10 , "
                "proceeding anyway \n"}},
        Answer{"AnUnknownKindIsUsed",
               7,
               0,
               "44.128.0.20",
               true,
               {LOG_INFO,
                "Router::upnp_discover - Unknown device type found at: "
                "http://192.168.77.1:5000/ctl/IPConn local address: 192.168.77.10, proceeding "
                "anyway \n"}},
        Answer{"ARefusedAddressIsAFailure",
               1,
               501,
               "",
               false,
               {LOG_INFO,
                "Router::upnp_discover - failed to get External IP address, ipStatus: 501, value "
                "received:  \n"}},
        Answer{"AnEmptyAddressIsAFailure",
               1,
               0,
               "",
               false,
               {LOG_INFO,
                "Router::upnp_discover - failed to get External IP address, ipStatus: 0, value "
                "received:  \n"}},
        Answer{"AnEndlessAddressIsCut",
               1,
               0,
               "%n%s%n%s%n%s%n%s%n%s%n%s",
               true,
               {LOG_INFO,
                "Router::upnp_discover - Router's external IP address: %n%s%n%s%n%s%n%s \n"}}),
    [](const auto& row) { return row.param.name; });

TEST_F(DiscoveryTest, OnlyRealGatewaysAreAsked) {
    gateway.setDevices(
        {{"http://192.168.77.3/tv.xml", "urn:schemas-upnp-org:device:Basic:1"},
         {"http://192.168.77.4/a.xml", "urn:schemas-upnp-org:service:WANPPPConnection:1"},
         {"http://192.168.77.5/udhisapi.dll?content=1", kGatewayTarget},
         {"http://192.168.77.6/b.xml", kGatewayTarget + "0"},
         {"http://192.168.77.7/c.xml", "urn:schemas-upnp-org:service:WANIPConnection:1"}});
    EXPECT_TRUE(router.upnp_discover());
    EXPECT_EQ(gateway.calls("igd"),
              (Texts{"igd http://192.168.77.4/a.xml http://192.168.77.7/c.xml"}));
    EXPECT_EQ(log.countPart(" desc: http://"), 5);
}

TEST_F(DiscoveryTest, AFalseGatewayAloneIsNone) {
    gateway.setDevices({{"http://192.168.77.5/udhisapi.dll", kGatewayTarget}});
    gateway.speakNatpmp(true);
    EXPECT_TRUE(router.discover());
    EXPECT_TRUE(router.isNatPMPGateway());
    EXPECT_EQ(gateway.count("igd"), 0);
    expectNotLogged("finished discovery");
}

TEST_F(DiscoveryTest, TheNamesOfDevicesDoNotTellSecrets) {
    gateway.setDevices({{std::string("http://") + support::kDeviceId + "/" + support::kDeviceAuth,
                         support::kSubdomain}});
    EXPECT_FALSE(router.upnp_discover());
    expectLogged(LOG_INFO,
                 " desc: http://*ID_REMOVED*/*AUTH_REMOVED*\n st: *SUBDOMAIN_REMOVED*\n\n");
}

TEST_F(DiscoveryTest, AChangeIsToldUntilItWasReadAndTheNextDiscoveryBegan) {
    EXPECT_FALSE(router.hasExternalIpChanged());
    router.discover();
    router.discover();  // nobody read the change in between
    EXPECT_TRUE(router.hasExternalIpChanged());
    EXPECT_TRUE(router.hasExternalIpChanged());
    router.discover();
    EXPECT_FALSE(router.hasExternalIpChanged());
    EXPECT_TRUE(router.hasLocalIpChanged());

    gateway.setExternalIp("44.128.0.99");
    router.discover();
    EXPECT_TRUE(router.hasExternalIpChanged());
    EXPECT_FALSE(router.hasLocalIpChanged());
}

struct Interfaces {
    const char* name;
    std::vector<support::FakeNet::Interface> before;
    std::vector<support::FakeNet::Interface> now;
    std::string localIp;
};

class LocalAddress : public RouterTest, public ::testing::WithParamInterface<Interfaces> {};

TEST_P(LocalAddress, IsChosen) {
    const Interfaces& row = GetParam();
    if (!row.before.empty()) {
        net.setInterfaces(row.before);
        router.initLocalIp();
    }
    log.clear();
    net.setInterfaces(row.now);
    router.initLocalIp();
    const int commandsBefore = static_cast<int>(commands.lines().size());
    EXPECT_EQ(router.getLocalIp(), row.localIp);
    // Only an unknown address is asked of the maker's router.
    EXPECT_EQ(commands.lines().size() > static_cast<std::size_t>(commandsBefore),
              row.localIp.empty());
    EXPECT_EQ(log.count(LOG_ERR, "Router::initLocalIP() - failed to retrieve local IPv4 or IPv6\n"),
              row.localIp.empty() ? 1 : 0);
}

INSTANTIATE_TEST_SUITE_P(
    ,
    LocalAddress,
    ::testing::Values(Interfaces{"UnfitInterfacesAreLeftOut",
                                 {},
                                 {{"lo", "127.0.0.1", IFF_UP | IFF_RUNNING | IFF_LOOPBACK},
                                  {"docker0", "172.17.0.1"},
                                  {"br-docker-2", "172.18.0.1"},
                                  {"tun0", "10.8.0.2", IFF_UP | IFF_POINTOPOINT},
                                  {"dummy0", "10.9.0.2", IFF_UP | IFF_NOARP},
                                  {"eth9", "10.0.0.9", IFF_BROADCAST},
                                  {"eth8", ""},
                                  {"eth7", "link"}},
                                 ""},
                      Interfaces{"UpOrRunningIsEnough",
                                 {},
                                 {{"eth0", "10.0.0.5", IFF_RUNNING}, {"eth1", "10.0.0.6", IFF_UP}},
                                 "10.0.0.5"},
                      Interfaces{"IPv4GoesBeforeIPv6",
                                 {},
                                 {{"eth0", "fe80::1"}, {"eth0", "10.0.0.5"}},
                                 "10.0.0.5"},
                      Interfaces{"IPv6IsTakenWhereThereIsNoOther",
                                 {},
                                 {{"eth0", "fe80::1"}, {"eth1", "fe80::2"}},
                                 "fe80::1"},
                      Interfaces{"AnIPv6AddressInUseStays",
                                 {{"eth0", "fe80::1"}},
                                 {{"eth0", "10.0.0.5"}, {"eth0", "fe80::1"}},
                                 "fe80::1"},
                      Interfaces{"AnAddressThatIsGoneIsReplaced",
                                 {{"eth0", "10.0.0.4"}},
                                 {{"eth0", "10.0.0.5"}},
                                 "10.0.0.5"}),
    [](const auto& row) { return row.param.name; });

TEST_F(DiscoveryTest, LifetimesAreKeptForBothProtocols) {
    unsigned upnp = 0;
    unsigned natpmp = 0;
    router.getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 604800U);
    EXPECT_EQ(natpmp, 172800U);
    router.setReqPortMappingLifetime(60, 70);
    router.getReqPortMappingLifetime(upnp, natpmp);
    EXPECT_EQ(upnp, 60U);
    EXPECT_EQ(natpmp, 70U);
    EXPECT_EQ(Router::INVALID_LEASE_DURATION, 4294967295U);
    EXPECT_EQ(Router::getInstance(), Router::getInstance());
}

}  // namespace
}  // namespace pelorus
