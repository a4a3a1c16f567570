#include "cloud/public_address.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <cstring>

#include "cloud/tavik_client.h"
#include "common/handles.h"
#include "common/log.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr const char* kMyIpPath = "/api/1.0/rest/myip";

}  // namespace

bool isIpv4Address(const std::string& text) {
    in_addr parsed{};
    const bool holdsNoNul = std::strlen(text.c_str()) == text.size();
    return holdsNoNul && inet_pton(AF_INET, text.c_str(), &parsed) != 0;
}

// NOLINTNEXTLINE(performance-unnecessary-value-param): the interface takes a copy
bool TavikClient::validateIpAddress(std::string address) const {
    return isIpv4Address(address);
}

bool TavikClient::getMyIP(std::string& ip, int& waitSeconds) try {
    if (serverRequestedSleep()) {
        waitSeconds = pollServerForSleepTime();
        logInfo("TavikClient::getMyIP - server has requested sleep %d seconds.\n", waitSeconds);
        return false;
    }
    waitSeconds = 0;
    const std::string url =
        fillTemplate("the public address path", getRestUrl(kMyIpPath, HTTP), {});
    logInfo("TavikClient::getMyIP - get my IP url: %s\n", scrubSecrets(url).c_str());
    int size = 0;
    const MallocHandle<char> data{httpGet(url.c_str(), size)};
    if (!data) {
        logError(
            "TavikClient::getMyIP - httpGet failed to get response from central server for url %s.\n",
            scrubSecrets(url).c_str());
        return false;
    }
    // Not trimmed, and kept even when it is no address.
    ip.assign(data.get(), static_cast<std::size_t>(size));
    logInfo("TavikClient::getMyIP - httpGet Response [%d bytes]: %s\n", size,
            scrubSecrets(ip).c_str());
    return isIpv4Address(ip);
} catch (...) {
    logError("** TavikClient::getMyIP - Throw exception error. **\n");
    return false;
}

}  // namespace pelorus
