#include <arpa/inet.h>
#include <curl/curl.h>
#include <netdb.h>
#include <netinet/in.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <utility>

#include "cloud/tavik_client.h"
#include "common/bounded_call.h"
#include "common/handles.h"
#include "common/log.h"
#include "common/signal_block.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr std::size_t kReceiveBlockSize = 10240;  // bytes
constexpr std::size_t kLargestAnswer = 10238;     // bytes
constexpr long kTransferTimeout = 30000;          // milliseconds, for the whole transfer
// The resolver has no limit of its own when a name server wants TCP and then says nothing; libcurl
// waits for its end.
constexpr int kResolverLimit = 31;  // seconds, also for a transfer
constexpr long kVerifyPeer = 1;

using CurlHandle = std::unique_ptr<CURL, Releaser<curl_easy_cleanup>>;
using AddrInfoHandle = std::unique_ptr<addrinfo, Releaser<freeaddrinfo>>;

void releaseBlock(CurlRcvBuffer& buffer) {
    std::free(buffer.data);  // NOLINT(*-no-malloc): allocated by curlRcvData
    buffer = {};
}

void setOptions(CURL* handle, const char* url, CurlRcvBuffer& buffer) {
    curl_easy_setopt(handle, CURLOPT_TIMEOUT_MS, kTransferTimeout);
    curl_easy_setopt(handle, CURLOPT_WRITEFUNCTION, curlRcvData);
    curl_easy_setopt(handle, CURLOPT_WRITEDATA, &buffer);
    curl_easy_setopt(handle, CURLOPT_SSLVERSION, long{CURL_SSLVERSION_DEFAULT});
    curl_easy_setopt(handle, CURLOPT_URL, url);
    curl_easy_setopt(handle, CURLOPT_SSL_VERIFYPEER, kVerifyPeer);
}

// Null for families without an address.
const void* addressOf(const addrinfo& entry) {
    const void* address = entry.ai_addr;
    if (entry.ai_family == AF_INET) return &static_cast<const sockaddr_in*>(address)->sin_addr;
    if (entry.ai_family == AF_INET6) return &static_cast<const sockaddr_in6*>(address)->sin6_addr;
    return nullptr;
}

int lookUp(const std::string& hostname, addrinfo*& found) {
    const BoundedCall bounds{Peer::ANYBODY, kResolverLimit};
    return getaddrinfo(hostname.c_str(), nullptr, nullptr, &found);
}

std::string firstAddress(const addrinfo* list) {
    for (; list != nullptr; list = list->ai_next) {
        const void* address = addressOf(*list);
        if (address == nullptr) continue;
        std::array<char, INET6_ADDRSTRLEN> text{};
        if (inet_ntop(list->ai_family, address, text.data(), text.size()) != nullptr) {
            return text.data();
        }
    }
    return {};
}

}  // namespace

std::size_t curlRcvData(void* data, std::size_t elemSize, std::size_t count, void* context) try {
    auto& buffer = *static_cast<CurlRcvBuffer*>(context);
    if (buffer.data == nullptr) {
        // httpGet hands the block to its callers, who release it with free.
        buffer.data = static_cast<char*>(std::malloc(kReceiveBlockSize));  // NOLINT(*-no-malloc)
        if (buffer.data == nullptr) {
            logError(
                "TavikClient curlRcvData - failed to allocate memory for receive buffer, transfer aborted\n");
            return 0;
        }
    }
    const std::size_t remaining = kLargestAnswer - static_cast<std::size_t>(buffer.size);
    const bool fits = count == 0 || elemSize <= remaining / count;
    if (!fits) {
        logError(
            "TavikClient curlRcvData - Buffer overrun detected, read buffer too small, transfer aborted\n");
        releaseBlock(buffer);
        return 0;
    }
    const std::size_t bytes = elemSize * count;
    std::memcpy(buffer.data + buffer.size, data, bytes);
    buffer.size += static_cast<int>(bytes);
    return bytes;
} catch (...) {
    logError("** TavikClient curlRcvData - Throw exception error. **\n");
    return 0;
}

TavikClient::~TavikClient() {
    cleanup();
}

TavikClient* TavikClient::getInstance() {
    static TavikClient instance;
    static bool initialized = false;
    if (!initialized) {
        if (!instance.initialize()) {
            instance.updateLocalCommStatus("disabled");
            logError(
                "TavikClient::getInstance() - initialize() returned false, set Comm Status to [disabled]\n");
        }
        initialized = true;
    }
    return &instance;
}

bool TavikClient::initialize() {
    portMapCheckSuccess = true;
    const std::string deviceId = getDeviceID();
    const std::string deviceAuth = getDeviceAuth();
    const bool complete = !deviceId.empty() && !deviceAuth.empty();
    if (!complete) {
        logError(
            "TavikClient::initialize() - failed to read DEVICEID, DEVICEAUTH from dynamic config file\n");
    }
    const TerminationBlock held;
    if (curl_global_init(CURL_GLOBAL_ALL) != CURLE_OK) {
        logError("TavikClient::initialize() - CURL initialization failed.\n");
    }
    return complete;
}

void TavikClient::cleanup() {
    const TerminationBlock held;
    curl_global_cleanup();
}

std::string TavikClient::getDeviceID() const {
    return setting("DEVICEID");
}

std::string TavikClient::getDeviceAuth() const {
    return setting("DEVICEAUTH");
}

// Ignores the configured scheme and builds both base URLs. False, with the cause logged, when no
// host of at least two characters is left.
bool TavikClient::deriveServerUrls() {
    const std::string base = setting("SERVER_BASE_URL");
    const std::size_t slash = base.find('/');
    if (slash != std::string::npos) {
        const std::size_t host = slash + 2;
        if (host + 1 < base.size()) serverHost = base.substr(host);
    }
    if (base.empty() || serverHost.empty()) {
        logError("TavikClient::getRestUrl - Invalid base server url %s. Return input urn.\n",
                 scrubSecrets(base).c_str());
        return false;
    }
    baseServerUrl = "http://" + serverHost;
    logInfo("TavikClient::getRestUrl - baseServerUrl %s.\n", scrubSecrets(baseServerUrl).c_str());
    baseSSLServerUrl = "https://" + serverHost;
    logInfo("TavikClient::getRestUrl - baseSSLServerUrl %s.\n",
            scrubSecrets(baseSSLServerUrl).c_str());
    return true;
}

std::string TavikClient::getRestUrl(const std::string& urn, HttpType type) {
    if ((baseServerUrl.empty() || baseSSLServerUrl.empty()) && !deriveServerUrls()) return urn;

    std::string url = urn;
    if (type == HTTP) {
        url = baseServerUrl + urn;
    } else if (type == HTTPS) {
        url = baseSSLServerUrl + urn;
    } else {
        logInfo("TavikClient::getRestUrl - Invalid http type %d. Use only the input urn.\n",
                static_cast<int>(type));
    }
    // Still a template: the log shows its placeholders as "_s".
    std::string logged = scrubSecrets(url);
    replaceAll(logged, "%", "_");
    logInfo("TavikClient::getRestUrl - restURL %s.\n", logged.c_str());
    return url;
}

char* TavikClient::httpGet(const char* url, int& size) {
    if (url == nullptr || *url == '\0') {
        logInfo("TavikClient:httpGet - empty url\n");
        return nullptr;
    }
    rcvBuffer = {};
    try {
        const BoundedCall bounds{Peer::ANYBODY, kResolverLimit};
        const CurlHandle handle{curl_easy_init()};
        if (handle) {
            setOptions(handle.get(), url, rcvBuffer);
            const CURLcode result = curl_easy_perform(handle.get());
            // Data received before the failure is still returned.
            if (result != CURLE_OK) {
                logError("TavikClient::httpGet  Error: [%s]\n", curl_easy_strerror(result));
            }
        }
    } catch (...) {
        logError("** TavikClient::httpGet - Throw exception error. **\n");
        releaseBlock(rcvBuffer);
        return nullptr;
    }
    size = rcvBuffer.size;
    return std::exchange(rcvBuffer.data, nullptr);
}

std::optional<Answer> TavikClient::fetchCentral(const MaskedUrl& url) {
    int size = 0;
    const MallocHandle<char> data{httpGet(url.request.c_str(), size)};
    if (!data) return std::nullopt;
    return Answer{data.get(), size};
}

std::string TavikClient::nsLookup(const std::string& hostname) const {
    const TerminationBlock held;
    addrinfo* found = nullptr;
    const int error = lookUp(hostname, found);
    if (error != 0) {
        logError("TavikClient::nsLookup() - getAddrInfo failed with error: %s\n",
                 gai_strerror(error));
        logError("TavikClient::nsLookup() - getAddrInfo failed hostname: %s\n",
                 scrubSecrets(hostname).c_str());
        return {};
    }
    const AddrInfoHandle list{found};
    return firstAddress(list.get());
}

void TavikClient::ReplaceStringInPlace(std::string& subject,
                                       const std::string& search,
                                       const std::string& replace) const {
    replaceAll(subject, search, replace);
}

}  // namespace pelorus
