// A NAT-PMP gateway's answers, in the form in which the library passes them on.
#include "router/natpmp.h"

#include <arpa/inet.h>

#include <cstring>

#include "fuzz_world.h"

namespace {

std::string answers;  // one after the other
natpmpresp_t answer;
bool isAnswer;

void deliver(const std::string& call) {
    if (!pelorus::support::holds(call, "natpmp wait")) return;
    auto& gateway = pelorus::support::FakeGateway::get();
    gateway.onTheWay.clear();
    isAnswer = false;
    if (answers.size() < sizeof answer) return;
    std::memcpy(&answer, answers.data(), sizeof answer);
    answers.erase(0, sizeof answer);
    isAnswer = answer.resultcode == 0;
    gateway.onTheWay.emplace(gateway.natpmpTime, answer);
}

}  // namespace

void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    answers = text;
    support::FakeGateway::get().natpmp = true;
    support::FakeGateway::get().onCall(deliver);
    CMnatpmp client;
    std::string ip;
    assert(client.retrieveExternalIP(ip) == isAnswer && ip.empty() != isAnswer);
    assert(!isAnswer || inet_addr(ip.c_str()) == answer.pnu.publicaddress.addr.s_addr);
    for (const int internalPort : {80, 443, 80, 0}) {
        int port = 9091;
        unsigned lifetime = internalPort != 0 ? 3600 : 0;
        assert(client.portMappingRequest(internalPort, port, "TCP", "", internalPort == 443,
                                         lifetime) == isAnswer);
        const auto& mapping = answer.pnu.newportmapping;
        assert(port == (isAnswer ? mapping.mappedpublicport : 9091));
        assert(!isAnswer || lifetime == mapping.lifetime);
        support::VirtualClock::get().advance(1801);
        client.CheckExpiredMappings();
    }
}
