#include "doctor/lines.h"

#include <algorithm>
#include <array>
#include <cstdint>

namespace pelorus::doctor {

namespace {

constexpr const char* kReplacement = "\xEF\xBF\xBD";
constexpr std::size_t kLeastWidth = 8;

bool isContinuation(char byte) {
    return (static_cast<unsigned char>(byte) & 0xC0U) == 0x80;
}

// Length of the well-formed sequence at the start of the text, 0 if there is none.
std::size_t sequenceLength(std::string_view text) {
    struct Form {
        unsigned mask, lead;
        std::uint32_t least;  // a smaller character has a shorter sequence
    };
    static constexpr std::array<Form, 4> kForms{
        {{0x80, 0x00, 0}, {0xE0, 0xC0, 0x80}, {0xF0, 0xE0, 0x800}, {0xF8, 0xF0, 0x10000}}};
    const auto first = static_cast<unsigned char>(text.front());
    for (std::size_t more = 0; more < kForms.size(); ++more) {
        const Form& form = kForms[more];
        if ((first & form.mask) != form.lead) continue;
        if (text.size() <= more) return 0;
        std::uint32_t character = first & ~form.mask;
        for (std::size_t index = 1; index <= more; ++index) {
            if (!isContinuation(text[index])) return 0;
            character = character << 6U | (static_cast<unsigned char>(text[index]) & 0x3FU);
        }
        const bool isControl = character < 0x20 || (character >= 0x7F && character < 0xA0);
        // Halves of UTF-16 pairs, and the two that no XML document may contain.
        const bool isNone = (character >= 0xD800 && character < 0xE000) || character > 0x10FFFF ||
                            character == 0xFFFE || character == 0xFFFF;
        return isControl || isNone || character < form.least ? 0 : more + 1;
    }
    return 0;
}

bool isBlank(char byte) {
    return static_cast<unsigned char>(byte) <= ' ';
}

// Takes the next word off the text.
std::string_view nextWord(std::string_view& text) {
    const auto* const start = std::find_if_not(text.begin(), text.end(), isBlank);
    const auto* const end = std::find_if(start, text.end(), isBlank);
    const auto length = static_cast<std::size_t>(end - start);
    const std::string_view word =
        text.substr(static_cast<std::size_t>(start - text.begin()), length);
    text.remove_prefix(static_cast<std::size_t>(end - text.begin()));
    return word;
}

// Takes at most that many characters off the word.
std::string_view takeLetters(std::string_view& word, std::size_t most) {
    std::size_t end = 0;
    for (std::size_t count = 0; end < word.size(); ++end) {
        if (!isContinuation(word[end]) && count++ == most) break;
    }
    const std::string_view taken = word.substr(0, end);
    word.remove_prefix(end);
    return taken;
}

}  // namespace

std::string printable(std::string_view text) {
    std::string clean;
    while (!text.empty()) {
        const std::size_t length = sequenceLength(text);
        if (length == 0) {
            clean += kReplacement;
        } else {
            clean += text.substr(0, length);
        }
        text.remove_prefix(std::max<std::size_t>(length, 1));
    }
    return clean;
}

std::size_t letters(std::string_view text) {
    return text.size() -
           static_cast<std::size_t>(std::count_if(text.begin(), text.end(), isContinuation));
}

std::string padded(std::string text, std::size_t width) {
    const std::size_t length = letters(text);
    if (length < width) text.append(width - length, ' ');
    return text;
}

std::vector<std::string> wrap(std::string_view text, std::size_t width) {
    width = std::max(width, kLeastWidth);
    std::vector<std::string> lines{""};
    for (std::string_view word = nextWord(text); !word.empty(); word = nextWord(text)) {
        if (!lines.back().empty()) {
            if (letters(lines.back()) + 1 + letters(word) <= width) {
                lines.back() += ' ';
            } else {
                lines.emplace_back();
            }
        }
        while (letters(word) > width) {
            lines.back() = takeLetters(word, width);
            lines.emplace_back();
        }
        lines.back() += word;
    }
    return lines;
}

std::vector<std::string> hang(const std::string& label, std::string_view text, std::size_t width) {
    const std::size_t indent = letters(label);
    std::vector<std::string> lines = wrap(text, width > indent ? width - indent : 0);
    lines.front().insert(0, label);
    for (std::size_t index = 1; index < lines.size(); ++index) {
        lines[index].insert(0, indent, ' ');
    }
    return lines;
}

}  // namespace pelorus::doctor
