#include "support/fake_net.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <netdb.h>

#include <cerrno>
#include <cstring>
#include <deque>

namespace pelorus::support {

namespace {

// An entry of getifaddrs with what it points to.
struct Node {
    ifaddrs entry{};
    std::string name;  // cppcheck-suppress unusedStructMember; entry points to it
    sockaddr_storage address{};
};

sa_family_t parse(const std::string& text, sockaddr_storage& address) {
    auto& v4 = reinterpret_cast<sockaddr_in&>(address);
    auto& v6 = reinterpret_cast<sockaddr_in6&>(address);
    if (inet_pton(AF_INET, text.c_str(), &v4.sin_addr) == 1) return AF_INET;
    return inet_pton(AF_INET6, text.c_str(), &v6.sin6_addr) == 1 ? AF_INET6 : AF_PACKET;
}

void release(void* list) {
    EXPECT_TRUE(list == nullptr || FakeNet::get().lists.erase(list) == 1)
        << "released a list that was not given, or twice";
}

}  // namespace

extern "C" {
int __real_getaddrinfo(const char*, const char*, const addrinfo*, addrinfo**);
void __real_freeaddrinfo(addrinfo* list);

int __wrap_getaddrinfo(const char* name, const char*, const addrinfo* hints, addrinfo** list) {
    expectTerminationHeld();
    FakeNet& net = FakeNet::get();
    if (net.onLookup) net.onLookup(name);
    addrinfo numeric = hints != nullptr ? *hints : addrinfo{};
    numeric.ai_flags = AI_NUMERICHOST;
    *list = nullptr;
    addrinfo** end = list;
    for (const std::string& address : net.names[net.lookups.emplace_back(name)]) {
        if (__real_getaddrinfo(address.c_str(), nullptr, &numeric, end) != 0) *end = nullptr;
        while (*end != nullptr) end = &(*end)->ai_next;
    }
    if (*list == nullptr) return EAI_NONAME;
    net.lists[*list] = nullptr;
    return 0;
}

int __wrap_getifaddrs(ifaddrs** list) {
    FakeNet& net = FakeNet::get();
    errno = ENOMEM;
    *list = nullptr;
    if (net.interfacesFail) return -1;
    const auto made = std::make_shared<std::deque<Node>>();
    for (auto next = net.interfaces.rbegin(); next != net.interfaces.rend(); ++next) {
        auto& [entry, name, address] = made->emplace_front();
        name = next->name;
        address.ss_family = parse(next->address, address);
        entry.ifa_next = *list;
        entry.ifa_name = name.data();
        entry.ifa_flags = next->flags;
        entry.ifa_addr = next->address.empty() ? nullptr : reinterpret_cast<sockaddr*>(&address);
        *list = &entry;
    }
    if (*list != nullptr) net.lists[*list] = made;
    return 0;
}

void __wrap_freeifaddrs(ifaddrs* list) {
    release(list);
}

void __wrap_freeaddrinfo(addrinfo* list) {
    release(list);
    __real_freeaddrinfo(list);
}

int __wrap_gethostname(char* name, std::size_t size) {
    errno = EPERM;
    std::strncpy(name, FakeNet::get().hostname.c_str(), size);
    return FakeNet::get().hostnameFails ? -1 : 0;
}
}

}  // namespace pelorus::support
