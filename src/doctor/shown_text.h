// Texts of others in what the doctor says.
#ifndef PELORUS_DOCTOR_SHOWN_TEXT_H
#define PELORUS_DOCTOR_SHOWN_TEXT_H

#include <cstddef>
#include <string>
#include <string_view>

namespace pelorus::doctor {

/// @p text with "?" in place of all but printable ASCII characters, cut to @p most characters, of
/// which the last three are dots then.
[[nodiscard]] std::string shownText(std::string_view text, std::size_t most = 80);

}  // namespace pelorus::doctor

#endif
