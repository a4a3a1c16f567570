// The settings files of a device, read as the daemon reads them.
#ifndef PELORUS_DOCTOR_DEVICE_SETTINGS_H
#define PELORUS_DOCTOR_DEVICE_SETTINGS_H

#include <cstddef>
#include <map>
#include <string>
#include <vector>

#include "common/files.h"
#include "config/settings_map.h"

namespace pelorus::doctor {

/// One of the files, and what it held.
struct SettingsFile {
    std::string path{};
    ForeignText content{};

    /// It is there, but this user may not read it.
    [[nodiscard]] bool needsRoot() const;
    /// Why it could not be read: "PATH cannot be read: No such file or directory"
    [[nodiscard]] std::string trouble() const;
};

enum class FileKind { STATIC, DYNAMIC, COPY };

/// A line that holds a setting.
struct SettingsLine {
    FileKind file{};
    std::size_t number{};  ///< from 1
    std::string key{};
    std::string value{};
    MergedLine::Fate fate{};
};

struct DeviceSettings {
    enum class Obstacle { NONE, STATIC_FILE, DYNAMIC_FILE };

    SettingsFile staticFile{};
    SettingsFile dynamicFile{};  ///< without a path when the static file cannot be read
    SettingsFile copy{};         ///< without a path when none is configured
    SettingsMap merged{};
    std::vector<SettingsLine> lines{};  ///< as they were merged; the first 20,000 of each file
    Obstacle obstacle{};                ///< the daemon would not start
    std::string reason{};               ///< why not, or which file could not be read
    bool needsRoot = false;             ///< a file that counts could not be read by this user

    /// The daemon would start, and every file that counts has been read.
    [[nodiscard]] bool isWhole() const { return obstacle == Obstacle::NONE && !needsRoot; }
    [[nodiscard]] const SettingsFile& file(FileKind kind) const;
    /// What the dynamic settings come from: the copy, or as long as there is none, the file itself.
    [[nodiscard]] FileKind dynamicSource() const;
    [[nodiscard]] std::string value(const std::string& key) const;
    /// Every value that the files give the device's secrets, by key: also those that another line
    /// overrides, or that stand behind # or a key in another spelling.
    [[nodiscard]] std::multimap<std::string, std::string> secrets() const;
};

/// Reads what the daemon would read at its start. Creates no copy: where it is missing, the dynamic
/// file is read.
[[nodiscard]] DeviceSettings readDeviceSettings(const std::string& staticFile);

/// The lines of a file on its own, all of them taken.
[[nodiscard]] std::vector<SettingsLine> linesOf(const SettingsFile& file, FileKind kind);

}  // namespace pelorus::doctor

#endif
