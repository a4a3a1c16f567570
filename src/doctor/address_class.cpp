#include "doctor/address_class.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <array>
#include <cstdint>
#include <optional>

namespace pelorus::doctor {

namespace {

struct Network {
    const char* address;
    int length;
    AddressClass kind;
};

constexpr std::array<Network, 15> kNetworks{{
    {"0.0.0.0", 8, AddressClass::NONE},
    {"10.0.0.0", 8, AddressClass::HOME},
    {"172.16.0.0", 12, AddressClass::HOME},
    {"192.168.0.0", 16, AddressClass::HOME},
    {"100.64.0.0", 10, AddressClass::SHARED},
    {"127.0.0.0", 8, AddressClass::RESERVED},
    {"169.254.0.0", 16, AddressClass::RESERVED},
    {"192.0.0.0", 29, AddressClass::SHARED},
    {"192.0.0.0", 24, AddressClass::RESERVED},
    {"192.0.2.0", 24, AddressClass::RESERVED},
    {"198.18.0.0", 15, AddressClass::RESERVED},
    {"198.51.100.0", 24, AddressClass::RESERVED},
    {"203.0.113.0", 24, AddressClass::RESERVED},
    {"224.0.0.0", 4, AddressClass::RESERVED},
    {"240.0.0.0", 4, AddressClass::RESERVED},
}};

std::optional<std::uint32_t> numberOf(const char* address) {
    in_addr parsed{};
    if (inet_pton(AF_INET, address, &parsed) != 1) return std::nullopt;
    return ntohl(parsed.s_addr);
}

bool isIn(std::uint32_t address, const Network& network) {
    return ((address ^ numberOf(network.address).value_or(0)) >> (32 - network.length)) == 0;
}

}  // namespace

AddressClass classOf(const std::string& address) {
    const auto number = numberOf(address.c_str());
    if (!number) return AddressClass::NONE;
    for (const Network& network : kNetworks) {
        if (isIn(*number, network)) return network.kind;
    }
    return AddressClass::PUBLIC;
}

bool isAtHome(const std::string& address) {
    return classOf(address) == AddressClass::HOME || address.rfind("169.254.", 0) == 0;
}

}  // namespace pelorus::doctor
