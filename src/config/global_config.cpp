#include "config/global_config.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "common/handles.h"
#include "common/log.h"

namespace pelorus {

namespace {

constexpr std::size_t kLineSize = 300;        // bytes of one fgets, terminator included
constexpr std::size_t kConfigLogSize = 1024;  // bytes of one log line of this store
constexpr mode_t kCopyMode = 0666;            // other programs of the device rewrite the copy

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

struct Setting {
    std::string_view key;
    std::string_view value;
};

bool isBlank(char c) {
    return c == ' ' || c == '\t';
}

// What may stand around a value without belonging to it.
bool isFrame(char c) {
    return isBlank(c) || c == '"';
}

// Splits one line. The key is empty when the line holds no setting.
Setting parseLine(std::string_view line) {
    const std::size_t split = line.find('=', 1);
    if (split == std::string_view::npos) return {};
    std::string_view key = line.substr(0, split);
    while (!key.empty() && isBlank(key.front())) key.remove_prefix(1);

    std::string_view value = line.substr(split + 1);
    while (!value.empty() && isFrame(value.front())) value.remove_prefix(1);
    while (!value.empty() && (isFrame(value.back()) || value.back() == '\n')) {
        value.remove_suffix(1);
    }
    return {key, value};
}

std::string quotedForShell(const std::string& text) {
    std::string quoted;
    for (const char c : text) {
        if (c == '\'') {
            quoted += "'\\''";
        } else {
            quoted += c;
        }
    }
    return quoted;
}

// Puts a backslash before each of the characters in @p special, and before each backslash.
std::string escapedForSed(const std::string& text, const char* special) {
    std::string escaped;
    for (const char c : text) {
        if (c == '\\' || std::strchr(special, c) != nullptr) escaped += '\\';
        escaped += c;
    }
    return escaped;
}

std::string pathForShell(const std::string& path) {
    constexpr const char* kPlain =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_/.-+,:@";
    if (path.find_first_not_of(kPlain) == std::string::npos) return path;
    return "'" + quotedForShell(path) + "'";
}

// The command that replaces a setting in a file. Key, values and path mean themselves only:
// nothing in them is read by the shell or by sed.
std::string replaceCommand(const std::string& key,
                           const std::string& oldValue,
                           const std::string& value,
                           const std::string& path) {
    const std::string from = escapedForSed(key + "=" + oldValue, "/.*[]^$");
    const std::string to = escapedForSed(key + "=" + value, "/&");
    return "sed -i 's/" + quotedForShell(from) + "/" + quotedForShell(to) + "/g' " +
           pathForShell(path);
}

bool copyFile(std::FILE* from, std::FILE* to) {
    std::array<char, kLineSize> piece{};
    while (std::fgets(piece.data(), piece.size(), from) != nullptr) {
        if (std::fputs(piece.data(), to) == EOF) return false;
    }
    return std::fflush(to) == 0;
}

}  // namespace

GlobalConfig* GlobalConfig::getInstance() {
    static GlobalConfig instance;
    return &instance;
}

bool GlobalConfig::loadConfig(const std::string& path) {
    configPath = path;
    bool parsed = false;
    {
        const FileHandle file = openFile(path, "re");
        if (!file) {
            logConfigError("GlobalConfig::loadConfig() - failed to open config file: [%s].\n",
                           path.c_str());
            return false;
        }
        parsed = loadConfigSettings(file.get());
    }
    if (properties.empty()) {
        // Says "open", but means a file without a single setting.
        logConfigError("GlobalConfig::loadConfigSettings() - failed to open config file: [%s].\n",
                       path.c_str());
        return false;
    }
    if (!parsed) return false;

    logConfigInfo("Getting path for dynamic config file.\n");
    const std::string dynamicPath = getProperty("DYNAMIC_CONFIG") + "/dynamicconfig.ini";
    logConfigInfo("Getting path for TEMP dynamic config file.\n");
    const std::string copyPath = getProperty(kTmpPathKey);
    return namesACopy(copyPath) ? loadTemporaryCopy(dynamicPath, copyPath)
                                : loadDynamicConfig(dynamicPath);
}

bool GlobalConfig::loadDynamicConfig(const std::string& path) {
    logConfigInfo("OPENING dynamic config file for read: \n");
    logConfigInfo("%s", path.c_str());
    const FileHandle file = openFile(path, "re");
    if (!file) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: [%s].\n",
            path.c_str());
        return false;
    }
    logConfigInfo("LOADING dynamic config file settings.\n");
    return loadConfigSettings(file.get());
}

namespace {

// Makes the first temporary copy. False, with the cause logged, when it cannot be made.
bool createTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath) {
    logConfigInfo("Opening dynamic config file for copy.\n");
    const FileHandle dynamicFile = openFile(dynamicPath, "re");
    if (!dynamicFile) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: %s\n",
            dynamicPath.c_str());
        return false;
    }
    logConfigInfo("Creating temp copy of dynamic config file.\n");
    const FileHandle copy = openFile(copyPath, "we");
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
        // A copy that was cut short would be taken for the whole from now on.
        static_cast<void>(unlink(copyPath.c_str()));
        return false;
    }
    return true;
}

}  // namespace

bool GlobalConfig::loadTemporaryCopy(const std::string& dynamicPath, const std::string& copyPath) {
    logConfigInfo("Loading TEMP dynamic config file.\n");
    FileHandle copy = openFile(copyPath, "re");
    if (!copy) {
        if (!createTemporaryCopy(dynamicPath, copyPath)) return false;
        static_cast<void>(chmod(copyPath.c_str(), kCopyMode));
        logConfigInfo("Re-opening TEMP dynamic config file.\n");
        copy = openFile(copyPath, "re");
    }
    if (!copy) {
        logConfigError(
            "GlobalConfig::loadConfig() - failed to open temp dynamic config settings file: [%s].\n",
            copyPath.c_str());
        return false;
    }
    const bool parsed = loadConfigSettings(copy.get());
    copy.reset();
    struct stat status {};
    if (stat(copyPath.c_str(), &status) == 0) tmpModTime = status.st_mtime;
    return parsed;
}

bool GlobalConfig::loadConfigSettings(std::FILE* file) {
    std::array<char, kLineSize> line{};
    std::string key;  // one block for all lines: the map copies a key only when it is new
    while (std::fgets(line.data(), line.size(), file) != nullptr) {
        const Setting setting = parseLine(line.data());
        if (setting.key.empty()) continue;
        key = setting.key;
        const auto [place, isNew] = properties.try_emplace(key, setting.value);
        if (!isNew) place->second = setting.value;
    }
    return true;
}

const std::string& GlobalConfig::getProperty(const std::string& key) {
    static const std::string absent;
    if (properties.empty()) loadConfig(configPath);
    if (key != kTmpPathKey) reloadChangedCopy();
    const auto found = properties.find(key);
    return found == properties.end() ? absent : found->second;
}

std::string GlobalConfig::knownProperty(const std::string& key) const {
    const auto found = properties.find(key);
    return found == properties.end() ? std::string{} : found->second;
}

void GlobalConfig::reloadChangedCopy() {
    const auto found = properties.find(kTmpPathKey);
    if (found == properties.end() || !namesACopy(found->second)) return;
    const std::string& path = found->second;
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) {
        logConfigError(
            "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [%s].\n",
            path.c_str());
        return;
    }
    if (status.st_mtime == tmpModTime) return;
    // Stored even when the copy cannot be opened: the next change brings the next attempt.
    tmpModTime = status.st_mtime;
    const FileHandle copy = openFile(path, "re");
    if (!copy) return;
    logConfigInfo("Reload dynamicconfig.ini file.\n");
    loadConfigSettings(copy.get());
}

std::string& GlobalConfig::setProperty(const std::string& key,
                                       const std::string& value,
                                       bool writeThrough) {
    if (properties.empty()) loadConfig(configPath);
    if (writeThrough) writeToStaticFile(key, knownProperty(key), value);
    return properties[key] = value;
}

void GlobalConfig::writeToStaticFile(const std::string& key,
                                     const std::string& oldValue,
                                     const std::string& value) const {
    const bool isNew = oldValue.empty();
    const std::string text =
        isNew ? key + "=" + value + "\n" : replaceCommand(key, oldValue, value, configPath);
    // A line or command that was cut short would damage the file, so it is not used at all.
    if (text.size() >= kLineSize || (key + value).find('\n') != std::string::npos) {
        logConfigError(
            "GlobalConfig::setProperty() - setting cannot be written to config file: %s\n",
            configPath.c_str());
        return;
    }
    if (!isNew) {
        if (std::system(text.c_str()) != 0) {
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
    if (properties.empty()) loadConfig(configPath);
    properties.erase(key);
}

bool GlobalConfig::refresh() {
    return loadConfig(configPath);
}

std::string setting(const std::string& key) {
    return GlobalConfig::getInstance()->getProperty(key);
}

}  // namespace pelorus
