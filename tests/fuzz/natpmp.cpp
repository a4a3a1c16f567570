// A NAT-PMP gateway's datagrams, read by the daemon and by the library.
#include "router/natpmp.h"

#include "fuzz_world.h"

namespace {

std::string datagrams;  // each begins with its size
std::string datagram;   // the one on its way

void deliver(const std::string& call) {
    if (!pelorus::support::holds(call, "natpmp wait")) return;
    auto& gateway = pelorus::support::FakeGateway::get();
    gateway.onTheWay.clear();
    gateway.datagram.reset();
    datagram.clear();
    if (datagrams.empty()) return;
    datagram = datagrams.substr(1, static_cast<unsigned char>(datagrams[0]) % 20);
    datagrams.erase(0, datagram.size() + 1);
    gateway.datagram = datagram;
    gateway.onTheWay.emplace(gateway.natpmpTime, natpmpresp_t{});
}

// Its bytes from @p first on as a number.
unsigned number(std::size_t first, std::size_t count) {
    unsigned value = 0;
    for (const char byte : datagram.substr(first, count)) {
        value = value << 8U | static_cast<unsigned char>(byte);
    }
    return value;
}

bool isSuccess(std::size_t size) {
    return datagram.size() >= size && datagram[0] == 0 && number(2, 2) == 0 &&
           number(1, 1) >= 128 && number(1, 1) <= 130;
}

}  // namespace

void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    datagrams = text;
    support::FakeGateway::get().natpmp = true;
    support::FakeGateway::get().onCall(deliver);
    CMnatpmp client;
    std::string ip;
    assert(client.retrieveExternalIP(ip) == isSuccess(12) && ip.empty() != isSuccess(12));
    for (const int internalPort : {80, 443, 80, 0}) {
        int port = 9091;
        unsigned lifetime = internalPort != 0 ? 3600 : 0;
        const bool granted =
            client.portMappingRequest(internalPort, port, "TCP", "", internalPort == 443, lifetime);
        assert(granted == isSuccess(16));
        const bool isMapping = granted && number(1, 1) != 128;
        assert(granted || port == 9091);
        assert(!isMapping ||
               (port == static_cast<int>(number(10, 2)) && lifetime == number(12, 4)));
        support::VirtualClock::get().advance(1801);
        client.CheckExpiredMappings();
    }
}
