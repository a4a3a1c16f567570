// The values of KEY=value lines, merged file after file.
#ifndef PELORUS_CONFIG_SETTINGS_MAP_H
#define PELORUS_CONFIG_SETTINGS_MAP_H

#include <cstddef>
#include <cstdio>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <string_view>

namespace pelorus {

/// Most keys that dynamic files can fill the map to.
inline constexpr std::size_t kMostSettings = 10'000;

/// Bytes that are read as one line at most, terminator included.
inline constexpr std::size_t kSettingLineSize = 300;

/// What became of one line with a setting.
struct MergedLine {
    enum class Fate {
        TAKEN,
        RESERVED,  ///< ignored: only the static file may set the key
        FULL,      ///< ignored: a new key beyond kMostSettings
    };
    Fate fate{};
    std::size_t number{};    ///< in its file, from 1
    const std::string& key;  ///< this and the value are good for the call only
    std::string_view value{};
};

/// Merges settings by the rules that hold for a static and a dynamic file. Others can write the
/// dynamic one: it must not set what they could run commands with, nor fill the memory. The static
/// file lists the keys that it reserves in STATIC_ONLY_KEYS, separated by blanks; several such lines
/// add up. Never logs.
class SettingsMap {
public:
    enum class Source { STATIC, DYNAMIC };
    using Report = std::function<void(const MergedLine&)>;

    /// Merges the lines of an open @p file (see parseSettingLine); a later value replaces an earlier
    /// one. A line of 300 or more characters counts as several. Reports every line that holds a
    /// setting, in order.
    void merge(std::FILE* file, Source source, const Report& report);

    /// True when only the static file may set @p key.
    [[nodiscard]] bool isReserved(const std::string& key) const { return reserved.count(key) != 0; }

    /// Forgets which keys are reserved; the values stay.
    void clearReserved() { reserved.clear(); }

    std::map<std::string, std::string> values{};

private:
    void reserve(std::string_view keys);
    [[nodiscard]] MergedLine::Fate fateOf(const std::string& key, Source source) const;

    std::set<std::string> reserved{};
};

}  // namespace pelorus

#endif
