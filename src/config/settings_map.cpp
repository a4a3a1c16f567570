#include "config/settings_map.h"

#include <array>
#include <sstream>

#include "config/setting_line.h"

namespace pelorus {

namespace {

const std::string kStaticOnlyKey = "STATIC_ONLY_KEYS";

}  // namespace

void SettingsMap::merge(std::FILE* file, Source source, const Report& report) {
    std::array<char, kSettingLineSize> piece{};
    std::string key;  // outside the loop to keep its memory: the map copies new keys only
    std::size_t number = 1;
    while (std::fgets(piece.data(), piece.size(), file) != nullptr) {
        const std::string_view text{piece.data()};
        const std::size_t line = number;
        if (!text.empty() && text.back() == '\n') ++number;
        const Setting setting = parseSettingLine(text);
        if (setting.key.empty()) continue;
        key = setting.key;
        const MergedLine::Fate fate = fateOf(key, source);
        if (fate == MergedLine::Fate::TAKEN) {
            if (source == Source::STATIC && key == kStaticOnlyKey) reserve(setting.value);
            const auto [position, isNew] = values.try_emplace(key, setting.value);
            if (!isNew) position->second = setting.value;
        }
        report({fate, line, key, setting.value});
    }
}

MergedLine::Fate SettingsMap::fateOf(const std::string& key, Source source) const {
    if (source == Source::STATIC) return MergedLine::Fate::TAKEN;
    if (isReserved(key)) return MergedLine::Fate::RESERVED;
    const bool fits = values.size() < kMostSettings || values.count(key) != 0;
    return fits ? MergedLine::Fate::TAKEN : MergedLine::Fate::FULL;
}

void SettingsMap::reserve(std::string_view keys) {
    std::istringstream words{std::string{keys}};
    for (std::string key; words >> key;) reserved.insert(key);
}

}  // namespace pelorus
