#include "doctor/secret_masks.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cstring>
#include <set>
#include <string_view>
#include <system_error>
#include <utility>

#include "common/masks.h"
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

// A character as it may be written in a text, and the length of that.
struct Written {
    unsigned char letter;
    std::size_t length;
};

using Ways = std::vector<Written>;

void addNumber(std::string_view digits, int base, std::size_t length, Ways& ways) {
    unsigned code = 0;
    const auto [end, error] =
        std::from_chars(digits.data(), digits.data() + digits.size(), code, base);
    const bool isWhole = error == std::errc{} && end == digits.data() + digits.size();
    if (isWhole && code <= 0xFF) ways.push_back({static_cast<unsigned char>(code), length});
}

// Also encoded twice, where % has become %25.
void addPercent(std::string_view text, Ways& ways) {
    for (std::size_t at = 1; at + 2 <= text.size(); at += 2) {
        addNumber(text.substr(at, 2), 16, at + 2, ways);
        if (text.substr(at, 2) != "25") return;
    }
}

void addEntity(std::string_view text, Ways& ways) {
    constexpr std::array<std::pair<std::string_view, unsigned char>, 5> kNames{
        {{"&amp;", '&'}, {"&lt;", '<'}, {"&gt;", '>'}, {"&quot;", '"'}, {"&apos;", '\''}}};
    for (const auto& [name, letter] : kNames) {
        if (text.substr(0, name.size()) == name) ways.push_back({letter, name.size()});
    }
    const std::size_t end = text.find(';');
    if (end == text.npos || end < 3 || text[1] != '#') return;
    const bool isHex = text[2] == 'x' || text[2] == 'X';
    addNumber(text.substr(isHex ? 3 : 2, end - (isHex ? 3 : 2)), isHex ? 16 : 10, end + 1, ways);
}

void addEscape(std::string_view text, Ways& ways) {
    constexpr std::size_t kCodeLength = 6;
    if (text.size() < 2) return;
    if (text[1] != 'u') {
        ways.push_back({static_cast<unsigned char>(text[1]), 2});
    } else if (text.size() >= kCodeLength) {
        addNumber(text.substr(2, 4), 16, kCodeLength, ways);
    }
}

// What the beginning of a text may stand for: itself, or what URLs, XML and JSON make of it.
Ways waysToRead(std::string_view text) {
    Ways ways{{static_cast<unsigned char>(text.front()), 1}};
    if (text.front() == '+') ways.push_back({' ', 1});
    if (text.front() == '%') addPercent(text, ways);
    if (text.front() == '&') addEntity(text, ways);
    if (text.front() == '\\') addEscape(text, ways);
    return ways;
}

bool isWrittenAs(char letter, unsigned char written) {
    const std::string_view one{&letter, 1};
    return sameLetter(static_cast<unsigned char>(letter), written) ||
           (written == '?' && shownText(one) != one);
}

// Where a secret that begins at a place of a text may go on, letter by letter.
class Match {
public:
    Match(std::string_view wholeText, std::size_t at) : text{wholeText}, ends{at} {}

    // False when the text does not go on with it.
    bool take(char letter) {
        std::set<std::size_t> next;
        for (const std::size_t end : ends) {
            if (end >= text.size()) continue;
            for (const Written& way : waysToRead(text.substr(end))) {
                if (isWrittenAs(letter, way.letter)) next.insert(end + way.length);
            }
        }
        if (next.empty()) return false;
        ends = std::move(next);
        return true;
    }

    [[nodiscard]] std::size_t end() const { return *ends.rbegin(); }

    // At the end of the text, or in the middle of an encoded character there.
    [[nodiscard]] bool isAtEnd() const {
        constexpr std::size_t kLongest = 6;
        const std::string_view rest = text.substr(end());
        return rest.empty() ||
               (rest.size() < kLongest && std::string_view{"%&\\"}.find(rest.front()) != rest.npos);
    }

private:
    std::string_view text;
    std::set<std::size_t> ends;
};

// Length of the secret at a place of a text, 0 if it is not there.
std::size_t secretLength(std::string_view text, std::size_t at, const std::string& secret) {
    Match match{text, at};
    const bool isThere =
        std::all_of(secret.begin(), secret.end(), [&](char letter) { return match.take(letter); });
    return isThere ? match.end() - at : 0;
}

bool isCutSecret(std::string_view text, std::size_t at, const std::string& secret) {
    Match match{text, at};
    std::size_t taken = 0;
    while (taken < secret.size() && match.take(secret[taken])) ++taken;
    return taken >= kLeastOfCut && match.isAtEnd();
}

// The beginning of a secret where a text was cut off.
void hideCut(std::string& text, const std::string& secret, const char* mask) {
    for (std::size_t dots = text.rfind(kCut); dots != text.npos && dots > 0;
         dots = text.rfind(kCut, dots - 1)) {
        const std::string_view left = std::string_view{text}.substr(0, dots);
        std::size_t at = 0;
        while (at < dots && !isCutSecret(left, at, secret)) ++at;
        if (at < dots) text.replace(at, dots - at, mask);
        dots = std::min(at + 1, dots);
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
constexpr std::array<Marker, 5> kMarkers{{
    {"device id '", STRIPPED_DEVID_VAL, "'"},
    {"of this unit '", STRIPPED_DEVID_VAL, "'"},
    {"/port_test/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/port_forward/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/comm_status/", STRIPPED_DEVID_VAL, kPathEnds},
}};

constexpr std::array<std::pair<std::string_view, const char*>, 6> kKeys{{
    {"auth", STRIPPED_DEVAUTH_VAL},
    {"device_id", STRIPPED_DEVID_VAL},
    {"deviceid", STRIPPED_DEVID_VAL},
    {"<id", STRIPPED_DEVID_VAL},
    {"\"id", STRIPPED_DEVID_VAL},
    {"subdomain", STRIPPED_SUBDOMAIN_VAL},
}};

void hideUpTo(std::string& text, std::size_t at, const char* ends, const char* mask) {
    const std::size_t end = std::min(text.find_first_of(ends, at), text.size());
    if (end > at && text[at] != '*') text.replace(at, end - at, mask);
}

void hideMarked(std::string& text, const Marker& marker) {
    for (std::size_t at = findAnyCase(text, marker.before, 0); at != text.npos;
         at = findAnyCase(text, marker.before, at)) {
        at += marker.before.size();
        hideUpTo(text, at, marker.ends, marker.mask);
    }
}

// Where the value of a key begins that ends at a place: behind =, : or >, also encoded, with quotes
// and blanks around it. Without one, the end of the text.
std::size_t valueBehind(std::string_view text, std::size_t at) {
    constexpr const char* kAround = " \t\"'\\";
    const auto skip = [&](std::size_t from) {
        return std::min(text.find_first_not_of(kAround, from), text.size());
    };
    at = skip(at);
    for (const std::string_view separator : {"=", ":", ">", "%3d", "%3a"}) {
        if (findAnyCase(text.substr(at, separator.size()), separator, 0) == 0) {
            return skip(at + separator.size());
        }
    }
    return text.size();
}

void hideKeyed(std::string& text, std::string_view key, const char* mask) {
    for (std::size_t at = findAnyCase(text, key, 0); at != text.npos;
         at = findAnyCase(text, key, at)) {
        // The tunnel's client begins its messages so.
        const bool isMessage = text.compare(at, 6, "AUTH: ") == 0;
        at += key.size();
        if (isMessage) continue;
        hideUpTo(text, valueBehind(text, at), kValueEnds, mask);
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
        secrets.push_back({value, mask});
    }
    // One that contains another one would otherwise be masked only in part.
    std::stable_sort(secrets.begin(), secrets.end(), [](const Secret& left, const Secret& right) {
        return left.value.size() > right.value.size();
    });
}

std::string SecretMasks::hide(std::string text, const Exception& isKept) const {
    for (const Secret& secret : secrets) {
        for (std::size_t at = 0; at < text.size();) {
            const std::size_t length = secretLength(text, at, secret.value);
            const bool isHidden = length > 0 && !(isKept && isKept(text, at, length));
            if (isHidden) text.replace(at, length, secret.mask);
            at += isHidden ? std::strlen(secret.mask) : 1;
        }
    }
    for (const Secret& secret : secrets) hideCut(text, secret.value, secret.mask);
    for (const Marker& marker : kMarkers) hideMarked(text, marker);
    for (const auto& [key, mask] : kKeys) hideKeyed(text, key, mask);
    hideInNames(text);
    return text;
}

}  // namespace pelorus::doctor
