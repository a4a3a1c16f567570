#include "doctor/device_settings.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>

#include "common/handles.h"
#include "doctor/known_settings.h"
#include "doctor/shown_text.h"
#include "doctor/write_obstacle.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kMostLines = 20'000;
constexpr std::size_t kMostStaticBytes = 16UL * 1024 * 1024;

bool namesACopy(const std::string& path) {
    return !path.empty() && path != "empty";
}

// Root puts the file there: any link is followed, and all of it is read.
ForeignText readStaticFile(const std::string& path) {
    const MallocHandle<char> target{realpath(path.c_str(), nullptr)};
    if (!target) {
        ForeignText none;
        none.error = errno;
        return none;
    }
    ForeignText found = readForeignFile(target.get());
    if (!found.text || !found.isCut) return found;
    std::ifstream file{target.get()};
    found.text->resize(kMostStaticBytes);
    file.read(found.text->data(), static_cast<std::streamsize>(kMostStaticBytes));
    found.text->resize(static_cast<std::size_t>(file.gcount()));
    found.isCut = file.good();
    return found;
}

void mergeLines(SettingsMap& map,
                std::string text,
                FileKind kind,
                std::vector<SettingsLine>& lines) {
    if (text.empty()) return;
    const FileHandle stream{fmemopen(text.data(), text.size(), "r")};
    if (!stream) return;
    const auto source =
        kind == FileKind::STATIC ? SettingsMap::Source::STATIC : SettingsMap::Source::DYNAMIC;
    std::size_t count = 0;
    map.merge(stream.get(), source, [&](const MergedLine& line) {
        if (++count > kMostLines) return;
        lines.push_back({kind, line.number, line.key, std::string{line.value}, line.fate});
    });
}

// Without blanks and the # of what is meant for a comment, in capitals.
std::string meantKey(const std::string& key) {
    std::string result;
    for (const char letter : key) {
        const auto code = static_cast<unsigned char>(letter);
        if (std::isspace(code) == 0 && letter != '#')
            result += static_cast<char>(std::toupper(code));
    }
    return result;
}

class SettingsReader {
public:
    DeviceSettings read(const std::string& staticFile) {
        found.staticFile = {staticFile, readStaticFile(staticFile)};
        if (!merge(found.staticFile, FileKind::STATIC)) {
            return refuse(DeviceSettings::Obstacle::STATIC_FILE, found.staticFile);
        }
        if (found.merged.values.empty()) {
            found.obstacle = DeviceSettings::Obstacle::STATIC_FILE;
            found.reason = shownText(staticFile) + " holds no setting";
            return found;
        }
        readDynamicSettings();
        return found;
    }

private:
    bool merge(const SettingsFile& file, FileKind kind) {
        if (!file.content.text) return false;
        mergeLines(found.merged, *file.content.text, kind, found.lines);
        return true;
    }

    // A lookup merges a copy that is there, which may even name other files.
    void readDynamicSettings() {
        const bool isCopyRead = openCopy() && merge(found.copy, FileKind::COPY);
        const std::string before = found.copy.path;
        found.dynamicFile.path = found.value("DYNAMIC_CONFIG") + "/dynamicconfig.ini";
        found.dynamicFile.content = readForeignFile(found.dynamicFile.path, Part::HEAD, Link::OWN);
        if (!openCopy()) {
            readDynamicFile();
        } else if (isCopyRead && found.copy.path == before) {
            return;
        } else if (!merge(found.copy, FileKind::COPY)) {
            if (found.copy.needsRoot()) {
                refuse(DeviceSettings::Obstacle::DYNAMIC_FILE, found.copy);
            } else {
                checkNewCopy();
                if (found.obstacle == DeviceSettings::Obstacle::NONE) readDynamicFile();
            }
        }
    }

    // False when none is configured.
    bool openCopy() {
        const std::string path = found.value("DYNAMIC_CONFIG_TMP");
        if (!namesACopy(path)) {
            found.copy = {};
            return false;
        }
        found.copy = {path, readForeignFile(path)};
        return true;
    }

    void checkNewCopy() {
        const std::string obstacle = writeObstacle(found.copy.path);
        if (obstacle.empty()) return;
        found.obstacle = DeviceSettings::Obstacle::DYNAMIC_FILE;
        found.reason = "the copy " + shownText(found.copy.path) + " cannot be made: " + obstacle;
    }

    void readDynamicFile() {
        if (merge(found.dynamicFile, FileKind::DYNAMIC)) return;
        refuse(DeviceSettings::Obstacle::DYNAMIC_FILE, found.dynamicFile);
    }

    DeviceSettings& refuse(DeviceSettings::Obstacle obstacle, const SettingsFile& file) {
        found.needsRoot = file.needsRoot();
        if (!found.needsRoot) found.obstacle = obstacle;
        found.reason = file.trouble();
        return found;
    }

    DeviceSettings found{};
};

}  // namespace

bool SettingsFile::needsRoot() const {
    const bool isForbidden = content.error == EACCES || content.error == EPERM;
    return !content.text && isForbidden && geteuid() != 0;
}

std::string SettingsFile::trouble() const {
    if (path.empty()) return "no file is named";
    const std::string beginning = shownText(path) + " cannot be read";
    if (needsRoot()) return beginning + " by this user: run it as root";
    if (!content.isRefused) return beginning + ": " + std::strerror(content.error);
    struct stat status {};
    const bool isFolder = stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
    return beginning +
           (isFolder ? ": it is a folder" : ": not a regular file, or a link of somebody else");
}

const SettingsFile& DeviceSettings::file(FileKind kind) const {
    if (kind == FileKind::STATIC) return staticFile;
    return kind == FileKind::DYNAMIC ? dynamicFile : copy;
}

FileKind DeviceSettings::dynamicSource() const {
    return copy.content.text ? FileKind::COPY : FileKind::DYNAMIC;
}

std::string DeviceSettings::value(const std::string& key) const {
    const auto found = merged.values.find(key);
    return found == merged.values.end() ? std::string{} : found->second;
}

std::multimap<std::string, std::string> DeviceSettings::secrets() const {
    std::multimap<std::string, std::string> result(merged.values.begin(), merged.values.end());
    for (const auto& some : {lines, linesOf(dynamicFile, FileKind::DYNAMIC)}) {
        for (const SettingsLine& line : some) {
            const std::string key = meantKey(line.key);
            const KnownSetting* known = findKnownSetting(key);
            const bool isSecret = known != nullptr && known->kind == SettingKind::SECRET;
            if (isSecret) result.emplace(key, line.value);
        }
    }
    return result;
}

DeviceSettings readDeviceSettings(const std::string& staticFile) {
    return SettingsReader{}.read(staticFile);
}

std::vector<SettingsLine> linesOf(const SettingsFile& file, FileKind kind) {
    std::vector<SettingsLine> lines;
    SettingsMap map;
    if (file.content.text) mergeLines(map, *file.content.text, kind, lines);
    return lines;
}

}  // namespace pelorus::doctor
