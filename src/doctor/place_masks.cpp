#include "doctor/place_masks.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <optional>

#include "common/text.h"
#include "doctor/address_class.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::string_view kCut = "...";

bool isDigit(char letter) {
    return letter >= '0' && letter <= '9';
}

bool isLetter(char letter) {
    return std::isalpha(static_cast<unsigned char>(letter)) != 0;
}

bool isLetterOrDigit(char letter) {
    return isLetter(letter) || isDigit(letter);
}

bool isOneOf(char letter, std::string_view letters) {
    return letters.find(letter) != letters.npos;
}

// Of addresses and names, and of the masks within names.
bool isWordLetter(char letter) {
    return isLetterOrDigit(letter) || isOneOf(letter, ".:-_*");
}

std::string lowerCase(std::string_view text) {
    std::string result{text};
    for (char& letter : result) {
        letter = static_cast<char>(std::tolower(static_cast<unsigned char>(letter)));
    }
    return result;
}

bool startsWith(std::string_view text, std::string_view beginning) {
    return text.substr(0, beginning.size()) == beginning;
}

bool endsWith(std::string_view text, std::string_view end) {
    return text.size() >= end.size() && text.substr(text.size() - end.size()) == end;
}

// What an IPv4 address is called; empty if it tells nothing.
std::string kindOf(const std::string& address) {
    for (const char* quiet : {"0.", "127.", "255."}) {
        if (startsWith(address, quiet)) return "";
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
    if (word.size() != kLength || !isOneOf(word[2], ":-")) return false;
    for (std::size_t index = 0; index < kLength; ++index) {
        const bool isHex = std::isxdigit(static_cast<unsigned char>(word[index])) != 0;
        if (index % 3 == 2 ? word[index] != word[2] : !isHex) return false;
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

// With nothing but a number between its name and an ending that no domain has: "syslog.1.gz".
bool isFileName(std::string_view word) {
    constexpr std::array<std::string_view, 11> kEndings{"conf", "cfg",  "crt", "gz",  "ini", "log",
                                                        "out",  "ovpn", "pem", "pid", "txt"};
    const std::string_view ending = word.substr(word.rfind('.') + 1);
    const std::string_view middle =
        word.substr(word.find('.'), word.size() - ending.size() - word.find('.'));
    return std::find(kEndings.begin(), kEndings.end(), ending) != kEndings.end() &&
           std::none_of(middle.begin(), middle.end(), isLetter);
}

// Labels with dots between them, the last one of letters: "nas.kavra.example", "*.example".
bool looksLikeName(std::string_view word) {
    const std::size_t dot = word.rfind('.');
    if (dot == word.npos || dot == 0 || word.size() - dot < 3) return false;
    if (word.find("..") != word.npos || word.find(':') != word.npos) return false;
    const std::string_view last = word.substr(dot + 1);
    const bool isDomain =
        startsWith(last, "xn--") || std::all_of(last.begin(), last.end(), isLetter);
    return isDomain && !isFileName(word);
}

// Where a name stands whatever it looks like.
struct Place {
    std::string_view before, behind;  // behind it; empty: the end of the word
    const char* kind;
    std::string_view in{};  // the text has this part somewhere
};

constexpr std::array<Place, 15> kPlaces{{{"connect to ", " port ", "host"},
                                         {"in connection to ", ":", "host"},
                                         {"resolve host: ", "", "host"},
                                         {"resolve host address: ", "", "host"},
                                         {"resolve: ", " (", "host"},
                                         {"resolve proxy: ", "", "host"},
                                         {"host name '", "'", "host"},
                                         {"hostname '", "'", "host"},
                                         {"host '", "'", "host"},
                                         {"subject name '", "'", "host"},
                                         {"subject name (", ")", "host"},
                                         {"CN=", "", "host"},
                                         {"/home/", "", "user"},
                                         {"/Users/", "", "user"},
                                         {" (", ")", "name", "gateway maps port "}}};

// What is named at a place of a text: its length, 0 if nothing is.
std::size_t namedLength(const Place& place, std::string_view text, std::size_t at) {
    if (!endsWith(text.substr(0, at), place.before)) return 0;
    if (text.find(place.in) == text.npos) return 0;
    text.remove_prefix(at);
    const auto* const end = std::find_if_not(text.begin(), text.end(), [](char letter) {
        return isWordLetter(letter) && letter != ':';
    });
    const auto length = static_cast<std::size_t>(end - text.begin());
    if (place.behind.empty()) return length;
    // Quoted names may hold anything.
    const std::size_t behind = text.find(place.behind);
    const bool isQuoted = place.behind.size() == 1 && place.behind != ":";
    if (behind != text.npos && (isQuoted || behind == length)) return behind;
    return endsWith(text, kCut) && (isQuoted || length == text.size()) ? text.size() : 0;
}

}  // namespace

PlaceMasks::PlaceMasks(const std::vector<std::string>& hosts, std::vector<std::string> logs)
    : logPaths{std::move(logs)} {
    for (const std::string& host : hosts) {
        const std::string name = lowerCase(host);
        known.insert(name);
        known.insert(name.substr(0, name.find('.')));
    }
    for (const char* quiet : {"", "localhost"}) known.erase(quiet);
}

std::string PlaceMasks::hide(std::string text) {
    for (const std::string& path : logPaths) {
        const std::string name = path.substr(path.rfind('/') + 1);
        if (name != path) replaceAll(text, shownText(path, 100), name);
    }
    std::string result;
    for (std::size_t at = 0; at < text.size();) {
        const std::string_view rest = std::string_view{text}.substr(at);
        std::size_t length = 0;
        for (const Place& place : kPlaces) {
            length = namedLength(place, text, at);
            if (length == 0) continue;
            result += hideNamed(place.kind, rest.substr(0, length));
            break;
        }
        if (length == 0) {
            const auto* const end = std::find_if_not(rest.begin(), rest.end(), isWordLetter);
            length = static_cast<std::size_t>(end - rest.begin());
            result += length == 0 ? std::string{rest.front()} : hideWord(rest.substr(0, length));
        }
        at += std::max<std::size_t>(length, 1);
    }
    return result;
}

// An address there is still an address.
std::string PlaceMasks::hideNamed(const std::string& kind, std::string_view name) {
    if (endsWith(name, kCut)) return hideNamed(kind, name.substr(0, name.size() - 3)) + "...";
    if (endsWith(name, ".")) return hideNamed(kind, name.substr(0, name.size() - 1)) + ".";
    std::string hidden = hideWord(name);
    const bool isWord = name.find(' ') == name.npos;
    if (name.empty() || (isWord && hidden != name)) return hidden;
    const bool isQuiet = name == "localhost" || ipv4Length(name, 0) == name.size();
    return isQuiet ? hidden : replacement(kind, lowerCase(name));
}

std::string PlaceMasks::hideWord(std::string_view word) {
    if (word.empty()) return "";
    if (const auto address = ipv6(word)) {
        const std::string kind = kindOf(*address);
        return kind.empty() ? std::string{word} : replacement(kind, canonical(*address));
    }
    if (endsWith(word, kCut)) {
        const std::string_view left = word.substr(0, word.size() - kCut.size());
        // What is left of an address or a name would be told.
        return std::any_of(left.begin(), left.end(),
                           [](char letter) { return isOneOf(letter, ".:"); })
                   ? std::string{kCut}
                   : hideWord(left).append(kCut);
    }
    // A full stop or a colon around it belongs to the sentence.
    if (isOneOf(word.back(), ".:")) {
        return hideWord(word.substr(0, word.size() - 1)) + word.back();
    }
    if (isOneOf(word.front(), ".-")) return word.front() + hideWord(word.substr(1));
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
std::string PlaceMasks::hideAddresses(std::string_view word) {
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

bool PlaceMasks::isHost(const std::string& name) const {
    return known.count(name) != 0 || looksLikeName(name);
}

std::string PlaceMasks::replacement(const std::string& kind, const std::string& place) {
    std::string& mask = replacements[place];
    if (mask.empty()) mask = kind + "-" + std::to_string(++counts[kind]);
    return mask;
}

}  // namespace pelorus::doctor
