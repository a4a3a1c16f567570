#include "config/setting_line.h"

#include <algorithm>

namespace pelorus {

namespace {

constexpr std::string_view kBlanks = " \t";
constexpr std::string_view kAroundValue = " \t\"";
constexpr std::string_view kBehindValue = " \t\"\n";

void trimFront(std::string_view& text, std::string_view unwanted) {
    text.remove_prefix(std::min(text.find_first_not_of(unwanted), text.size()));
}

void trimBack(std::string_view& text, std::string_view unwanted) {
    text = text.substr(0, text.find_last_not_of(unwanted) + 1);  // npos + 1 is 0
}

}  // namespace

Setting parseSettingLine(std::string_view line) {
    const std::size_t split = line.find('=', 1);
    if (split == std::string_view::npos) return {};
    Setting setting{line.substr(0, split), line.substr(split + 1)};
    trimFront(setting.key, kBlanks);
    trimFront(setting.value, kAroundValue);
    trimBack(setting.value, kBehindValue);
    return setting;
}

}  // namespace pelorus
