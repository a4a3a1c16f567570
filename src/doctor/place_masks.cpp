#include "doctor/place_masks.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <functional>
#include <optional>
#include <sstream>

#include "common/text.h"
#include "doctor/address_class.h"
#include "doctor/own_words.h"
#include "doctor/quotations.h"
#include "doctor/shown_text.h"
#include "doctor/text_parts.h"

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

bool isHex(char letter) {
    return std::isxdigit(static_cast<unsigned char>(letter)) != 0;
}

// Length of the MAC address that a text begins with, 0 if there is none: six pairs of hexadecimal
// digits, with the same character between them, or with none and a letter among them.
std::size_t macLength(std::string_view text) {
    constexpr std::size_t kPairs = 6;
    const bool isJoined = text.size() < 3 || !isOneOf(text[2], ":-");
    const std::size_t step = isJoined ? 2 : 3, length = kPairs * step - (isJoined ? 0 : 1);
    if (text.size() < length || (text.size() > length && isLetterOrDigit(text[length]))) return 0;
    bool hasLetter = false;
    for (std::size_t index = 0; index < length; ++index) {
        const char letter = text[index];
        if (index % step == 2 ? letter != text[2] : !isHex(letter)) return 0;
        hasLetter |= isLetter(letter);
    }
    return isJoined && !hasLetter ? 0 : length;
}

// A character as URLs encode it: "%2F" is no part of the word behind it.
bool isEncoded(std::string_view text) {
    return text.size() >= 3 && text.front() == '%' && isHex(text[1]) && isHex(text[2]);
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
    constexpr std::array<std::string_view, 12> kEndings{"bz2", "conf", "cfg",  "crt", "gz",  "ini",
                                                        "log", "out",  "ovpn", "pem", "pid", "txt"};
    const std::string_view ending = word.substr(word.rfind('.') + 1);
    const std::string_view middle =
        word.substr(word.find('.'), word.size() - ending.size() - word.find('.'));
    return std::find(kEndings.begin(), kEndings.end(), ending) != kEndings.end() &&
           std::none_of(middle.begin(), middle.end(), isLetter);
}

// Labels with dots between them, the last one with a letter in front: "nas.kavra.example", "*.nas2".
bool looksLikeName(std::string_view word) {
    const std::size_t dot = word.rfind('.');
    if (dot == word.npos || dot == 0 || word.size() - dot < 3) return false;
    if (word.find("..") != word.npos || word.find(':') != word.npos) return false;
    const std::string_view last = word.substr(dot + 1);
    const bool isLabel =
        isLetter(last.front()) && std::all_of(last.begin(), last.end(), [](char letter) {
            return isLetterOrDigit(letter) || letter == '-';
        });
    return isLabel && !isFileName(word);
}

// How the end of a name is found.
enum class Ends {
    WITH_WORD,
    BEFORE,   // the text behind it, which follows the word
    AT,       // the text behind it, whatever the name holds
    AS_USER,  // the @ of a URL
    IN_PATH,  // what ends a part of a path
    AS_ITEM,  // of a list: a part of a certificate's subject, a client or what others call it
};

// Where a name stands whatever it looks like.
struct Place {
    std::string_view before, behind;
    const char* kind;
    Ends ends = Ends::WITH_WORD;
    std::string_view in{};  // the text has this part somewhere
};

constexpr std::array<Place, 31> kPlaces{{
    {"connect to ", " port ", "host", Ends::BEFORE},
    {"connect to ", ":", "host", Ends::BEFORE},
    {" via ", ":", "host", Ends::BEFORE},
    {" via ", " after ", "host", Ends::BEFORE},
    {"CONNECT to ", "", "host"},
    {"proxy tunnel to ", "", "host"},
    {"in connection to ", ":", "host", Ends::BEFORE},
    {"resolve host: ", "", "host"},
    {"resolve host address: ", "", "host"},
    {"resolve: ", " (", "host", Ends::BEFORE},
    {"resolve proxy: ", "", "host"},
    {"name '", "'", "host", Ends::AT},
    {"host '", "'", "host", Ends::AT},
    {"subject name (", ")", "host", Ends::AT},
    {"[", "] Inactivity timeout", "host", Ends::BEFORE},
    {"[", "] Peer Connection Initiated", "host", Ends::BEFORE},
    {"CN=", "", "host", Ends::AS_ITEM},
    {"O=", "", "name", Ends::AS_ITEM},
    {"OU=", "", "name", Ends::AS_ITEM},
    {" L=", "", "name", Ends::AS_ITEM},
    {", must be ", "", "host", Ends::AS_ITEM, "X509NAME ERROR: "},
    {"://", "@", "user", Ends::AS_USER},
    {"://", "", "host"},
    {"@", "", "host"},
    {"/home/", "", "user", Ends::IN_PATH},
    {"/homes/", "", "user", Ends::IN_PATH},
    {"/Users/", "", "user", Ends::IN_PATH},
    {"\\Users\\", "", "user", Ends::IN_PATH},
    {" leads to ", "", "host", Ends::AS_ITEM, kPortWanted},
    {" to ", "", "host", Ends::AS_ITEM, kTable},
    {" (", ")", "name", Ends::AS_ITEM, kTable},
}};

// What stands in a list of the gateway's entries: one is "80 to CLIENT (NAME)".
std::size_t itemLength(const Place& place, std::string_view text) {
    if (place.behind.empty()) {
        std::size_t end = text.size();
        for (const std::string_view next : {" (", ", ", "; "}) end = std::min(end, text.find(next));
        return end;
    }
    for (std::size_t end = text.find(')'); end != text.npos; end = text.find(')', end + 1)) {
        const std::string_view rest = text.substr(end + 1);
        const bool isNext = startsWith(rest, ", ") && rest.size() > 2 && isDigit(rest[2]);
        if (rest.empty() || isNext || rest == kNotOurs || startsWith(rest, "; ")) return end;
    }
    return text.size();
}

std::size_t userLength(std::string_view text) {
    const std::size_t end = text.find_first_of("@/?# \"'<>");
    return end != text.npos && text[end] == '@' ? end : 0;
}

// What is named at a place of a text: its length, 0 if nothing is.
std::size_t namedLength(const Place& place, std::string_view text, std::size_t at) {
    if (!endsWith(text.substr(0, at), place.before)) return 0;
    if (text.find(place.in) == text.npos) return 0;
    text.remove_prefix(at);
    if (place.ends == Ends::AS_ITEM) return itemLength(place, text);
    if (place.ends == Ends::AS_USER) return userLength(text);
    if (place.ends == Ends::IN_PATH)
        return std::min(text.find_first_of(" /\\\"'<>:;,)"), text.size());
    const auto* const end = std::find_if_not(text.begin(), text.end(), [](char letter) {
        return isWordLetter(letter) && letter != ':';
    });
    const auto length = static_cast<std::size_t>(end - text.begin());
    if (place.ends == Ends::WITH_WORD) return length;
    const bool isQuoted = place.ends == Ends::AT;
    const std::string_view rest = text.substr(length);
    // Behind the colon there is a port, or it is the sentence's.
    const bool isPort = place.behind != ":" || (rest.size() > 1 && isDigit(rest[1]));
    if (isQuoted && text.find(place.behind) != text.npos) return text.find(place.behind);
    if (!isQuoted && startsWith(rest, place.behind) && isPort) return length;
    return endsWith(text, kCut) && (isQuoted || rest.empty()) ? text.size() : 0;
}

// Length of the IPv6 address at a place of a word, 0 if there is none. A port may follow.
std::size_t ipv6Length(std::string_view word, std::size_t at) {
    const std::string_view rest = word.substr(at);
    const std::size_t end = rest.find_first_not_of("0123456789abcdefABCDEF.:");
    std::size_t length = std::min({end, rest.size(), std::size_t{INET6_ADDRSTRLEN}});
    for (; length > 1; --length) {
        const bool isWhole = length == rest.size() || !isLetterOrDigit(rest[length]);
        if (isWhole && ipv6(rest.substr(0, length))) return length;
    }
    return 0;
}

// Too little for a mask, but the beginning of an address.
bool isBeginning(std::string_view text) {
    return text.size() <= 4 && std::all_of(text.begin(), text.end(), isHex) &&
           std::any_of(text.begin(), text.end(), isDigit);
}

}  // namespace

PlaceMasks::PlaceMasks(const std::vector<std::string>& hosts, std::vector<std::string> logs)
    : logPaths{std::move(logs)} {
    for (const std::string& host : hosts) learn(lowerCase(host));
    known.erase("localhost");
}

// What no word has stands between names; an address is found without being known.
void PlaceMasks::learn(const std::string& host) {
    if (ipv4Length(host, 0) != host.size()) known.insert(host);
    std::string names = host;
    std::replace_if(names.begin(), names.end(), std::not_fn(isWordLetter), ' ');
    std::istringstream stream{names};
    for (std::string name; stream >> name;) {
        for (const std::string& part : {name, name.substr(0, name.find('.'))}) {
            if (part.size() > 2 && std::any_of(part.begin(), part.end(), isLetter))
                known.insert(part);
        }
    }
}

std::string PlaceMasks::hide(std::string text) {
    for (const std::string& path : logPaths) {
        replaceAll(text, shownText(path, 100), shownText(path.substr(path.rfind('/') + 1), 100));
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
            const bool isHidden = length > 0 && !isOwnWord(text, at, 1);
            if (length == 0) length = isEncoded(rest) ? 3 : 1;
            result += isHidden ? hideWordAt(text, at, length) : std::string{rest.substr(0, length)};
        }
        at += length;
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

// What stands around a word tells what it is.
std::string PlaceMasks::hideWordAt(std::string_view text, std::size_t at, std::size_t length) {
    const std::string_view word = text.substr(at, length);
    if (startsWith(text.substr(at + length), "@")) return replacement("user", lowerCase(word));
    // The tunnel's client puts the port behind it, also behind a short form.
    const std::size_t port = word.rfind(':');
    if (endsWith(text.substr(0, at), "[AF_INET6]") && port != word.npos &&
        ipv6(word.substr(0, port))) {
        return hideWord(word.substr(0, port)) + std::string{word.substr(port)};
    }
    return hideWord(word);
}

std::string PlaceMasks::hideWord(std::string_view word) {
    if (word.empty()) return "";
    if (ipv6(word)) return hideParts(word);
    if (endsWith(word, kCut)) return hideCut(word.substr(0, word.size() - kCut.size()));
    // A full stop or a colon around it belongs to the sentence.
    if (isOneOf(word.back(), ".:")) {
        return hideWord(word.substr(0, word.size() - 1)) + word.back();
    }
    if (isOneOf(word.front(), ".-")) return word.front() + hideWord(word.substr(1));
    const std::string name = lowerCase(word.substr(0, word.find(':')));
    const bool isHost = known.count(name) != 0 || looksLikeName(name);
    return isHost ? replacement("host", name) + hideParts(word.substr(name.size()))
                  : hideParts(word);
}

// What is left of an address or a name would be told.
std::string PlaceMasks::hideCut(std::string_view left) {
    constexpr std::size_t kLeastOfHost = 3;
    if (left.find_first_of(".:") != left.npos || isBeginning(left)) return std::string{kCut};
    const std::string name = lowerCase(left);
    const auto host = known.lower_bound(name);
    const bool isPart =
        name.size() >= kLeastOfHost && host != known.end() && startsWith(*host, name);
    return (isPart ? replacement("host", *host) : hideWord(left)).append(kCut);
}

// Addresses and known names: others contain them, and a port may follow.
std::string PlaceMasks::hideParts(std::string_view word) {
    std::string result;
    for (std::size_t at = 0; at < word.size();) {
        const Part part = partAt(word, at);
        const std::size_t length = std::max<std::size_t>(part.length, 1);
        const bool isShown = part.length == 0 || part.kind.empty();
        result +=
            isShown ? std::string{word.substr(at, length)} : replacement(part.kind, part.place);
        at += length;
    }
    return result;
}

PlaceMasks::Part PlaceMasks::partAt(std::string_view word, std::size_t at) const {
    if (at > 0 && isLetterOrDigit(word[at - 1])) return {};
    const std::string_view rest = word.substr(at);
    if (const std::size_t length = ipv6Length(word, at); length > 0) {
        const auto address = ipv6(rest.substr(0, length));
        return {length, kindOf(*address), canonical(*address)};
    }
    if (const std::size_t length = macLength(rest); length > 0) {
        std::string digits = lowerCase(rest.substr(0, length));
        digits.erase(std::remove_if(digits.begin(), digits.end(), std::not_fn(isHex)),
                     digits.end());
        return {length, "mac", digits};
    }
    if (const std::size_t length = ipv4Length(word, at); length > 0) {
        const std::string place{rest.substr(0, length)};
        return {length, kindOf(place), place};
    }
    Part longest;
    for (const std::string& host : known) {
        const bool isHere = startsWith(lowerCase(rest.substr(0, host.size())), host) &&
                            (rest.size() == host.size() || !isLetterOrDigit(rest[host.size()]));
        if (isHere && host.size() > longest.length) longest = {host.size(), "host", host};
    }
    return longest;
}

bool PlaceMasks::hidesAround(std::string_view text, std::size_t at, std::size_t length) const {
    const std::string_view part = text.substr(at, length);
    if (!std::all_of(part.begin(), part.end(), isWordLetter)) return false;
    std::size_t begin = at, end = at + length;
    while (begin > 0 && isWordLetter(text[begin - 1])) --begin;
    while (end < text.size() && isWordLetter(text[end])) ++end;
    if (end - begin == length) return false;
    PlaceMasks trial = *this;
    const std::string hidden = lowerCase(trial.hideWord(text.substr(begin, end - begin)));
    return hidden.find(lowerCase(part)) == hidden.npos;
}

std::string PlaceMasks::replacement(const std::string& kind, const std::string& place) {
    std::string& mask = replacements[place];
    if (mask.empty()) mask = kind + "-" + std::to_string(++counts[kind]);
    return mask;
}

}  // namespace pelorus::doctor
