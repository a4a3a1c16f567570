#include "doctor/findings.h"

#include <algorithm>
#include <charconv>
#include <optional>

namespace pelorus::doctor {

namespace {

constexpr Sign kFirstSign = Sign::NO_INTERFACE_UP;
constexpr Sign kLastSign = Sign::PORT_TEST_FAILS;
constexpr std::size_t kMostRecords = 200;

// The kinds of lines: KIND SUBJECT TEXT, and the end.
constexpr char kSign = 'S';
constexpr char kCheck = 'C';
constexpr char kValue = 'V';
constexpr std::string_view kEnd = "END";

bool isPlain(char letter) {
    return letter >= ' ' && letter <= '~';
}

bool isWord(std::string_view text) {
    const auto isLetter = [](char letter) {
        return (letter >= 'a' && letter <= 'z') || (letter >= 'A' && letter <= 'Z');
    };
    return !text.empty() && std::all_of(text.begin(), text.end(), isLetter);
}

std::optional<int> numberIn(std::string_view text, int least, int most) {
    int number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc{} || end != text.data() + text.size()) return std::nullopt;
    if (number < least || number > most) return std::nullopt;
    return number;
}

}  // namespace

std::string plainText(std::string_view text, std::size_t most) {
    std::string plain;
    for (const char letter : text.substr(0, most)) {
        if (isPlain(letter)) plain += letter;
    }
    return plain;
}

void Findings::add(Sign sign, const std::string& text) {
    seen.push_back({sign, plainText(text)});
    pass(kSign, std::to_string(static_cast<int>(sign)), seen.back().text);
}

void Findings::check(Check::Verdict verdict, const std::string& text) {
    lines.push_back({verdict, Source::NOW, plainText(text)});
    pass(kCheck, std::to_string(static_cast<int>(verdict)), lines.back().text);
}

void Findings::set(const std::string& name, const std::string& value) {
    values[name] = plainText(value);
    pass(kValue, name, values[name]);
}

void Findings::finish() {
    complete = true;
    if (send) send(std::string{kEnd} + "\n");
}

void Findings::pass(char kind, const std::string& subject, const std::string& text) const {
    if (send) send(std::string{kind} + " " + subject + " " + text + "\n");
}

bool Findings::read(std::string_view text) {
    for (std::size_t end = text.find('\n'); end != text.npos; end = text.find('\n')) {
        if (!readLine(text.substr(0, end))) return false;
        text.remove_prefix(end + 1);
    }
    return !complete || text.empty();
}

bool Findings::readLine(std::string_view line) {
    const bool tooMany = seen.size() + lines.size() + values.size() >= kMostRecords;
    if (complete || tooMany || !std::all_of(line.begin(), line.end(), isPlain)) return false;
    if (line == kEnd) {
        complete = true;
        return true;
    }
    const std::size_t blank = line.find(' ', 2);
    if (line.size() < 2 || line[1] != ' ' || blank == line.npos) return false;
    const std::string_view subject = line.substr(2, blank - 2);
    const std::string text = plainText(line.substr(blank + 1));
    if (line[0] == kSign) {
        const auto sign =
            numberIn(subject, static_cast<int>(kFirstSign), static_cast<int>(kLastSign));
        if (sign) seen.push_back({static_cast<Sign>(*sign), text});
        return sign.has_value();
    }
    if (line[0] == kCheck) {
        const auto verdict = numberIn(subject, 0, static_cast<int>(Check::Verdict::NOT_SEEN));
        if (verdict) lines.push_back({static_cast<Check::Verdict>(*verdict), Source::NOW, text});
        return verdict.has_value();
    }
    if (line[0] != kValue || !isWord(subject)) return false;
    values[std::string{subject}] = text;
    return true;
}

bool Findings::has(Sign sign) const {
    return std::any_of(seen.begin(), seen.end(),
                       [sign](const Seen& entry) { return entry.sign == sign; });
}

std::string Findings::value(const std::string& name) const {
    const auto found = values.find(name);
    return found == values.end() ? std::string{} : found->second;
}

}  // namespace pelorus::doctor
