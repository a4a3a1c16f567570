// The settings: KEY=value lines of a static and a dynamic file, merged into one map.
#ifndef PELORUS_CONFIG_GLOBAL_CONFIG_H
#define PELORUS_CONFIG_GLOBAL_CONFIG_H

#include <cstdio>
#include <ctime>
#include <map>
#include <string>

namespace pelorus {

/// Process-wide store of settings.
///
/// The dynamic file belongs to other programs of the device. It is read through a temporary copy
/// (key DYNAMIC_CONFIG_TMP) that those programs rewrite too; a copy with a new modification time
/// is merged again at the next lookup, so long-lived callers see changes without asking for them.
class GlobalConfig {
public:
    static GlobalConfig* getInstance();
    GlobalConfig(const GlobalConfig&) = delete;
    GlobalConfig& operator=(const GlobalConfig&) = delete;

    /// Loads the static file @p path and then the dynamic file it names. False when either cannot
    /// be read; the cause is logged and what was merged until then stays.
    bool loadConfig(const std::string& path);

    /// Merges the lines of an open @p file, later keys over earlier ones. A key keeps blanks in
    /// front of the "=", a value loses blanks and double quotes at both ends; lines without "=" are
    /// ignored and lines of 300 and more characters count as several. Always true. The caller
    /// closes the file.
    bool loadConfigSettings(std::FILE* file);

    /// The value of @p key, or an empty text when it is absent. Costs one stat of the temporary
    /// copy. The reference stays valid until the key is deleted, but its text may change with the
    /// next call: copy what must last.
    const std::string& getProperty(const std::string& key);

    /// The value of @p key as last read, without a look at the files: for what must not log or
    /// reload, such as the scrubbing of a log line.
    [[nodiscard]] std::string knownProperty(const std::string& key) const;

    /// Sets @p key in memory and, with @p writeThrough, in the static file as well (never in the
    /// dynamic one). A failed write is logged and does not keep the value from being set in
    /// memory. Returns the stored value.
    std::string& setProperty(const std::string& key, const std::string& value, bool writeThrough);

    /// Forgets @p key in memory; the files are not touched, so a reload brings it back.
    void deleteProperty(const std::string& key);

    /// Loads both files again; result as loadConfig.
    bool refresh();

private:
    GlobalConfig() = default;
    ~GlobalConfig() = default;

    bool loadDynamicConfig(const std::string& path);
    bool loadTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath);
    void reloadChangedCopy();
    void writeToStaticFile(const std::string& key,
                           const std::string& oldValue,
                           const std::string& value) const;

    time_t tmpModTime = 0;
    std::string configPath;
    std::map<std::string, std::string> properties;
};

/// A copy of the value of @p key, for callers that keep it; empty when it is absent.
[[nodiscard]] std::string setting(const std::string& key);

}  // namespace pelorus

#endif
