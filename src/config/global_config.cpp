#include "config/global_config.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdarg>
#include <utility>

#include "common/files.h"
#include "common/log.h"
#include "common/shell.h"
#include "config/replace_command.h"

namespace pelorus {

namespace {

constexpr std::size_t kConfigLogSize = 1024;  // bytes of one log line of this store
constexpr mode_t kCopyMode = 0666;            // other programs on the device rewrite the copy

const std::string kTmpPathKey = "DYNAMIC_CONFIG_TMP";

__attribute__((format(printf, 1, 2))) void logConfigError(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kConfigLogSize, LOG_ERR, format, args);
    va_end(args);
}

__attribute__((format(printf, 1, 2))) void logConfigInfo(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kConfigLogSize, LOG_INFO, format, args);
    va_end(args);
}

bool namesACopy(const std::string& path) {
    return !path.empty() && path != "empty";
}

// False when the copy is incomplete.
bool copyFile(std::FILE* from, std::FILE* to) {
    std::array<char, kSettingLineSize> piece{};
    while (std::fgets(piece.data(), piece.size(), from) != nullptr) {
        if (std::fputs(piece.data(), to) == EOF) return false;
    }
    return std::fflush(to) == 0;
}

// Makes the first temporary copy. False, with the cause logged, when it cannot be made.
bool createTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath) {
    logConfigInfo("Opening dynamic config file for copy.\n");
    const FileHandle dynamicFile = openForeignFile(dynamicPath, Part::HEAD, Link::OWN);
    if (!dynamicFile) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: %s\n",
            dynamicPath.c_str());
        return false;
    }
    logConfigInfo("Creating temp copy of dynamic config file.\n");
    const FileHandle copy = createFile(copyPath, kCopyMode);
    if (!copy) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to create temporary dynamic config file: %s\n",
            copyPath.c_str());
        return false;
    }
    logConfigInfo("Copying dynamic config file.\n");
    if (!copyFile(dynamicFile.get(), copy.get())) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to write temporary dynamic config file: %s\n",
            copyPath.c_str());
        // An incomplete copy would be read as the whole file from now on.
        static_cast<void>(unlink(copyPath.c_str()));
        return false;
    }
    return true;
}

}  // namespace

GlobalConfig* GlobalConfig::getInstance() {
    static GlobalConfig instance;
    return &instance;
}

bool GlobalConfig::loadConfig(const std::string& path) {
    configPath = path;
    if (!loadStaticConfig()) return false;
    logConfigInfo("Getting path for dynamic config file.\n");
    const std::string dynamicPath = getProperty("DYNAMIC_CONFIG") + "/dynamicconfig.ini";
    logConfigInfo("Getting path for TEMP dynamic config file.\n");
    const std::string copyPath = getProperty(kTmpPathKey);
    return namesACopy(copyPath) ? loadTemporaryCopy(dynamicPath, copyPath)
                                : loadDynamicConfig(dynamicPath);
}

bool GlobalConfig::loadStaticConfig() {
    const FileHandle file = openFile(configPath, "re");
    if (!file) {
        logConfigError("GlobalConfig::loadConfig() - failed to open config file: [%s].\n",
                       configPath.c_str());
        return false;
    }
    properties.clearReserved();
    reportedKeys.clear();
    isFullReported = false;
    const bool parsed = merge(file.get(), SettingsMap::Source::STATIC);
    if (properties.values.empty()) {
        // Says "open", but means a file without a single setting.
        logConfigError("GlobalConfig::loadConfigSettings() - failed to open config file: [%s].\n",
                       configPath.c_str());
        return false;
    }
    return parsed;
}

bool GlobalConfig::loadDynamicConfig(const std::string& path) {
    logConfigInfo("OPENING dynamic config file for read: \n");
    logConfigInfo("%s", path.c_str());
    const FileHandle file = openForeignFile(path, Part::HEAD, Link::OWN);
    if (!file) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: [%s].\n",
            path.c_str());
        return false;
    }
    logConfigInfo("LOADING dynamic config file settings.\n");
    return merge(file.get(), SettingsMap::Source::DYNAMIC);
}

bool GlobalConfig::loadTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath) {
    logConfigInfo("Loading TEMP dynamic config file.\n");
    FileHandle copy = openForeignFile(copyPath);
    if (!copy) {
        if (!createTemporaryCopy(dynamicPath, copyPath)) return false;
        logConfigInfo("Re-opening TEMP dynamic config file.\n");
        copy = openForeignFile(copyPath);
    }
    if (!copy) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open temp dynamic config settings file: [%s].\n",
            copyPath.c_str());
        return false;
    }
    const bool parsed = merge(copy.get(), SettingsMap::Source::DYNAMIC);
    copy.reset();
    struct stat status {};
    if (stat(copyPath.c_str(), &status) == 0) tmpModTime = status.st_mtime;
    return parsed;
}

bool GlobalConfig::loadConfigSettings(std::FILE* file) {
    return merge(file, SettingsMap::Source::STATIC);
}

bool GlobalConfig::merge(std::FILE* file, SettingsMap::Source source) {
    properties.merge(file, source, [this](const MergedLine& line) {
        if (line.fate != MergedLine::Fate::TAKEN) reportIgnored(line);
    });
    return true;
}

void GlobalConfig::reportIgnored(const MergedLine& line) {
    if (line.fate == MergedLine::Fate::RESERVED) {
        if (reportedKeys.insert(line.key).second) {
            logConfigError(
                "GlobalConfig::merge() - only the static config file may set %s, ignored.\n",
                line.key.c_str());
        }
    } else if (!std::exchange(isFullReported, true)) {
        logConfigError("GlobalConfig::merge() - %zu settings are the most, further ones ignored.\n",
                       kMostSettings);
    }
}

const std::string& GlobalConfig::getProperty(const std::string& key) {
    static const std::string absent;
    if (properties.values.empty()) loadConfig(configPath);
    if (key != kTmpPathKey) reloadChangedCopy();
    const auto found = properties.values.find(key);
    return found == properties.values.end() ? absent : found->second;
}

std::string GlobalConfig::knownProperty(const std::string& key) const {
    const auto found = properties.values.find(key);
    return found == properties.values.end() ? std::string{} : found->second;
}

void GlobalConfig::reloadChangedCopy() {
    const auto found = properties.values.find(kTmpPathKey);
    if (found == properties.values.end() || !namesACopy(found->second)) return;
    const std::string& path = found->second;
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) {
        logConfigError(
            "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [%s].\n",
            path.c_str());
        return;
    }
    if (status.st_mtime == tmpModTime) return;
    // Stored even when the copy cannot be opened: only its next change starts another attempt.
    tmpModTime = status.st_mtime;
    const FileHandle copy = openForeignFile(path);
    if (!copy) return;
    logConfigInfo("Reload dynamicconfig.ini file.\n");
    merge(copy.get(), SettingsMap::Source::DYNAMIC);
}

std::string& GlobalConfig::setProperty(const std::string& key,
                                       const std::string& value,
                                       bool writeThrough) {
    if (properties.values.empty()) loadConfig(configPath);
    if (writeThrough) writeToStaticFile(key, knownProperty(key), value);
    return properties.values[key] = value;
}

void GlobalConfig::writeToStaticFile(const std::string& key,
                                     const std::string& oldValue,
                                     const std::string& value) const {
    const bool isNew = oldValue.empty();
    const std::string text =
        isNew ? key + "=" + value + "\n" : replaceCommand(key, oldValue, value, configPath);
    // A truncated line or command would damage the file, and so would a second line.
    if (text.size() >= kSettingLineSize || (key + value).find('\n') != std::string::npos) {
        logConfigError(
            "GlobalConfig::setProperty() - setting cannot be written to config file: %s\n",
            configPath.c_str());
        return;
    }
    if (!isNew) {
        if (runShell(text) != 0) {
            logConfigError("GlobalConfig::setProperty() - failed to update config file: %s\n",
                           configPath.c_str());
        }
        return;
    }
    const FileHandle file = openFile(configPath, "ae");
    if (!file) {
        logConfigError("GlobalConfig::setProperty() - failed to open config file: %s\n",
                       configPath.c_str());
        return;
    }
    if (std::fputs(text.c_str(), file.get()) == EOF || std::fflush(file.get()) != 0) {
        logConfigError("GlobalConfig::setProperty() - failed to update config file: %s\n",
                       configPath.c_str());
    }
}

void GlobalConfig::deleteProperty(const std::string& key) {
    if (properties.values.empty()) loadConfig(configPath);
    properties.values.erase(key);
}

bool GlobalConfig::refresh() {
    return loadConfig(configPath);
}

std::string setting(const std::string& key) {
    return GlobalConfig::getInstance()->getProperty(key);
}

}  // namespace pelorus
