#include "router/natpmp.h"

#include <cerrno>

#include "support/fake_gateway.h"
#include "support/fixture.h"

namespace pelorus {
namespace {

using support::expectLogged;
using support::expectLogIs;
using support::FakeGateway;
using support::LogLine;
using Texts = support::Texts;
using Call = FakeGateway::Natpmp;

const std::string kRequest = "CMnatpmp::portMappingRequest  ";

class NatpmpTest : public support::PelorusTest {
protected:
    NatpmpTest() {
        gateway.reset();
        gateway.speakNatpmp(true);
    }
    bool map(int internalPort, int externalPort, bool isHttps = false) {
        port = externalPort;
        return client.mapPort(internalPort, port, "TCP", "Kavra", isHttps);
    }

    FakeGateway& gateway = FakeGateway::get();
    CMnatpmp client;
    int port = 0;
};

TEST_F(NatpmpTest, OpensOnceAndClosesWhatIsOpen) {
    {
        CMnatpmp other;
        EXPECT_TRUE(other.close());
        EXPECT_TRUE(other.init());
        EXPECT_TRUE(other.init());
        EXPECT_TRUE(other.close());
        EXPECT_TRUE(other.init());
    }
    EXPECT_EQ(gateway.calls(),
              (Texts{"natpmp open", "natpmp close", "natpmp open", "natpmp close"}));
}

TEST_F(NatpmpTest, AFailedCloseIsLoggedAndStillCloses) {
    EXPECT_TRUE(client.init());
    gateway.failNatpmp(Call::CLOSE, NATPMP_ERR_CLOSEERR);
    EXPECT_TRUE(client.close());
    EXPECT_TRUE(client.close());
    expectLogIs({{LOG_ERR, "CMnatpmp::close  closenatpmp failed -4\n"}});
    EXPECT_EQ(gateway.count("natpmp close"), 1);
}

TEST_F(NatpmpTest, FetchesTheExternalAddress) {
    std::string ip;
    EXPECT_TRUE(client.retrieveExternalIP(ip));
    EXPECT_EQ(ip, "44.128.0.20");
    expectLogIs(
        {{LOG_INFO, "CMnatpmp::retrieveExternalIP  fetched external IP address 44.128.0.20\n"}});
}

TEST_F(NatpmpTest, AGatewayThatKeepsSilentIsReadThreeTimes) {
    gateway.keepSilent();
    std::string ip = "old";
    EXPECT_FALSE(client.retrieveExternalIP(ip));
    EXPECT_EQ(ip, "");
    EXPECT_EQ(gateway.calls("natpmp wait"),
              (Texts{"natpmp wait 250 ms", "natpmp wait 500 ms", "natpmp wait 1000 ms"}));
    expectLogIs(
        {{LOG_INFO, "CMnatpmp::retrieveExternalIP  failed to fetched external IP address, errno " +
                        std::to_string(EAGAIN) + "\n"}});
    EXPECT_EQ(client.CheckNATPMPResponse(), NATPMP_TRYAGAIN);
}

struct Failure {
    const char* name;
    Call call;
    bool addressKept;  // what the caller held before the question
    std::vector<LogLine> whenFetching;
    std::vector<LogLine> whenMapping;
};

class FailingCall : public NatpmpTest, public ::testing::WithParamInterface<Failure> {};

TEST_P(FailingCall, EndsTheRequest) {
    const Failure& row = GetParam();
    gateway.failNatpmp(row.call, -9, EIO);
    std::string ip = "old";
    EXPECT_FALSE(client.retrieveExternalIP(ip));
    EXPECT_EQ(ip, row.addressKept ? "old" : "");
    expectLogIs(row.whenFetching);

    log.clear();
    EXPECT_FALSE(map(80, 9091));
    EXPECT_EQ(port, 9091);
    expectLogIs(row.whenMapping);
    EXPECT_TRUE(gateway.mappings().empty());
}

const LogLine kNoAddress{
    LOG_INFO, "CMnatpmp::retrieveExternalIP  failed to fetched external IP address, errno 5\n"};
const LogLine kNotMapped{LOG_ERR, kRequest +
                                      "failed to map public port 9091 to localport 80, protocol 2, "
                                      "lifetime 172800, errno 5\n"};
const LogLine kNoTimeout{LOG_ERR,
                         "CMnatpmp::CheckNATPMPResponse  getnatpmprequesttimeout error -9\n"};
const LogLine kNotOpened{LOG_ERR, "CMnatpmp::init  initnatpmp failed -9\n"};

INSTANTIATE_TEST_SUITE_P(
    ,
    FailingCall,
    ::testing::Values(
        Failure{"Open",
                Call::OPEN,
                true,
                {kNotOpened,
                 {LOG_ERR,
                  "CMnatpmp::retrieveExternalIP  libnatpmp was not previously initialized.\n"}},
                {kNotOpened, {LOG_ERR, kRequest + "libnatpmp was not previously initialized.\n"}}},
        Failure{
            "Timeout", Call::TIMEOUT, false, {kNoTimeout, kNoAddress}, {kNoTimeout, kNotMapped}},
        Failure{"Read", Call::READ, false, {kNoAddress}, {kNotMapped}}),
    [](const auto& row) { return row.param.name; });

TEST_F(NatpmpTest, ARequestThatCannotBeSentIsNotWaitedFor) {
    gateway.failNatpmp(Call::SEND_ADDRESS, NATPMP_ERR_SENDERR, EIO);
    gateway.failNatpmp(Call::SEND_MAPPING, NATPMP_ERR_SENDERR, EIO);
    std::string ip = "old";
    EXPECT_FALSE(client.retrieveExternalIP(ip));
    EXPECT_FALSE(map(80, 9091));
    EXPECT_EQ(ip, "old");
    EXPECT_EQ(gateway.count("natpmp wait"), 0);
    expectLogIs(
        {{LOG_ERR, "CMnatpmp::retrieveExternalIP  sendpublicaddressrequest error -10, errno 5\n"},
         {LOG_ERR, kRequest + "sendnewportmappingrequest error -10, protocol 2, internalPort 80, "
                              "externalPort 9091, lifetime 172800, errno 5\n"}});
}

TEST_F(NatpmpTest, OnlyTheTwoProtocolsAreAskedFor) {
    port = 9091;
    EXPECT_FALSE(client.mapPort(80, port, "tcp", "", false));
    EXPECT_FALSE(client.unmapPort(80, 9091, "%s%n"));
    EXPECT_TRUE(client.mapPort(80, port, "UDP", "", false));
    EXPECT_EQ(gateway.calls("natpmp map"), (Texts{"natpmp map UDP 9091 -> 80 for 172800 s"}));
    expectLogged(LOG_ERR, kRequest + "invalid protocol string tcp\n");
    expectLogged(LOG_ERR, kRequest + "invalid protocol string %s%n\n");
}

TEST_F(NatpmpTest, TheGrantWinsOverTheRequest) {
    FakeGateway::Grant grant;
    grant.publicPort = 40000;
    grant.privatePort = 81;
    grant.lifetime = 3600;
    gateway.grant(grant);
    EXPECT_TRUE(map(80, 9091, true));
    EXPECT_EQ(port, 40000);
    expectLogIs(
        {{LOG_INFO,
          kRequest + "mapped public port 40000 to localport 81 protocol 2, lifetime 3600\n"},
         {LOG_INFO, kRequest + "requested internal port does not match the response internal port. "
                               "req_internal_port 80, resp_internal_port 81, external_port 40000, "
                               "lifetime 3600\n"},
         {LOG_INFO, kRequest + "set HTTPS PMTracker params. internal_port 80, external_port 40000, "
                               "lifetime 3600\n"},
         {LOG_INFO,
          "CMnatpmp::portMappingRequest - get after setting HTTPS PMTracker params.   "
          "internalPort[80], mappedExternalPort[40000], lifetime[3600]\n"}});
}

TEST_F(NatpmpTest, RemovalsNameTheInternalPortOnly) {
    ASSERT_TRUE(map(80, 9091));
    ASSERT_TRUE(map(443, 9444, true));
    gateway.clear();
    log.clear();
    for (const int internalPort : {22, 443, 80}) {
        EXPECT_TRUE(client.unmapPort(internalPort, 9444, "TCP"));
    }
    EXPECT_EQ(gateway.calls("natpmp map"),
              (Texts{"natpmp map TCP 0 -> 22 for 0 s", "natpmp map TCP 0 -> 443 for 0 s",
                     "natpmp map TCP 0 -> 80 for 0 s"}));
    EXPECT_TRUE(gateway.mappings().empty());
    expectLogIs(
        {{LOG_INFO, kRequest + "mapped public port 0 to localport 22 protocol 2, lifetime 0\n"},
         {LOG_INFO, kRequest +
                        "internal ports mismatch when destroying port mapping. "
                        "tracked_internal_port 443, req_internal_port 22, external_port 9444, "
                        "lifetime 172800\n"},
         {LOG_INFO, kRequest + "mapped public port 0 to localport 443 protocol 2, lifetime 0\n"},
         {LOG_INFO, kRequest +
                        "destroyed HTTPS port mapping. internal_port 443, external_port 9444, "
                        "lifetime 172800\n"},
         {LOG_INFO, kRequest + "mapped public port 0 to localport 80 protocol 2, lifetime 0\n"},
         {LOG_INFO, kRequest + "destroyed HTTP port mapping. internal_port 80, external_port 9091, "
                               "lifetime 172800\n"}});
}

TEST_F(NatpmpTest, AMappingGrantedForNoTimeIsARemoval) {
    ASSERT_TRUE(map(80, 9091));
    FakeGateway::Grant grant;
    grant.lifetime = 0;
    gateway.grant(grant);
    log.clear();
    EXPECT_TRUE(map(80, 9091));
    expectLogged(LOG_INFO, kRequest +
                               "destroyed HTTP port mapping. internal_port 80, external_port 9091, "
                               "lifetime 172800\n");
}

TEST_F(NatpmpTest, RemovingAllForgetsBothMappings) {
    ASSERT_TRUE(map(80, 9091));
    ASSERT_TRUE(map(443, 9444, true));
    EXPECT_TRUE(client.unmapAllPorts("TCP", "Kavra"));
    EXPECT_TRUE(gateway.mappings().empty());
    EXPECT_EQ(gateway.calls().back(), "natpmp wait 250 ms");
    EXPECT_EQ(gateway.count("natpmp map TCP 0 -> 0 for 0 s"), 1);
    expectLogged(
        LOG_INFO,
        kRequest + "destroyed all mappings. internal_port 0, external_port 0, lifetime 0\n");
    gateway.clear();
    clock.advance(1);
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.count("natpmp map TCP 0 -> 0 for 172800 s"), 2);
}

TEST_F(NatpmpTest, RenewsAfterHalfOfTheGrantedLease) {
    client.setReqPortMappingLifetime(7200);
    FakeGateway::Grant grant;
    grant.lifetime = 600;
    gateway.grant(grant);
    ASSERT_TRUE(map(443, 9444, true));
    ASSERT_TRUE(map(80, 9091));
    clock.advance(300);
    gateway.clear();
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls(), Texts{});

    clock.advance(1);
    log.clear();
    grant.publicPort = 9555;
    gateway.grant(grant);
    client.renewPortMapping("HTTPS");
    EXPECT_EQ(gateway.calls("natpmp map"), (Texts{"natpmp map TCP 9444 -> 443 for 7200 s"}));
    EXPECT_EQ(log.lines().front().text,
              "CMnatpmp::renewPortMapping - pastHalfway() returned TRUE\n");
    const long start = support::VirtualClock::kStart;
    expectLogged(
        LOG_INFO,
        "CMnatpmp::renewPortMapping - Renew NAT-PMP port mapping PORTFORWARDED HTTPS: mapPort "
        "returncode[1], internalPort[443], new externalPort[9555], now[" +
            std::to_string(start + 301) + "], previous start[" + std::to_string(start) +
            "], previous lifetime[600], new lifetime[7200].\n");

    // The other one is still due; this one starts a new half.
    gateway.clear();
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls("natpmp map"), (Texts{"natpmp map TCP 9091 -> 80 for 7200 s"}));
}

}  // namespace
}  // namespace pelorus
