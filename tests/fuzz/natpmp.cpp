// A NAT-PMP gateway's datagrams, read by the library itself and then by the daemon.
#include "router/natpmp.h"

#include <arpa/inet.h>
#include <sys/socket.h>

#include "fuzz_world.h"

extern "C" int __real_readnatpmpresponseorretry(natpmp_t* client, natpmpresp_t* response);

namespace {

std::string datagrams;  // each begins with its size
natpmpresp_t answer;
bool isAnswer;

// A socket on this machine that is its own peer.
int makeLoop() {
    sockaddr_in address{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t size = sizeof address;
    auto* const plain = reinterpret_cast<sockaddr*>(&address);
    const int loop = socket(AF_INET, SOCK_DGRAM, 0);
    assert(bind(loop, plain, size) == 0 && getsockname(loop, plain, &size) == 0);
    assert(connect(loop, plain, size) == 0);
    return loop;
}

void deliver(const std::string& call) {
    if (!pelorus::support::holds(call, "natpmp wait")) return;
    static const int loop = makeLoop();
    auto& gateway = pelorus::support::FakeGateway::get();
    gateway.onTheWay.clear();
    isAnswer = false;
    if (datagrams.empty()) return;
    const std::string datagram = datagrams.substr(1, static_cast<unsigned char>(datagrams[0]) % 17);
    datagrams.erase(0, datagram.size() + 1);
    natpmp_t library{};
    library.s = loop;
    library.gateway = htonl(INADDR_LOOPBACK);
    library.has_pending_request = 1;
    assert(send(loop, datagram.data(), datagram.size(), 0) >= 0);
    isAnswer = __real_readnatpmpresponseorretry(&library, &answer) >= 0;
    gateway.failing.clear();
    if (!isAnswer) gateway.failing = {"read"};
    gateway.onTheWay.emplace(gateway.natpmpTime, answer);
}

}  // namespace

void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    datagrams = text;
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
