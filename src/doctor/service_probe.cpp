#include "doctor/service_probe.h"

#include <curl/curl.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <ctime>
#include <memory>

#include "common/handles.h"
#include "doctor/certificate_verdict.h"
#include "doctor/resolver.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr long kConnectPatience = 7000;  // milliseconds
constexpr long kTimePatience = 2000;     // milliseconds

using CurlHandle = std::unique_ptr<CURL, Releaser<curl_easy_cleanup>>;
using ErrorText = std::array<char, CURL_ERROR_SIZE>;

void unreachable(Findings& findings, const std::string& text) {
    findings.add(Sign::SERVICE_UNREACHABLE, "the central service " + text);
    findings.problem("central service: " + text);
}

void unresolved(Findings& findings, const std::string& text) {
    findings.add(Sign::SERVICE_UNRESOLVED, text);
    findings.problem("central service: " + text);
}

// Neither body nor proxy: the daemon runs without the variables of a login.
CurlHandle connectionTo(const std::string& url, long patience) {
    CurlHandle handle{curl_easy_init()};
    if (!handle) return handle;
    curl_easy_setopt(handle.get(), CURLOPT_URL, url.c_str());
    curl_easy_setopt(handle.get(), CURLOPT_TIMEOUT_MS, patience);
    curl_easy_setopt(handle.get(), CURLOPT_SSLVERSION, long{CURL_SSLVERSION_DEFAULT});
    curl_easy_setopt(handle.get(), CURLOPT_PROXY, "");
    return handle;
}

std::optional<std::time_t> parsedTime(const char* text) {
    const std::time_t when = curl_getdate(text, nullptr);
    if (when < 0) return std::nullopt;
    return when;
}

std::size_t takeHeader(char* data, std::size_t size, std::size_t count, void* context) {
    constexpr std::string_view kName = "Date:";
    const std::string line(data, std::min<std::size_t>(size * count, 200));
    if (strncasecmp(line.c_str(), kName.data(), kName.size()) == 0) {
        static_cast<ServiceTimes*>(context)->date = parsedTime(line.c_str() + kName.size());
    }
    return size * count;
}

void takeCertificateTimes(CURL* handle, ServiceTimes& times) {
    constexpr std::string_view kFirst = "Start date:";
    constexpr std::string_view kLast = "Expire date:";
    curl_certinfo* chain = nullptr;
    if (curl_easy_getinfo(handle, CURLINFO_CERTINFO, &chain) != CURLE_OK || chain == nullptr)
        return;
    if (chain->num_of_certs < 1) return;
    for (const curl_slist* entry = chain->certinfo[0]; entry != nullptr; entry = entry->next) {
        const std::string line = entry->data;
        if (line.rfind(kFirst, 0) == 0) times.notBefore = parsedTime(line.c_str() + kFirst.size());
        if (line.rfind(kLast, 0) == 0) times.notAfter = parsedTime(line.c_str() + kLast.size());
    }
}

// Asks without verification, as the certificate does not pass; nothing secret is sent.
ServiceTimes askForTimes(const std::string& url) {
    ServiceTimes times;
    const CurlHandle handle = connectionTo(url, kTimePatience);
    if (!handle) return times;
    curl_easy_setopt(handle.get(), CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(handle.get(), CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(handle.get(), CURLOPT_CERTINFO, 1L);
    curl_easy_setopt(handle.get(), CURLOPT_NOBODY, 1L);
    curl_easy_setopt(handle.get(), CURLOPT_HEADERFUNCTION, takeHeader);
    curl_easy_setopt(handle.get(), CURLOPT_HEADERDATA, &times);
    static_cast<void>(curl_easy_perform(handle.get()));
    takeCertificateTimes(handle.get(), times);
    return times;
}

void judgeCertificate(const std::string& url, const std::string& message, Findings& findings) {
    const std::string fault = certificateFault(message);
    const std::string text = "certificate of the central service " + fault;
    findings.add(Sign::SERVICE_CERTIFICATE_BAD, "the " + text);
    findings.problem(text);
    if (!mayBeTheClock(fault)) return;
    const auto clock = clockFault(std::time(nullptr), askForTimes(url));
    if (!clock) return;
    findings.add(Sign::CLOCK_WRONG, *clock);
    findings.problem("clock: " + *clock);
}

// curl_easy_getinfo() tells the time of a connection only once the handshake is over.
int closeSocket(void* context, curl_socket_t number) {
    sockaddr_storage peer{};
    socklen_t size = sizeof peer;
    void* const raw = &peer;
    const bool wasConnected = getpeername(number, static_cast<sockaddr*>(raw), &size) == 0;
    if (wasConnected) *static_cast<bool*>(context) = true;
    return close(number);
}

// The daemon waits longer: a slow handshake explains nothing while the device is reached. A host
// that takes no connection in all that time is not there.
void judgeSilence(bool wasConnected, bool isFailed, Findings& findings) {
    if (wasConnected && !isFailed) {
        findings.notSeen("central service: takes connections, but no TLS handshake in 7 s");
    } else {
        unreachable(findings, "does not answer in time");
    }
}

void connectToService(const std::string& url,
                      const std::string& host,
                      bool isFailed,
                      Findings& findings) {
    bool wasConnected = false;
    ErrorText message{};
    CurlHandle handle = connectionTo(url, kConnectPatience);
    if (!handle) return;
    curl_easy_setopt(handle.get(), CURLOPT_CLOSESOCKETFUNCTION, closeSocket);
    curl_easy_setopt(handle.get(), CURLOPT_CLOSESOCKETDATA, &wasConnected);
    curl_easy_setopt(handle.get(), CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(handle.get(), CURLOPT_CONNECT_ONLY, 1L);
    curl_easy_setopt(handle.get(), CURLOPT_ERRORBUFFER, message.data());
    const CURLcode result = curl_easy_perform(handle.get());
    handle.reset();  // closes
    switch (result) {
        case CURLE_OK:
            findings.add(Sign::SERVICE_REACHED, "the central service " + host + " is reached");
            findings.ok("central service: name, connection and certificate");
            return;
        case CURLE_PEER_FAILED_VERIFICATION:
            judgeCertificate(url, message.data(), findings);
            return;
        case CURLE_SSL_CACERT_BADFILE:
            findings.add(Sign::SERVICE_CERTIFICATE_BAD,
                         "this device has no list of certificate authorities");
            findings.problem("central service: no list of certificate authorities here");
            return;
        case CURLE_COULDNT_RESOLVE_HOST:
            unresolved(findings, "the name of the central service is not resolved");
            return;
        case CURLE_OPERATION_TIMEDOUT:
            judgeSilence(wasConnected, isFailed, findings);
            return;
        case CURLE_COULDNT_CONNECT:
            unreachable(findings, "cannot be connected to");
            return;
        default:
            unreachable(findings, std::string{"does not complete the connection: "} +
                                      curl_easy_strerror(result));
            return;
    }
}

}  // namespace

void lookAtService(const Evidence& evidence, Findings& findings) {
    const std::string server = serviceHost(evidence.setting("SERVER_BASE_URL"));
    const std::string url = "https://" + server + "/";
    const auto target = hostOfUrl(url);
    if (server.empty() || !target) {
        findings.notSeen("central service: SERVER_BASE_URL names no host");
        return;
    }
    hurryResolver();
    findings.set("resolving", target->host);
    const Lookup found = lookUp(target->host);
    findings.set("resolving", "");
    if (found.addresses.empty()) {
        unresolved(findings, "name " + target->host + ": " + found.obstacle);
    } else if (std::any_of(found.addresses.begin(), found.addresses.end(), isThisDevice)) {
        unresolved(findings, "name " + target->host + " leads to this device");
    } else {
        connectToService(url, target->host, evidence.statusWord == "failed", findings);
    }
}

void judgeUnfinishedService(const Findings& sofar, Findings& findings) {
    const std::string host = sofar.value("resolving");
    if (!host.empty()) unresolved(findings, "name " + host + ": " + kSilentNameServer);
}

}  // namespace pelorus::doctor
