#include "doctor/secret_masks.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <set>
#include <string_view>

#include "common/masks.h"
#include "config/scrub.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kLeastSecret = 3;
constexpr std::size_t kLeastOfCut = 4;
constexpr std::string_view kCut = "...";

bool isLetterOrDigit(char letter) {
    return std::isalnum(static_cast<unsigned char>(letter)) != 0;
}

bool sameLetter(unsigned char left, unsigned char right) {
    return std::tolower(left) == std::tolower(right);
}

std::size_t findAnyCase(std::string_view text, std::string_view part, std::size_t from) {
    if (from > text.size()) return text.npos;
    const auto* const found =
        std::search(text.begin() + from, text.end(), part.begin(), part.end(), sameLetter);
    return found == text.end() ? text.npos : static_cast<std::size_t>(found - text.begin());
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

// The beginning of a secret where a text was cut off.
void hideCut(std::string& text, const std::string& secret, const char* mask) {
    for (std::size_t dots = text.rfind(kCut); dots != text.npos && dots > 0;
         dots = text.rfind(kCut, dots - 1)) {
        for (std::size_t size = std::min(secret.size() - 1, dots); size >= kLeastOfCut; --size) {
            const std::string_view last = std::string_view{text}.substr(dots - size, size);
            if (!std::equal(last.begin(), last.end(), secret.begin(), sameLetter)) continue;
            text.replace(dots - size, size, mask);
            break;
        }
    }
}

// What stands in front of a secret, and the characters that end it.
struct Marker {
    std::string_view before;
    const char* mask;
    const char* ends;
};

constexpr const char* kValueEnds = " &<>\"'[](),;";
constexpr const char* kPathEnds = " /?&<>\"'[](),;";
constexpr std::array<Marker, 13> kMarkers{{
    {"auth=", STRIPPED_DEVAUTH_VAL, kValueEnds},
    {"auth>", STRIPPED_DEVAUTH_VAL, kValueEnds},
    {"device_id=", STRIPPED_DEVID_VAL, kValueEnds},
    {"device_id>", STRIPPED_DEVID_VAL, kValueEnds},
    {"deviceid=", STRIPPED_DEVID_VAL, kValueEnds},
    {"deviceid>", STRIPPED_DEVID_VAL, kValueEnds},
    {"device id '", STRIPPED_DEVID_VAL, "'"},
    {"of this unit '", STRIPPED_DEVID_VAL, "'"},
    {"/port_test/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/port_forward/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/comm_status/", STRIPPED_DEVID_VAL, kPathEnds},
    {"subdomain=", STRIPPED_SUBDOMAIN_VAL, kValueEnds},
    {"subdomain>", STRIPPED_SUBDOMAIN_VAL, kValueEnds},
}};

void hideMarked(std::string& text, const Marker& marker) {
    for (std::size_t at = findAnyCase(text, marker.before, 0); at != text.npos;
         at = findAnyCase(text, marker.before, at)) {
        at += marker.before.size();
        const std::size_t end = std::min(text.find_first_of(marker.ends, at), text.size());
        if (end > at && text[at] != '*') text.replace(at, end - at, marker.mask);
    }
}

// Public names have the label "device", with the id behind it, behind the name of the device.
void hideInNames(std::string& text) {
    constexpr std::string_view kLabel = "device";
    for (std::size_t at = findAnyCase(text, kLabel, 1); at != text.npos;
         at = findAnyCase(text, kLabel, at)) {
        const char before = text[at - 1];
        at += kLabel.size();
        std::size_t end = at;
        while (end < text.size() && isLetterOrDigit(text[end])) ++end;
        const bool isName = end > at && (before == '.' || before == '-') && end + 1 < text.size() &&
                            text[end] == '.' && isLetterOrDigit(text[end + 1]);
        if (isName) text.replace(at, end - at, STRIPPED_DEVID_VAL);
    }
}

}  // namespace

SecretMasks::SecretMasks(const std::map<std::string, std::string>& settings) {
    constexpr std::array<std::pair<const char*, const char*>, 3> kSecrets{
        {{"DEVICEID", STRIPPED_DEVID_VAL},
         {"DEVICEAUTH", STRIPPED_DEVAUTH_VAL},
         {"SUBDOMAIN", STRIPPED_SUBDOMAIN_VAL}}};
    for (const auto& [key, mask] : kSecrets) {
        const auto found = settings.find(key);
        const std::string value = found == settings.end() ? "" : trimmed(found->second);
        if (value.size() < kLeastSecret) continue;
        for (const std::string& form :
             std::set<std::string>{value, urlEncoded(value), shownText(value, value.size())}) {
            secrets.push_back({form, mask});
        }
    }
    // One that contains another one would otherwise be masked only in part.
    std::stable_sort(secrets.begin(), secrets.end(), [](const Secret& left, const Secret& right) {
        return left.value.size() > right.value.size();
    });
}

std::string SecretMasks::hide(std::string text) const {
    for (const Secret& secret : secrets) hideSecret(text, secret.value, secret.mask);
    for (const Secret& secret : secrets) hideCut(text, secret.value, secret.mask);
    for (const Marker& marker : kMarkers) hideMarked(text, marker);
    hideInNames(text);
    return text;
}

}  // namespace pelorus::doctor
