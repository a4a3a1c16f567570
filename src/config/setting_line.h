// The KEY=value lines of the configuration files.
#ifndef PELORUS_CONFIG_SETTING_LINE_H
#define PELORUS_CONFIG_SETTING_LINE_H

#include <string_view>

namespace pelorus {

/// One setting. Both parts point into the line they were read from.
struct Setting {
    std::string_view key;  ///< empty when the line holds no setting
    std::string_view value;
};

/// Splits one line at its first "=" that is not its first character. The key keeps blanks in front
/// of the "="; the value loses blanks and double quotes at both ends, and the line feed. There are
/// no comments.
[[nodiscard]] Setting parseSettingLine(std::string_view line);

}  // namespace pelorus

#endif
