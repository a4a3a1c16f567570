#include "doctor/resolver.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <array>
#include <chrono>
#include <cstdlib>
#include <memory>

#include "common/handles.h"
#include "common/own_address.h"

namespace pelorus::doctor {

namespace {

constexpr std::chrono::seconds kPatience{2};  // for one question

std::string textOf(const addrinfo& entry) {
    const void* const raw = entry.ai_addr;
    const void* address = nullptr;
    if (entry.ai_family == AF_INET) address = &static_cast<const sockaddr_in*>(raw)->sin_addr;
    if (entry.ai_family == AF_INET6) address = &static_cast<const sockaddr_in6*>(raw)->sin6_addr;
    std::array<char, INET6_ADDRSTRLEN> text{};
    if (address == nullptr ||
        inet_ntop(entry.ai_family, address, text.data(), text.size()) == nullptr) {
        return {};
    }
    return text.data();
}

}  // namespace

void hurryResolver() {
    // One thread; the C library reads it at its first lookup.
    // A few lost packets must not count as silence.
    static_cast<void>(setenv("RES_OPTIONS", "timeout:2 attempts:3", 1));
}

Lookup lookUp(const std::string& host) {
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* list = nullptr;
    const auto begin = std::chrono::steady_clock::now();
    const int error = getaddrinfo(host.c_str(), nullptr, &hints, &list);
    Lookup result;
    if (error == EAI_AGAIN) {
        const bool wasSilent = std::chrono::steady_clock::now() - begin >= kPatience;
        result.noServer = true;
        result.obstacle = wasSilent ? kSilentNameServer : "the name server cannot tell now";
        return result;
    }
    if (error != 0) {
        result.obstacle = "no such name";
        return result;
    }
    const std::unique_ptr<addrinfo, Releaser<freeaddrinfo>> owned(list);
    for (const addrinfo* entry = list; entry != nullptr; entry = entry->ai_next) {
        const std::string address = textOf(*entry);
        if (!address.empty()) result.addresses.push_back(address);
    }
    if (result.addresses.empty()) result.obstacle = "the name has no address";
    return result;
}

bool isThisDevice(const std::string& address) {
    in_addr parsed{};
    if (inet_pton(AF_INET, address.c_str(), &parsed) == 1) return isOwnAddress(parsed);
    return address == "::1" || address == "::";
}

}  // namespace pelorus::doctor
