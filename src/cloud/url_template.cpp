#include "cloud/url_template.h"

#include <algorithm>
#include <cctype>
#include <optional>
#include <string_view>

#include "common/log.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

enum class Secrets { REAL, MASKED };

// Leaves what addresses and words consist of.
std::string percentEncoded(const std::string& text) {
    constexpr std::string_view kPlain = ".:-_~";
    constexpr std::string_view kHexDigits = "0123456789ABCDEF";
    std::string encoded;
    for (const char letter : text) {
        const auto code = static_cast<unsigned char>(letter);
        if (code < 128 && (std::isalnum(code) != 0 || kPlain.find(letter) != kPlain.npos)) {
            encoded += letter;
        } else {
            encoded += {'%', kHexDigits[code / 16], kHexDigits[code % 16]};
        }
    }
    return encoded;
}

// Nothing when the argument is not of the kind the placeholder asks for.
std::optional<std::string> argumentText(const TemplateArgument& argument,
                                        char placeholder,
                                        Secrets secrets) {
    if (const int* number = std::get_if<int>(&argument)) {
        if (placeholder == 'd' || placeholder == 'i') return std::to_string(*number);
        if (placeholder == 'u') return std::to_string(static_cast<unsigned>(*number));
        return std::nullopt;
    }
    if (placeholder != 's') return std::nullopt;
    if (const auto* secret = std::get_if<SecretArgument>(&argument)) {
        return secrets == Secrets::REAL ? secret->value : secret->mask;
    }
    return percentEncoded(std::get<std::string>(argument));
}

std::optional<std::string> format(const std::string& urlTemplate,
                                  std::initializer_list<TemplateArgument> arguments,
                                  Secrets secrets) {
    std::string url;
    const auto* next = arguments.begin();
    for (std::size_t at = 0; at < urlTemplate.size(); ++at) {
        if (urlTemplate[at] != '%') {
            url += urlTemplate[at];
            continue;
        }
        if (++at == urlTemplate.size()) return std::nullopt;
        if (urlTemplate[at] == '%') {
            url += '%';
            continue;
        }
        if (next == arguments.end()) return std::nullopt;
        const auto text = argumentText(*next++, urlTemplate[at], secrets);
        if (!text) return std::nullopt;
        url += *text;
    }
    // Scrubbed before the cut, which could leave part of a secret.
    if (secrets == Secrets::MASKED) url = scrubSecrets(url);
    url.resize(std::min(url.size(), kUrlBufferSize - 1));
    return url;
}

void reportBadTemplate(const std::string& key) {
    logError(
        "fillTemplate - URL template of %s asks for more or other values than it is given, no URL built.\n",
        key.c_str());
}

}  // namespace

std::string fillTemplate(const std::string& key,
                         const std::string& urlTemplate,
                         std::initializer_list<TemplateArgument> arguments) {
    auto url = format(urlTemplate, arguments, Secrets::REAL);
    if (url) return *url;
    reportBadTemplate(key);
    return {};
}

MaskedUrl fillMaskedTemplate(const std::string& key,
                             const std::string& urlTemplate,
                             std::initializer_list<TemplateArgument> arguments) {
    auto request = format(urlTemplate, arguments, Secrets::REAL);
    auto logged = format(urlTemplate, arguments, Secrets::MASKED);
    if (request && logged) return {*request, *logged};
    reportBadTemplate(key);
    return {};
}

}  // namespace pelorus
