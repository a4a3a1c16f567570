// Lines of text: how long they are, and where they are broken.
#ifndef PELORUS_DOCTOR_LINES_H
#define PELORUS_DOCTOR_LINES_H

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace pelorus::doctor {

/// @p text with U+FFFD in place of whatever is not UTF-8 or not printable.
[[nodiscard]] std::string printable(std::string_view text);

/// The number of characters of @p text.
[[nodiscard]] std::size_t letters(std::string_view text);

/// @p text, followed by blanks up to @p width characters.
[[nodiscard]] std::string padded(std::string text, std::size_t width);

/// @p text in lines of at most @p width characters, broken at white space; a longer word is broken
/// where the line ends. At least one line, which may be empty.
[[nodiscard]] std::vector<std::string> wrap(std::string_view text, std::size_t width);

/// @p text behind @p label: wrapped at @p width characters, and indented by the length of the label.
[[nodiscard]] std::vector<std::string> hang(const std::string& label,
                                            std::string_view text,
                                            std::size_t width);

}  // namespace pelorus::doctor

#endif
