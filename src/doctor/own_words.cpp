#include "doctor/own_words.h"

#include <algorithm>
#include <cctype>
#include <set>
#include <string>

#include "doctor/causes.h"
#include "doctor/quotations.h"
#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

// What facts have beside the words of the causes.
constexpr std::string_view kOfFacts =
    "about accepted active ago already also announced announces answered before connect connected "
    "connecting control data date did differs direct directly disabled dynamic empty error "
    "expired external failure folder forwarding gave gone handshake hard holds host idle ignored "
    "input interface key known last leads least level lifetime line lines link list listens "
    "logged main mappings maps message more need now number options packet part passed pid "
    "problem process program reach reaches recognised relayed request resolved response result "
    "root route runs seconds see seen sees several severity signal since skipped sleep space "
    "standby started state static successful syslog table temporary test than timed timeout told "
    "unknown unless unused update user value verified via waiting where while whole writes "
    "yesterday zero";

bool isLetter(char letter) {
    return std::isalpha(static_cast<unsigned char>(letter)) != 0;
}

void addWords(std::string_view text, std::set<std::string>& words) {
    constexpr std::size_t kLeast = 3;
    std::string word;
    for (std::size_t at = 0; at <= text.size(); ++at) {
        if (at < text.size() && isLetter(text[at])) {
            word += static_cast<char>(std::tolower(static_cast<unsigned char>(text[at])));
            continue;
        }
        if (word.size() >= kLeast) words.insert(word);
        word.clear();
    }
}

const std::set<std::string>& ownWords() {
    static const std::set<std::string> words = [] {
        std::set<std::string> result;
        addWords(kOfFacts, result);
        for (const Cause& cause : allCauses()) {
            for (const std::string_view text : {cause.name, cause.sentence, cause.remedy}) {
                addWords(text, result);
            }
        }
        return result;
    }();
    return words;
}

bool isQuoted(std::string_view text, std::size_t at) {
    if (endsWith(text, kNotOurs) && at + kNotOurs.size() > text.size()) return false;
    return std::any_of(kQuotations.begin(), kQuotations.end(), [&](std::string_view beginning) {
        const std::size_t found = text.find(beginning);
        return found != text.npos && found + beginning.size() <= at;
    });
}

// Behind the word there is only punctuation up to the next blank.
bool goesOnAsSentence(std::string_view rest) {
    if (startsWith(rest, "'s")) rest.remove_prefix(2);
    const std::size_t end = rest.find_first_not_of(",;:.)");
    return end == rest.npos || rest[end] == ' ';
}

}  // namespace

bool isOwnWord(std::string_view text, std::size_t at, std::size_t length) {
    if (isQuoted(text, at)) return false;
    std::size_t begin = at, end = at;
    while (begin > 0 && isLetter(text[begin - 1])) --begin;
    while (end < text.size() && isLetter(text[end])) ++end;
    if (end < at + length) return false;
    const bool beginsInSentence = begin == 0 || text[begin - 1] == ' ' || text[begin - 1] == '(';
    if (!beginsInSentence || !goesOnAsSentence(text.substr(end))) return false;
    std::string word{text.substr(begin, end - begin)};
    std::transform(word.begin(), word.end(), word.begin(),
                   [](unsigned char letter) { return static_cast<char>(std::tolower(letter)); });
    return ownWords().count(word) != 0;
}

}  // namespace pelorus::doctor
