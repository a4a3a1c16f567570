#include "support/fake_net.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <deque>

namespace pelorus::support {

namespace {

using Storage = sockaddr_storage;

// Fills @p storage; false when @p address is no address.
bool toSockaddr(const std::string& address, Storage& storage) {
    sockaddr_in v4{};
    sockaddr_in6 v6{};
    if (address == "link") {
        storage.ss_family = AF_PACKET;
    } else if (inet_pton(AF_INET, address.c_str(), &v4.sin_addr) == 1) {
        v4.sin_family = AF_INET;
        std::memcpy(&storage, &v4, sizeof v4);
    } else if (inet_pton(AF_INET6, address.c_str(), &v6.sin6_addr) == 1) {
        v6.sin6_family = AF_INET6;
        std::memcpy(&storage, &v6, sizeof v6);
    } else {
        return false;
    }
    return true;
}

sockaddr* asSockaddr(Storage& storage) {
    return reinterpret_cast<sockaddr*>(&storage);
}

constexpr std::array<int, 3> kSocketTypes{SOCK_STREAM, SOCK_DGRAM, SOCK_RAW};

}  // namespace

struct FakeNet::InterfaceList {
    std::deque<ifaddrs> entries;
    std::deque<std::string> names;
    std::deque<Storage> addresses;

    void add(const Interface& interface) {
        names.push_back(interface.name);
        addresses.emplace_back();
        ifaddrs entry{};
        entry.ifa_name = names.back().data();
        entry.ifa_flags = interface.flags;
        if (toSockaddr(interface.address, addresses.back())) {
            entry.ifa_addr = asSockaddr(addresses.back());
        }
        entries.push_back(entry);
        if (entries.size() > 1) entries[entries.size() - 2].ifa_next = &entries.back();
    }
};

struct FakeNet::AddressList {
    std::deque<addrinfo> entries;
    std::deque<Storage> addresses;

    void add(const std::string& address, int socketType, const addrinfo* hints) {
        Storage storage{};
        if (!toSockaddr(address, storage)) return;
        const int family = hints != nullptr ? hints->ai_family : AF_UNSPEC;
        if (family != AF_UNSPEC && family != storage.ss_family) return;
        addresses.push_back(storage);
        addrinfo entry{};
        entry.ai_family = storage.ss_family;
        entry.ai_socktype = socketType;
        entry.ai_addr = asSockaddr(addresses.back());
        entry.ai_addrlen =
            storage.ss_family == AF_INET ? sizeof(sockaddr_in) : sizeof(sockaddr_in6);
        entries.push_back(entry);
        if (entries.size() > 1) entries[entries.size() - 2].ai_next = &entries.back();
    }
};

FakeNet::FakeNet() {
    reset();
}

FakeNet::~FakeNet() = default;

FakeNet& FakeNet::get() {
    static FakeNet instance;
    return instance;
}

void FakeNet::setName(const std::string& name, const std::vector<std::string>& addresses) {
    names[name] = addresses;
}

void FakeNet::reset() {
    interfaces = {{"lo", "127.0.0.1", IFF_UP | IFF_RUNNING | IFF_LOOPBACK},
                  {"eth0", "192.168.77.10"}};
    interfacesFail = false;
    hostname = "nas";
    hostnameFails = false;
    names.clear();
    asked.clear();
    interfaceLists.clear();
    addressLists.clear();
}

void FakeNet::checkReleased() const {
    EXPECT_TRUE(interfaceLists.empty()) << "getifaddrs lists kept: " << interfaceLists.size();
    EXPECT_TRUE(addressLists.empty()) << "getaddrinfo lists kept: " << addressLists.size();
}

int FakeNet::takeInterfaces(ifaddrs** list) {
    if (interfacesFail) {
        errno = ENOMEM;
        return -1;
    }
    auto made = std::make_unique<InterfaceList>();
    for (const Interface& interface : interfaces) made->add(interface);
    *list = made->entries.empty() ? nullptr : &made->entries.front();
    if (*list != nullptr) interfaceLists.emplace(*list, std::move(made));
    return 0;
}

void FakeNet::releaseInterfaces(ifaddrs* list) {
    if (list == nullptr) return;
    EXPECT_EQ(interfaceLists.erase(list), 1U) << "freeifaddrs of something getifaddrs did not give";
}

int FakeNet::lookUp(const char* name,
                    const char* /*service*/,
                    const addrinfo* hints,
                    addrinfo** list) {
    asked.emplace_back(name != nullptr ? name : "");
    const auto found = names.find(asked.back());
    if (found == names.end()) return EAI_NONAME;
    auto made = std::make_unique<AddressList>();
    const int wanted = hints != nullptr ? hints->ai_socktype : 0;
    for (const std::string& address : found->second) {
        for (const int type : kSocketTypes) {
            if (wanted == 0 || wanted == type) made->add(address, type, hints);
        }
    }
    if (made->entries.empty()) return EAI_NONAME;
    *list = &made->entries.front();
    addressLists.emplace(*list, std::move(made));
    return 0;
}

void FakeNet::releaseAddresses(addrinfo* list) {
    EXPECT_EQ(addressLists.erase(list), 1U) << "freeaddrinfo of something getaddrinfo did not give";
}

int FakeNet::takeHostname(char* name, std::size_t size) const {
    if (hostnameFails) {
        errno = EPERM;
        return -1;
    }
    // Like libc: no terminator where the name fills the buffer.
    const std::size_t taken = std::min(size, hostname.size() + 1);
    std::memcpy(name, hostname.c_str(), taken);
    if (taken > hostname.size()) return 0;
    errno = ENAMETOOLONG;
    return -1;
}

}  // namespace pelorus::support

using pelorus::support::FakeNet;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
int __wrap_getifaddrs(ifaddrs** list);
void __wrap_freeifaddrs(ifaddrs* list);
int __wrap_getaddrinfo(const char* name,
                       const char* service,
                       const addrinfo* hints,
                       addrinfo** list);
void __wrap_freeaddrinfo(addrinfo* list);
int __wrap_gethostname(char* name, std::size_t size);
}

int __wrap_getifaddrs(ifaddrs** list) {
    return FakeNet::get().takeInterfaces(list);
}

void __wrap_freeifaddrs(ifaddrs* list) {
    FakeNet::get().releaseInterfaces(list);
}

int __wrap_getaddrinfo(const char* name,
                       const char* service,
                       const addrinfo* hints,
                       addrinfo** list) {
    return FakeNet::get().lookUp(name, service, hints, list);
}

void __wrap_freeaddrinfo(addrinfo* list) {
    FakeNet::get().releaseAddresses(list);
}

int __wrap_gethostname(char* name, std::size_t size) {
    return FakeNet::get().takeHostname(name, size);
}
// NOLINTEND(bugprone-reserved-identifier)
