// The settings: KEY=value lines of a static and a dynamic file, merged into one map.
#ifndef PELORUS_CONFIG_GLOBAL_CONFIG_H
#define PELORUS_CONFIG_GLOBAL_CONFIG_H

#include <cstdio>
#include <ctime>
#include <set>
#include <string>

#include "config/settings_map.h"

namespace pelorus {

/// Process-wide store of settings.
///
/// The dynamic file belongs to other programs on the device. It is read through a temporary copy
/// (key DYNAMIC_CONFIG_TMP), which those programs rewrite as well. A lookup that finds a new
/// modification time merges the copy again, so callers see changes without reloading.
///
/// The copy may be writable by everybody. Keys that the static file lists in STATIC_ONLY_KEYS
/// (separated by blanks; several such lines add up) are ignored anywhere else; the first time, a
/// log line names the key. Of a dynamic file at most kMostForeignBytes are read, and the store
/// takes no new key beyond 10,000; a log line says so.
class GlobalConfig {
public:
    static GlobalConfig* getInstance();
    GlobalConfig(const GlobalConfig&) = delete;
    GlobalConfig& operator=(const GlobalConfig&) = delete;

    /// Loads the static file @p path and then the dynamic file it names. False when either cannot
    /// be read; the cause is logged and whatever was merged by then stays.
    bool loadConfig(const std::string& path);

    /// Merges the lines of an open @p file (see parseSettingLine); a later value replaces an
    /// earlier one. A line of 300 or more characters counts as several. Always true. The caller
    /// closes the file.
    bool loadConfigSettings(std::FILE* file);

    /// The value of @p key, or an empty string when it is absent. Costs one stat of the temporary
    /// copy. The reference stays valid until the key is deleted, but its text may change with the
    /// next call: copy what you keep.
    const std::string& getProperty(const std::string& key);

    /// The value of @p key as last read. Never reloads and never logs, so it is safe while a log
    /// line is being put together.
    [[nodiscard]] std::string knownProperty(const std::string& key) const;

    /// Sets @p key in memory and, with @p writeThrough, in the static file as well (never in the
    /// dynamic one). When the write fails, that is logged and the value is set in memory only.
    /// Returns the stored value.
    std::string& setProperty(const std::string& key, const std::string& value, bool writeThrough);

    /// Removes @p key from memory. The files are not touched, so a reload brings it back.
    void deleteProperty(const std::string& key);

    /// Loads both files again; same result as loadConfig.
    bool refresh();

private:
    GlobalConfig() = default;
    ~GlobalConfig() = default;

    bool merge(std::FILE* file, SettingsMap::Source source);
    void reportIgnored(const MergedLine& line);
    bool loadStaticConfig();
    bool loadDynamicConfig(const std::string& path);
    bool loadTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath);
    void reloadChangedCopy();
    void writeToStaticFile(const std::string& key,
                           const std::string& oldValue,
                           const std::string& value) const;

    time_t tmpModTime = 0;
    std::string configPath;
    SettingsMap properties;
    std::set<std::string> reportedKeys;  // set elsewhere although they are reserved
    bool isFullReported = false;
};

/// A copy of the value of @p key, for callers that keep it; empty when the key is absent.
[[nodiscard]] std::string setting(const std::string& key);

}  // namespace pelorus

#endif
