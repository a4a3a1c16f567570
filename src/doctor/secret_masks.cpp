#include "doctor/secret_masks.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <set>
#include <string_view>
#include <utility>

#include "common/masks.h"
#include "doctor/own_words.h"
#include "doctor/readings.h"
#include "doctor/shown_text.h"
#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kLeastSecret = 3;
constexpr std::size_t kMostSecrets = 1000;
constexpr std::size_t kLeastOfCut = 4;
constexpr std::string_view kCut = "...";

bool isLetterOrDigit(char letter) {
    return std::isalnum(static_cast<unsigned char>(letter)) != 0;
}

bool isSameLetter(char left, char right) {
    return std::tolower(static_cast<unsigned char>(left)) ==
           std::tolower(static_cast<unsigned char>(right));
}

std::size_t findAnyCase(std::string_view text, std::string_view part, std::size_t from) {
    if (from > text.size()) return text.npos;
    const auto* const found =
        std::search(text.begin() + from, text.end(), part.begin(), part.end(), isSameLetter);
    return found == text.end() ? text.npos : static_cast<std::size_t>(found - text.begin());
}

std::string trimmed(std::string text) {
    constexpr const char* kBlanks = " \t\r\n";
    text.erase(0, std::min(text.find_first_not_of(kBlanks), text.size()));
    text.erase(text.find_last_not_of(kBlanks) + 1);
    return text;
}

// URLs write + for a blank, and what is shown has ? for what cannot be printed.
bool isWrittenAs(char letter, char written) {
    const std::string_view one{&letter, 1};
    return isSameLetter(letter, written) || (written == '+' && letter == ' ') ||
           (written == '?' && shownText(one) != one);
}

bool isSecretAt(std::string_view text, std::size_t at, std::string_view secret) {
    return at + secret.size() <= text.size() &&
           std::equal(secret.begin(), secret.end(), text.begin() + at, isWrittenAs);
}

// A part of a text, and what replaces it.
struct Span {
    std::size_t begin, end;
    const char* mask;
};

// What stands in front of a secret, and the characters that end it.
struct Marker {
    std::string_view before;
    const char* mask;
    const char* ends;
};

constexpr const char* kPathEnds = " /?&<>\"'[](),;";
constexpr std::array<Marker, 5> kMarkers{{
    {"device id '", STRIPPED_DEVID_VAL, "'"},
    {"of this unit '", STRIPPED_DEVID_VAL, "'"},
    {"/port_test/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/port_forward/", STRIPPED_DEVID_VAL, kPathEnds},
    {"/comm_status/", STRIPPED_DEVID_VAL, kPathEnds},
}};

// The last letters of a key, whatever joins its words, and the characters that end its value.
constexpr const char* kValueEnds = " &<>\"'[](),;";
constexpr const char* kHeaderEnds = "&<>\"'[](),;";
constexpr std::array<Marker, 8> kKeys{{
    {"auth", STRIPPED_DEVAUTH_VAL, kValueEnds},
    {"authorization", STRIPPED_DEVAUTH_VAL, kHeaderEnds},
    {"authorisation", STRIPPED_DEVAUTH_VAL, kHeaderEnds},
    {"deviceid", STRIPPED_DEVID_VAL, kValueEnds},
    {"devid", STRIPPED_DEVID_VAL, kValueEnds},
    {"<id", STRIPPED_DEVID_VAL, kValueEnds},
    {"\"id", STRIPPED_DEVID_VAL, kValueEnds},
    {"subdomain", STRIPPED_SUBDOMAIN_VAL, kValueEnds},
}};

// Where the key at the end of a text begins; npos if it ends otherwise.
std::size_t keyStart(std::string_view text, std::string_view key) {
    std::size_t left = key.size();
    for (std::size_t at = text.size(); at > 0; --at) {
        const char letter = text[at - 1];
        if (isSameLetter(letter, key[left - 1])) {
            if (--left == 0) return at - 1;
        } else if (left == key.size() || std::string_view{" -_"}.find(letter) == text.npos) {
            return text.npos;
        }
    }
    return text.npos;
}

// A colon behind the name of a file is the sentence's.
bool isInPath(std::string_view text, std::size_t at) {
    const auto isOfName = [](char letter) {
        return isLetterOrDigit(letter) ||
               std::string_view{"-_."}.find(letter) != std::string_view::npos;
    };
    while (at > 0 && isOfName(text[at - 1])) --at;
    return at > 0 && text[at - 1] == '/';
}

// The places of what one reading of a text shows.
class Finder {
public:
    Finder(const Reading& subject, std::vector<Span>& found)
        : reading{subject}, text{subject.text}, spans{found} {}

    void findSecret(std::string_view secret, const char* mask) {
        for (std::size_t at = 0; at < text.size(); ++at) {
            if (isSecretAt(text, at, secret)) add(at, at + secret.size(), mask);
        }
    }

    // The beginning of a secret where the text was cut off, perhaps within an encoded character.
    void findCut(std::string_view secret, const char* mask) {
        constexpr std::size_t kLongestCode = 6;
        for (std::size_t dots = text.find(kCut); dots != text.npos;
             dots = text.find(kCut, dots + 1)) {
            const std::size_t code = text.substr(0, dots).find_last_of("%&\\");
            const bool isCode = code != text.npos && dots - code < kLongestCode;
            for (const std::size_t end : {dots, isCode ? code : dots}) {
                std::size_t length = std::min(secret.size(), end);
                while (length >= kLeastOfCut &&
                       !isSecretAt(text.substr(0, end), end - length, secret.substr(0, length))) {
                    --length;
                }
                if (length >= kLeastOfCut) add(end - length, dots, mask);
            }
        }
    }

    void findMarked(const Marker& marker) {
        for (std::size_t at = findAnyCase(text, marker.before, 0); at != text.npos;
             at = findAnyCase(text, marker.before, at)) {
            at += marker.before.size();
            addUpTo(marker.ends, at, marker.mask);
        }
    }

    // Behind a key and =, : or >, with quotes and blanks around it.
    void findKeyed() {
        constexpr const char* kAround = " \t\"'\\";
        for (std::size_t at = text.find_first_of("=:>"); at != text.npos;
             at = text.find_first_of("=:>", at + 1)) {
            const auto before = text.substr(0, text.substr(0, at).find_last_not_of(kAround) + 1);
            const bool isColon = text[at] == ':' && before.size() == at;
            for (const Marker& key : kKeys) {
                const std::size_t start = keyStart(before, key.before);
                if (start == text.npos || (isColon && isInPath(text, start))) continue;
                // The tunnel's client begins its messages so.
                if (startsWith(text.substr(start), "AUTH: ")) continue;
                addUpTo(key.ends, text.find_first_not_of(kAround, at + 1), key.mask);
            }
        }
    }

    // Public names have the label "device", with the id behind it, behind the name of the device.
    void findInNames() {
        constexpr std::string_view kLabel = "device";
        for (std::size_t at = findAnyCase(text, kLabel, 1); at != text.npos;
             at = findAnyCase(text, kLabel, at)) {
            const char before = text[at - 1];
            at += kLabel.size();
            std::size_t end = at;
            while (end < text.size() && isLetterOrDigit(text[end])) ++end;
            const bool isName = end > at && (before == '.' || before == '-') &&
                                end + 1 < text.size() && text[end] == '.' &&
                                isLetterOrDigit(text[end + 1]);
            if (isName) add(at, end, STRIPPED_DEVID_VAL);
        }
    }

private:
    void add(std::size_t begin, std::size_t end, const char* mask) {
        spans.push_back({reading.places[begin], reading.places[end], mask});
    }

    // Unless it is a mask already.
    void addUpTo(const char* ends, std::size_t at, const char* mask) {
        if (at >= text.size() || text[at] == '*') return;
        const std::size_t end = std::min(text.find_first_of(ends, at), text.size());
        if (end > at) add(at, end, mask);
    }

    const Reading& reading;
    std::string_view text;
    std::vector<Span>& spans;
};

// What overlaps becomes one, with the mask of the longest.
std::string replaced(const std::string& text, std::vector<Span> spans) {
    std::stable_sort(spans.begin(), spans.end(),
                     [](const Span& left, const Span& right) { return left.begin < right.begin; });
    std::string result;
    std::size_t at = 0;
    for (auto span = spans.begin(); span != spans.end();) {
        Span longest = *span;
        const std::size_t begin = span->begin;
        std::size_t end = begin;
        do {
            end = std::max(end, span->end);
            if (span->end - span->begin > longest.end - longest.begin) longest = *span;
            ++span;
        } while (span != spans.end() && span->begin < end);
        result.append(text, at, begin - at).append(longest.mask);
        at = end;
    }
    return result.append(text, at);
}

}  // namespace

SecretMasks::SecretMasks(const std::multimap<std::string, std::string>& settings) {
    constexpr std::array<std::pair<const char*, const char*>, 3> kSecrets{
        {{"DEVICEID", STRIPPED_DEVID_VAL},
         {"DEVICEAUTH", STRIPPED_DEVAUTH_VAL},
         {"SUBDOMAIN", STRIPPED_SUBDOMAIN_VAL}}};
    for (const auto& [key, mask] : kSecrets) {
        const auto [begin, end] = settings.equal_range(key);
        std::set<std::string> values;
        for (auto given = begin; given != end && values.size() < kMostSecrets; ++given) {
            const std::string value = trimmed(given->second);
            if (value.size() >= kLeastSecret && values.insert(value).second) {
                secrets.push_back({value, mask});
            }
        }
    }
}

std::string SecretMasks::hide(std::string text, const Exception& isKept) const {
    std::vector<Span> spans;
    for (const Reading& reading : readingsOf(text)) {
        Finder finder{reading, spans};
        for (const Secret& secret : secrets) finder.findSecret(secret.value, secret.mask);
    }
    const auto isLeft = [&](const Span& span) {
        const std::size_t length = span.end - span.begin;
        return isOwnWord(text, span.begin, length) || (isKept && isKept(text, span.begin, length));
    };
    spans.erase(std::remove_if(spans.begin(), spans.end(), isLeft), spans.end());
    for (const Reading& reading : readingsOf(text)) {
        Finder finder{reading, spans};
        for (const Secret& secret : secrets) finder.findCut(secret.value, secret.mask);
        for (const Marker& marker : kMarkers) finder.findMarked(marker);
        finder.findKeyed();
        finder.findInNames();
    }
    return replaced(text, std::move(spans));
}

}  // namespace pelorus::doctor
