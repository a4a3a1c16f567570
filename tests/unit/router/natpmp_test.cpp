#include "router/natpmp.h"

#include "common/stop_budget.h"
#include "common/termination.h"
#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

const std::string kRequest = "CMnatpmp::portMappingRequest  ";
const std::string kFetch = "CMnatpmp::retrieveExternalIP  ";

class NatpmpTest : public RouterTest {
protected:
    NatpmpTest() { gateway.natpmp = true; }
    bool map(int internalPort, int externalPort, bool isHttps = false) {
        port = externalPort;
        return client.mapPort(internalPort, port, "TCP", "Kavra", isHttps);
    }

    CMnatpmp client;
    int port = 0;
    std::string ip = "old";
};

TEST_F(NatpmpTest, OnlyAnOpenClientIsClosed) {
    {
        CMnatpmp other;
        EXPECT_TRUE(other.close() && other.init() && other.init() && other.close() && other.init());
    }
    EXPECT_EQ(gateway.calls(),
              (Texts{"natpmp open", "natpmp close", "natpmp open", "natpmp close"}));
}

TEST_F(NatpmpTest, EachRequestHasASocketOfItsOwn) {
    gateway.silent = true;
    EXPECT_FALSE(client.retrieveExternalIP(ip));
    EXPECT_EQ(ip, "");
    EXPECT_EQ(log.countPart("errno " + std::to_string(EAGAIN) + "\n"), 1);
    gateway.silent = false;
    EXPECT_TRUE(map(80, 9091));
    EXPECT_EQ(gateway.calls(),
              (Texts{"natpmp open", "natpmp address", "natpmp wait 250 ms", "natpmp wait 500 ms",
                     "natpmp wait 1000 ms", "natpmp open at the same gateway", "natpmp close",
                     "natpmp map TCP 9091 -> 80 for 172800 s", "natpmp wait 250 ms"}));
    EXPECT_EQ(gateway.natpmpTime, 1750);
}

TEST_F(NatpmpTest, AStopDoesNotWaitForEachRequest) {
    sigConnKilled = SIGTERM;
    renewStopBudget(std::chrono::nanoseconds{1});
    EXPECT_FALSE(stopBudgetSpent());
    EXPECT_TRUE(client.retrieveExternalIP(ip));
    EXPECT_TRUE(stopBudgetSpent());
}

TEST_F(NatpmpTest, AClockThatIsSetBackDoesNotProlongAWait) {
    gateway.silent = true;
    gateway.clockSetBack = 86400;
    EXPECT_FALSE(client.retrieveExternalIP(ip));
    EXPECT_EQ(gateway.natpmpTime, 3000);
}

TEST_F(NatpmpTest, AnAnswerWithoutAllItsValuesIsAnError) {
    const auto answer = [](std::size_t size, char operation, char result = 0) {
        return std::string{'\0', operation, '\0', result}.append(12, '\1').substr(0, size);
    };
    for (std::size_t size : {0U, 2U, 11U}) {
        gateway.datagram = answer(size, '\x80');
        EXPECT_FALSE(client.retrieveExternalIP(ip) || map(80, 9091)) << size;
    }
    const std::string incomplete = "errno " + std::to_string(EBADMSG) + "\n";
    EXPECT_EQ(log.countPart(incomplete), 6);
    gateway.refused = {9091};
    gateway.datagram = answer(8, '\x82', 2);
    errno = 0;
    EXPECT_FALSE(map(80, 9091));
    EXPECT_EQ(log.countPart(incomplete), 6) << "a refusal has no values";
    gateway.refused.clear();
    gateway.datagram = answer(12, '\x80');
    EXPECT_TRUE(client.retrieveExternalIP(ip) && !map(80, 9091));
    EXPECT_EQ(gateway.natpmpTime, 0);
    gateway.datagram = answer(16, '\x82');
    EXPECT_TRUE(map(80, 9091));
}

TEST_F(NatpmpTest, NothingIsAskedWithoutANewSocket) {
    gateway.answerDelay = 2000;
    EXPECT_FALSE(map(80, 9091));
    gateway.failing = {"open"};
    EXPECT_FALSE(map(80, 9092));
    once("CMnatpmp::init  initnatpmp failed -9\n");
    EXPECT_EQ(gateway.count("natpmp open"), gateway.count("natpmp close"));
    EXPECT_EQ(gateway.count("natpmp map"), 1);
    gateway.failing = {};
    gateway.answerDelay = 0;
    EXPECT_TRUE(map(80, 9092));
    EXPECT_EQ(port, 9092);
}

// clang-format off
struct Failure { const char* name; std::set<std::string> calls; std::string ip; int waits; Texts errors; };
class FailingCall : public NatpmpTest, public ::testing::WithParamInterface<Failure> {};
INSTANTIATE_TEST_SUITE_P(, FailingCall, ::testing::Values(
    Failure{"Open", {"open"}, "old", 0, {"CMnatpmp::init  initnatpmp failed -9\n", kFetch + "libnatpmp was not previously initialized.\n"}},
    Failure{"Send", {"address", "map"}, "old", 0, {kFetch + "sendpublicaddressrequest error -9, errno 5\n",
        kRequest + "sendnewportmappingrequest error -9, protocol 2, internalPort 80, externalPort 9091, lifetime 172800, errno 5\n"}},
    Failure{"TimeoutAndClose", {"timeout", "close"}, "", 0, {"CMnatpmp::CheckNATPMPResponse  getnatpmprequesttimeout error -9\n", "CMnatpmp::close  closenatpmp failed -9\n"}},
    Failure{"Read", {"read"}, "", 2, {kRequest + "failed to map public port 9091 to localport 80, protocol 2, lifetime 172800, errno 5\n"}}), RowName{});
// clang-format on

TEST_P(FailingCall, EndsTheRequest) {
    const Failure& row = GetParam();
    gateway.failing = row.calls;
    EXPECT_FALSE(client.retrieveExternalIP(ip) || map(80, 9091));
    EXPECT_EQ(ip + std::to_string(port), row.ip + "9091");
    EXPECT_EQ(gateway.count("natpmp wait"), row.waits);
    EXPECT_EQ(gateway.count("natpmp open") - gateway.count("natpmp close"),
              1 - row.calls.count("open"));
    for (const std::string& error : row.errors) EXPECT_GE(log.count(LOG_ERR, error), 1) << error;
}

TEST_F(NatpmpTest, ARemovalForgetsTheMappingOfItsInternalPort) {
    EXPECT_FALSE(client.unmapPort(80, 9091, "%s%n"));
    EXPECT_EQ(log.count(LOG_ERR, kRequest + "invalid protocol string %s%n\n"), 1);
    EXPECT_TRUE(client.unmapPort(80, 9091, "UDP"));
    log.clear();
    ASSERT_TRUE(map(80, 9091) && map(443, 9444, true));
    EXPECT_TRUE(client.unmapPort(22, 9444, "TCP") && client.unmapPort(80, 9444, "TCP"));
    gateway.granted = {{}, {}, 0};  // no time is a removal too
    EXPECT_TRUE(map(443, 9444, true));
    EXPECT_TRUE(client.unmapAllPorts("TCP", "Kavra"));
    const std::string gone = "internal_port 80, external_port 9091, lifetime 172800\n";
    EXPECT_EQ(log.count(LOG_INFO, kRequest + "destroyed HTTP port mapping. " + gone), 1);
    once("destroyed HTTPS port mapping. internal_port 443, external_port 9444");
    once("tracked_internal_port 443, req_internal_port 22, external_port 9444");
    for (const char* part : {"destroyed all mappings", "destroyed HTTPS", "mismatch"}) once(part);
    gateway.granted = {};
    clock.advance(1);
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.count("natpmp map TCP 0 -> 0 for 172800 s"), 2);
    EXPECT_EQ(gateway.calls("for 0 s"),
              (Texts{"natpmp map UDP 0 -> 80 for 0 s", "natpmp map TCP 0 -> 22 for 0 s",
                     "natpmp map TCP 0 -> 80 for 0 s", "natpmp map TCP 0 -> 0 for 0 s"}));
}

TEST_F(NatpmpTest, TheGrantWinsOverTheRequest) {
    gateway.granted = {40000, 81, 600};
    ASSERT_TRUE(map(443, 9444, true));
    EXPECT_EQ(port, 40000);
    once("req_internal_port 443, resp_internal_port 81, external_port 40000");
    once(
        "setting HTTPS PMTracker params.   internalPort[443], mappedExternalPort[40000], lifetime[600]");
    gateway.granted = {{}, {}, 600};
    ASSERT_TRUE(map(80, 9091));
    client.setReqPortMappingLifetime(7200);
    gateway.clear();
    clock.advance(300);
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.calls(), Texts{});
    clock.advance(1);
    client.renewPortMapping("HTTPS");
    client.CheckExpiredMappings();  // the first one starts a new half, the other is still due
    EXPECT_EQ(gateway.calls("natpmp map"), (Texts{"natpmp map TCP 40000 -> 443 for 7200 s",
                                                  "natpmp map TCP 9091 -> 80 for 7200 s"}));
    gateway.granted = {};
    EXPECT_TRUE(client.unmapAllPorts("TCP", "Kavra"));
    clock.advance(1);
    client.CheckExpiredMappings();
    EXPECT_EQ(gateway.count("natpmp map TCP 0 -> 0 for 7200 s"), 2);
}

}  // namespace
}  // namespace pelorus
