#include "doctor/sharing.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <optional>

#include "common/masks.h"
#include "config/scrub.h"
#include "doctor/address_class.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kLeastSecret = 3;

bool isDigit(char letter) {
    return letter >= '0' && letter <= '9';
}

bool isHexDigit(char letter) {
    return std::isxdigit(static_cast<unsigned char>(letter)) != 0;
}

bool isLetterOrDigit(char letter) {
    return std::isalnum(static_cast<unsigned char>(letter)) != 0;
}

// Of addresses and names, and of the masks within names.
bool isWordLetter(char letter) {
    return isLetterOrDigit(letter) || std::string_view{".:-_*"}.find(letter) != std::string::npos;
}

std::string lowerCase(std::string_view text) {
    std::string result{text};
    for (char& letter : result) {
        letter = static_cast<char>(std::tolower(static_cast<unsigned char>(letter)));
    }
    return result;
}

std::string trimmed(std::string text) {
    constexpr const char* kBlanks = " \t\r\n";
    text.erase(0, std::min(text.find_first_not_of(kBlanks), text.size()));
    text.erase(text.find_last_not_of(kBlanks) + 1);
    return text;
}

std::string urlEncoded(const std::string& text) {
    constexpr const char* kDigits = "0123456789ABCDEF";
    std::string result;
    for (const char letter : text) {
        const auto code = static_cast<unsigned char>(letter);
        if (isLetterOrDigit(letter) || std::string_view{"-_.~"}.find(letter) != std::string::npos) {
            result += letter;
        } else {
            result += '%';
            result += kDigits[code >> 4U];
            result += kDigits[code & 0xFU];
        }
    }
    return result;
}

bool endsWith(std::string_view text, std::string_view end) {
    return text.size() > end.size() && text.substr(text.size() - end.size()) == end;
}

// The host that SERVER_BASE_URL names.
std::string hostOf(const std::string& baseUrl) {
    const std::string host = serviceHost(baseUrl);
    return lowerCase(host.substr(0, host.find_first_of("/:")));
}

// What an IPv4 address is called; empty if it tells nothing.
std::string kindOf(const std::string& address) {
    for (const char* quiet : {"0.", "127.", "255."}) {
        if (address.rfind(quiet, 0) == 0) return "";
    }
    if (isAtHome(address)) return "private-address";
    return classOf(address) == AddressClass::SHARED ? "shared-address" : "address";
}

std::string kindOf(const in6_addr& address) {
    if (IN6_IS_ADDR_UNSPECIFIED(&address) || IN6_IS_ADDR_LOOPBACK(&address)) return "";
    const bool isPrivate = IN6_IS_ADDR_LINKLOCAL(&address) || (address.s6_addr[0] & 0xFEU) == 0xFC;
    return isPrivate ? "private-address" : "address";
}

std::optional<in6_addr> ipv6(std::string_view word) {
    in6_addr address{};
    const bool isOne = std::count(word.begin(), word.end(), ':') >= 2 &&
                       inet_pton(AF_INET6, std::string{word}.c_str(), &address) == 1;
    return isOne ? std::optional{address} : std::nullopt;
}

std::string canonical(const in6_addr& address) {
    std::array<char, INET6_ADDRSTRLEN> text{};
    static_cast<void>(inet_ntop(AF_INET6, &address, text.data(), text.size()));
    return text.data();
}

// Six pairs of hexadecimal digits, all with the same character between them.
bool isMac(std::string_view word) {
    constexpr std::size_t kLength = 17;
    if (word.size() != kLength || (word[2] != ':' && word[2] != '-')) return false;
    for (std::size_t index = 0; index < kLength; ++index) {
        if (index % 3 == 2 ? word[index] != word[2] : !isHexDigit(word[index])) return false;
    }
    return true;
}

// Length of the IPv4 address at a place of a word, 0 if there is none.
std::size_t ipv4Length(std::string_view word, std::size_t at) {
    const auto isNumber = [&](std::size_t index) {
        return index < word.size() && isDigit(word[index]);
    };
    if (!isNumber(at)) return 0;
    if (at > 0 && isLetterOrDigit(word[at - 1])) return 0;
    if (at > 1 && word[at - 1] == '.' && isDigit(word[at - 2])) return 0;
    std::size_t end = at;
    while (isNumber(end) || (end < word.size() && word[end] == '.' && isNumber(end + 1))) ++end;
    const std::string text{word.substr(at, end - at)};
    in_addr address{};
    return inet_pton(AF_INET, text.c_str(), &address) == 1 ? text.size() : 0;
}

}  // namespace

Masks::Masks(const std::map<std::string, std::string>& settings,
             bool sharing,
             const std::string& deviceName)
    : isSharing{sharing}, ownName{lowerCase(deviceName)} {
    const auto value = [&](const char* key) {
        const auto found = settings.find(key);
        return found == settings.end() ? std::string{} : trimmed(found->second);
    };
    constexpr std::array<std::pair<const char*, const char*>, 3> kSecrets{
        {{"DEVICEID", STRIPPED_DEVID_VAL},
         {"DEVICEAUTH", STRIPPED_DEVAUTH_VAL},
         {"SUBDOMAIN", STRIPPED_SUBDOMAIN_VAL}}};
    for (const auto& [key, mask] : kSecrets) {
        const std::string secret = value(key);
        if (secret.size() < kLeastSecret) continue;
        secrets.push_back({secret, mask});
        if (urlEncoded(secret) != secret) secrets.push_back({urlEncoded(secret), mask});
    }
    // One that contains another one would otherwise be masked only in part.
    std::stable_sort(secrets.begin(), secrets.end(), [](const Secret& left, const Secret& right) {
        return left.value.size() > right.value.size();
    });
    service = hostOf(value("SERVER_BASE_URL"));
    domain = domainOfNames(service);
}

std::string Masks::hide(std::string text) {
    for (const Secret& secret : secrets) hideSecret(text, secret.value, secret.mask);
    return isSharing ? hidePlaces(text) : text;
}

void Masks::hideIn(Diagnosis& diagnosis) {
    const auto mask = [this](std::string& text) { text = hide(std::move(text)); };
    mask(diagnosis.address);
    mask(diagnosis.ports);
    mask(diagnosis.daemon.options);
    if (diagnosis.before) {
        mask(diagnosis.before->address);
        mask(diagnosis.before->cause);
    }
    for (NamedCause& cause : diagnosis.causes) {
        for (Fact& fact : cause.proofs) mask(fact.text);
    }
    for (Check& check : diagnosis.checks) mask(check.text);
    for (std::string& text : diagnosis.untold) mask(text);
    for (Period& period : diagnosis.history) {
        mask(period.address);
        mask(period.cause);
    }
}

std::string Masks::hidePlaces(std::string_view text) {
    std::string result;
    while (!text.empty()) {
        const auto* const wordEnd = std::find_if_not(text.begin(), text.end(), isWordLetter);
        const auto length = static_cast<std::size_t>(wordEnd - text.begin());
        if (length == 0) {
            result += text.front();
            text.remove_prefix(1);
        } else {
            result += hideWord(text.substr(0, length));
            text.remove_prefix(length);
        }
    }
    return result;
}

std::string Masks::hideWord(std::string_view word) {
    if (word.empty()) return "";
    if (const auto address = ipv6(word)) {
        const std::string kind = kindOf(*address);
        return kind.empty() ? std::string{word} : replacement(kind, canonical(*address));
    }
    // A full stop or a colon behind it belongs to the sentence.
    if (const char last = word.back(); last == '.' || last == ':') {
        return hideWord(word.substr(0, word.size() - 1)) + last;
    }
    if (isMac(word)) {
        std::string place = lowerCase(word);
        std::replace(place.begin(), place.end(), '-', ':');
        return replacement("mac", place);
    }
    const std::string name = lowerCase(word.substr(0, word.find(':')));
    if (isHost(name)) return replacement("host", name) + std::string{word.substr(name.size())};
    return hideAddresses(word);
}

// IPv4 addresses: a port may follow, and names contain them.
std::string Masks::hideAddresses(std::string_view word) {
    std::string result;
    for (std::size_t at = 0; at < word.size();) {
        const std::size_t length = ipv4Length(word, at);
        const std::string place{word.substr(at, std::max<std::size_t>(length, 1))};
        const std::string kind = length == 0 ? "" : kindOf(place);
        result += kind.empty() ? place : replacement(kind, place);
        at += place.size();
    }
    return result;
}

bool Masks::isHost(std::string_view name) const {
    if (name.empty()) return false;
    if (name == ownName || name == service) return true;
    if (name.substr(0, name.find('.')) == ownName) return true;
    return endsWith(name, domain);
}

std::string Masks::replacement(const std::string& kind, const std::string& place) {
    std::string& known = replacements[place];
    if (known.empty()) known = kind + "-" + std::to_string(++counts[kind]);
    return known;
}

}  // namespace pelorus::doctor
