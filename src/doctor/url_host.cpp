#include "doctor/url_host.h"

#include <algorithm>
#include <cctype>

#include "common/text.h"

namespace pelorus::doctor {

namespace {

constexpr int kHttpPort = 80;
constexpr int kHttpsPort = 443;
constexpr int kLastPort = 65535;

// 0 for another scheme.
int portOfScheme(std::string scheme) {
    std::transform(scheme.begin(), scheme.end(), scheme.begin(),
                   [](unsigned char letter) { return static_cast<char>(std::tolower(letter)); });
    if (scheme == "http") return kHttpPort;
    return scheme == "https" ? kHttpsPort : 0;
}

// What stands between the scheme and the path, without user and password.
std::string authorityOf(const std::string& url, std::size_t start) {
    const std::string authority = url.substr(start, url.find_first_of("/?#", start) - start);
    return authority.substr(authority.rfind('@') + 1);
}

}  // namespace

std::optional<HostAndPort> hostOfUrl(const std::string& url) {
    const std::size_t colon = url.find("://");
    if (colon == std::string::npos) return std::nullopt;
    HostAndPort found{{}, portOfScheme(url.substr(0, colon))};
    const std::string authority = authorityOf(url, colon + 3);
    const bool bracketed = !authority.empty() && authority.front() == '[';
    const std::size_t end = bracketed ? authority.find(']') : authority.find(':');
    found.host = bracketed ? authority.substr(1, end - 1) : authority.substr(0, end);
    if (bracketed && end == std::string::npos) return std::nullopt;
    if (end != std::string::npos) {
        const std::string rest = authority.substr(end + (bracketed ? 1 : 0));
        if (rest.size() > 1) found.port = scanInt(rest.c_str() + 1).value_or(0);
    }
    if (found.host.empty() || found.port < 1 || found.port > kLastPort) return std::nullopt;
    return found;
}

std::string serviceHost(const std::string& baseUrl) {
    const std::size_t slash = baseUrl.find('/');
    if (slash == std::string::npos || slash + 3 >= baseUrl.size()) return {};
    return baseUrl.substr(slash + 2);
}

std::string serviceName(const std::string& baseUrl) {
    const std::string authority = authorityOf(serviceHost(baseUrl), 0);
    return authority.substr(0, authority.find(':'));
}

std::string domainOfNames(const std::string& baseUrl) {
    const std::size_t dot = baseUrl.find('.');
    return dot == std::string::npos ? ".kavra.example" : baseUrl.substr(dot);
}

}  // namespace pelorus::doctor
