#include "support/fake_net.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>

#include <algorithm>
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

// Fills in the address; null when @p text is none.
sockaddr* parse(const std::string& text, sockaddr_storage& address) {
    auto* v4 = reinterpret_cast<sockaddr_in*>(&address);
    auto* v6 = reinterpret_cast<sockaddr_in6*>(&address);
    if (text == "link") {
        address.ss_family = AF_PACKET;
    } else if (inet_pton(AF_INET, text.c_str(), &v4->sin_addr) == 1) {
        address.ss_family = AF_INET;
    } else if (inet_pton(AF_INET6, text.c_str(), &v6->sin6_addr) == 1) {
        address.ss_family = AF_INET6;
    } else {
        return nullptr;
    }
    return reinterpret_cast<sockaddr*>(&address);
}

}  // namespace

void FakeNet::checkReleased() const {
    EXPECT_TRUE(lists.empty()) << "address lists kept: " << lists.size();
}

extern "C" {
// clang-format off
int __real_getaddrinfo(const char* name, const char* service, const addrinfo* hints, addrinfo** list);
void __real_freeaddrinfo(addrinfo* list);

int __wrap_getaddrinfo(const char* name, const char* /*service*/, const addrinfo* hints, addrinfo** list) {
    expectTerminationHeld();
    // clang-format on
    FakeNet& net = FakeNet::get();
    addrinfo numeric = hints != nullptr ? *hints : addrinfo{};
    numeric.ai_flags = AI_NUMERICHOST;
    *list = nullptr;
    addrinfo** end = list;
    for (const std::string& address : net.names[net.asked.emplace_back(name)]) {
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
        auto& node = made->emplace_front();
        node.name = next->name;
        node.entry.ifa_next = *list;
        node.entry.ifa_name = node.name.data();
        node.entry.ifa_flags = next->flags;
        node.entry.ifa_addr = parse(next->address, node.address);
        *list = &node.entry;
    }
    if (*list != nullptr) net.lists[*list] = made;
    return 0;
}

void __wrap_freeifaddrs(ifaddrs* list) {
    const bool known = FakeNet::get().lists.erase(list) == 1;
    EXPECT_TRUE(known || list == nullptr) << "released a list that was not given, or twice";
}

void __wrap_freeaddrinfo(addrinfo* list) {
    const bool known = FakeNet::get().lists.erase(list) == 1;
    EXPECT_TRUE(known || list == nullptr) << "released a list that was not given, or twice";
    __real_freeaddrinfo(list);
}

int __wrap_gethostname(char* name, std::size_t size) {
    const FakeNet& net = FakeNet::get();
    errno = EPERM;
    if (net.hostnameFails) return -1;
    // Like libc: no terminator where the name fills the buffer.
    std::memcpy(name, net.hostname.c_str(), std::min(size, net.hostname.size() + 1));
    return size > net.hostname.size() ? 0 : -1;
}

// The one call of libcurl without a world behind it; a build without the library links too.
const char* __wrap_curl_easy_strerror(int code) {
    constexpr int kTimedOut = 28;
    return code == kTimedOut ? "Timeout was reached" : "Another error";
}
}

}  // namespace pelorus::support
