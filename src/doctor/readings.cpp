#include "doctor/readings.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <numeric>
#include <string_view>
#include <system_error>
#include <utility>

#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kMostReadings = 32;

// What the code at the beginning of a text stands for; without a length there is none.
struct Decoded {
    std::string text;
    std::size_t length = 0;
};

std::string inUtf8(unsigned code) {
    constexpr unsigned kOneByte = 0x80, kTwoBytes = 0x800;
    const auto byte = [](unsigned value) { return static_cast<char>(value); };
    const char last = byte(0x80U | (code & 0x3FU));
    if (code < kOneByte) return {byte(code)};
    if (code < kTwoBytes) return {byte(0xC0U | (code >> 6U)), last};
    return {byte(0xE0U | (code >> 12U)), byte(0x80U | ((code >> 6U) & 0x3FU)), last};
}

Decoded number(std::string_view digits, int base, std::size_t length, bool isByte) {
    constexpr unsigned kLast = 0xFFFF;
    unsigned code = 0;
    const char* const end = digits.data() + digits.size();
    const auto [stop, error] = std::from_chars(digits.data(), end, code, base);
    if (error != std::errc{} || stop != end || code > kLast) return {};
    return {isByte ? std::string{static_cast<char>(code)} : inUtf8(code), length};
}

Decoded percent(std::string_view text) {
    return text.size() < 3 ? Decoded{} : number(text.substr(1, 2), 16, 3, true);
}

Decoded entity(std::string_view text) {
    constexpr std::array<std::pair<std::string_view, const char*>, 6> kNames{{{"&amp;", "&"},
                                                                              {"&lt;", "<"},
                                                                              {"&gt;", ">"},
                                                                              {"&quot;", "\""},
                                                                              {"&apos;", "'"},
                                                                              {"&nbsp;", " "}}};
    for (const auto& [name, letter] : kNames) {
        if (startsWith(text, name)) return {letter, name.size()};
    }
    const std::size_t end = text.find(';');
    if (end == text.npos || end < 3 || text[1] != '#') return {};
    const std::size_t digits = text[2] == 'x' || text[2] == 'X' ? 3 : 2;
    return number(text.substr(digits, end - digits), digits == 3 ? 16 : 10, end + 1, false);
}

Decoded escape(std::string_view text) {
    if (text.size() < 2) return {};
    const bool isUnicode = text[1] == 'u';
    if (!isUnicode && text[1] != 'x') return {std::string{text[1]}, 2};
    const std::size_t length = isUnicode ? 6 : 4;
    return text.size() < length ? Decoded{}
                                : number(text.substr(2, length - 2), 16, length, !isUnicode);
}

struct Code {
    char begin;
    Decoded (*decode)(std::string_view text);
};

constexpr std::array<Code, 3> kCodes{{{'%', percent}, {'&', entity}, {'\\', escape}}};

Reading read(const Reading& before, const Code& code) {
    Reading result;
    const std::string_view text = before.text;
    for (std::size_t at = 0; at < text.size();) {
        Decoded part;
        if (text[at] == code.begin) part = code.decode(text.substr(at));
        if (part.length == 0) part = {std::string{text[at]}, 1};
        result.text += part.text;
        result.places.resize(result.text.size(), before.places[at]);
        at += part.length;
    }
    result.places.push_back(before.places.back());
    return result;
}

}  // namespace

std::vector<Reading> readingsOf(const std::string& text) {
    std::vector<Reading> all{{text, std::vector<std::size_t>(text.size() + 1)}};
    std::iota(all.front().places.begin(), all.front().places.end(), 0);
    for (std::size_t index = 0; index < all.size(); ++index) {
        for (const Code& code : kCodes) {
            if (all.size() == kMostReadings) return all;
            Reading next = read(all[index], code);
            const auto isSame = [&](const Reading& other) { return other.text == next.text; };
            if (std::none_of(all.begin(), all.end(), isSame)) all.push_back(std::move(next));
        }
    }
    return all;
}

}  // namespace pelorus::doctor
