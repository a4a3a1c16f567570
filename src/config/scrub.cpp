#include "config/scrub.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <utility>

#include "common/masks.h"
#include "config/global_config.h"

namespace pelorus {

namespace {

bool sameLetter(unsigned char left, unsigned char right) {
    return std::tolower(left) == std::tolower(right);
}

}  // namespace

// Case-insensitive: secrets are part of host names, and DNS changes their case. A
// configuration file with CRLF line ends leaves a carriage return behind a secret, which no answer
// repeats.
void hideSecret(std::string& text, std::string secret, const std::string& mask) {
    while (!secret.empty() && secret.back() == '\r') secret.pop_back();
    if (secret.empty()) return;
    auto from = text.begin();
    while (true) {
        from = std::search(from, text.end(), secret.begin(), secret.end(), sameLetter);
        if (from == text.end()) return;
        const auto at = from - text.begin();
        text.replace(static_cast<std::size_t>(at), secret.size(), mask);
        from = text.begin() + at + static_cast<std::ptrdiff_t>(mask.size());
    }
}

std::string scrubSecrets(std::string text) {
    const auto* config = GlobalConfig::getInstance();
    std::array<std::pair<std::string, const char*>, 3> secrets{{
        {config->knownProperty("DEVICEID"), STRIPPED_DEVID_VAL},
        {config->knownProperty("DEVICEAUTH"), STRIPPED_DEVAUTH_VAL},
        {config->knownProperty("SUBDOMAIN"), STRIPPED_SUBDOMAIN_VAL},
    }};
    // Longest first: a secret that contains another one would otherwise be masked only in part.
    std::stable_sort(secrets.begin(), secrets.end(), [](const auto& left, const auto& right) {
        return left.first.size() > right.first.size();
    });
    for (const auto& [secret, mask] : secrets) hideSecret(text, secret, mask);
    std::replace(text.begin(), text.end(), '\n', ' ');
    return text;
}

}  // namespace pelorus
