#include "doctor/settings_report.h"

#include <algorithm>
#include <cctype>
#include <map>
#include <string_view>
#include <utility>

#include "doctor/device_settings.h"
#include "doctor/file_safety.h"
#include "doctor/known_settings.h"
#include "doctor/secret_masks.h"
#include "doctor/setting_value.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

using LastLines = std::map<std::string, const SettingsLine*>;

constexpr std::size_t kMostReported = 100;
constexpr std::size_t kMostOfValue = 60;  // characters

// Each key's last line that counts.
LastLines lastLines(const std::vector<SettingsLine>& lines) {
    LastLines last;
    for (const SettingsLine& line : lines) {
        if (line.fate == MergedLine::Fate::TAKEN) last[line.key] = &line;
    }
    return last;
}

std::string withoutReturn(std::string value) {
    while (!value.empty() && value.back() == '\r') value.pop_back();
    return value;
}

std::string trimmed(std::string key) {
    key.erase(key.find_last_not_of(" \t") + 1);  // npos + 1 is 0
    return key;
}

std::string inCapitals(std::string key) {
    std::transform(key.begin(), key.end(), key.begin(),
                   [](unsigned char letter) { return static_cast<char>(std::toupper(letter)); });
    return key;
}

// Of what the daemon does not know, only what looks like a key: the rest may be a secret.
std::string shownKey(const std::string& key) {
    const auto start = key.begin() + (key.rfind('#', 0) == 0 ? 1 : 0);
    const auto end = std::find_if_not(start, key.end(), [](unsigned char letter) {
        return std::isupper(letter) != 0 || std::isdigit(letter) != 0 || letter == '_';
    });
    const bool isKey =
        end > start && (end == key.end() || std::isalnum(static_cast<unsigned char>(*end)) == 0);
    return isKey ? std::string{key.begin(), end} : "this key";
}

class SettingsCheck {
public:
    explicit SettingsCheck(const std::string& staticFile)
        : settings{readDeviceSettings(staticFile)} {}

    SettingsReport run() {
        checkFiles();
        if (!settings.merged.values.empty()) {
            checkText(FileKind::STATIC);
            checkText(settings.dynamicSource());
            checkLines();
            checkMissing();
            checkDifferences();
            checkSafety();
        }
        for (auto* list : {&report.problems, &report.remarks}) {
            const std::size_t more = list->size() - std::min(list->size(), kMostReported);
            list->resize(list->size() - more);
            for (std::string& line : *list) line = masks.hide(line);
            if (more > 0) list->push_back("and " + std::to_string(more) + " more");
        }
        return report;
    }

private:
    void problem(const std::string& place, const std::string& text) {
        report.problems.push_back(place + ": " + text);
    }
    void remark(const std::string& place, const std::string& text) {
        report.remarks.push_back(place + ": " + text);
    }
    [[nodiscard]] std::string place(FileKind file) const {
        return shownText(settings.file(file).path);
    }
    [[nodiscard]] std::string place(FileKind file, std::size_t line) const {
        return place(file) + ":" + std::to_string(line);
    }
    [[nodiscard]] std::string place(const SettingsLine& line) const {
        return place(line.file, line.number);
    }

    void checkFiles() {
        report.needsRoot = settings.needsRoot;
        report.usable = settings.isWhole();
        if (report.needsRoot) {
            report.problems.push_back(settings.reason);
        } else if (!report.usable) {
            report.problems.push_back("the daemon would not start: " + settings.reason);
        }
        for (const FileKind file : {FileKind::STATIC, settings.dynamicSource()}) {
            if (settings.file(file).content.isCut) {
                const bool isStatic = file == FileKind::STATIC;
                problem(place(file), std::string{"is longer than "} + (isStatic ? "16" : "1") +
                                         " MiB; only its beginning is read");
            }
        }
    }

    // What a setting's key and value do not show.
    void checkText(FileKind file) {
        const std::string text = settings.file(file).content.text.value_or("");
        std::size_t number = 0;
        bool isDosReported = false;
        for (std::size_t at = 0; at < text.size();) {
            const std::size_t end = std::min(text.find('\n', at), text.size());
            const std::string_view line = std::string_view{text}.substr(at, end - at);
            ++number;
            at = end + 1;
            if (line.find('=') == std::string_view::npos) continue;
            if (line.size() >= kSettingLineSize) {
                problem(place(file, number),
                        "has " + std::to_string(line.size()) +
                            " characters: what follows the 299th is read as another line");
            }
            if (line.find('\0') != std::string_view::npos) {
                problem(place(file, number), "has zero bytes: the rest is not read");
            }
            if (line.back() == '\r' && !std::exchange(isDosReported, true)) {
                problem(place(file, number),
                        "DOS line end: the carriage return becomes part of the value");
            }
        }
    }

    void checkLines() {
        LastLines last;
        for (const SettingsLine& line : settings.lines) {
            if (line.fate == MergedLine::Fate::RESERVED) {
                remark(place(line),
                       shownKey(line.key) + " is ignored: only the static file sets it");
            } else if (line.fate == MergedLine::Fate::FULL) {
                problem(place(line), "is ignored: there are " + std::to_string(kMostSettings) +
                                         " settings already");
            } else {
                const SettingsLine* earlier = std::exchange(last[line.key], &line);
                if (earlier == nullptr) {
                    checkKey(line);
                } else {
                    checkEarlier(line, *earlier);
                }
            }
        }
        for (const auto& [key, line] : last) {
            const KnownSetting* known = findKnownSetting(key);
            if (known != nullptr) checkValue(*known, *line);
        }
    }

    void checkKey(const SettingsLine& line) {
        if (findKnownSetting(line.key) != nullptr || isOfBackEnd(line.key)) return;
        const std::string plain = trimmed(line.key);
        if (plain != line.key && findKnownSetting(plain) != nullptr) {
            problem(place(line), "the blank in front of = makes another key than " + plain);
        } else if (line.key.front() == '#') {
            remark(place(line), "# begins no comment: it sets " + shownKey(line.key));
        } else if (findKnownSetting(inCapitals(plain)) != nullptr) {
            problem(place(line), plain + " is another key than " + inCapitals(plain));
        } else {
            remark(place(line), "the daemon does not know " + shownKey(line.key));
        }
    }

    void checkEarlier(const SettingsLine& line, const SettingsLine& earlier) {
        const bool addsUp = line.key == "STATIC_ONLY_KEYS";
        if (addsUp || earlier.value == line.value) return;
        std::string text = shownKey(line.key);
        const KnownSetting* known = findKnownSetting(line.key);
        if (known != nullptr && isShowable(*known)) {
            text += "=" + shownText(line.value, kMostOfValue) + " replaces " +
                    shownText(earlier.value, kMostOfValue) + " of ";
        } else {
            text += " replaces the value of ";
        }
        const bool isSameFile = earlier.file == line.file;
        remark(place(line),
               text + (isSameFile ? "line " + std::to_string(earlier.number) : place(earlier)));
    }

    void checkValue(const KnownSetting& known, const SettingsLine& line) {
        const std::string value = withoutReturn(line.value);
        const std::string fault = valueFault(known, value);
        if (fault.empty()) {
            if (known.kind == SettingKind::SWITCH && value == "0") {
                remark(place(line), line.key + "=0: remote access is off");
            }
            return;
        }
        const std::string shown =
            isShowable(known) ? "=" + shownText(value, kMostOfValue) : std::string{};
        problem(place(line), line.key + shown + " " + fault);
    }

    void checkMissing() {
        const LastLines last = lastLines(settings.lines);
        for (const KnownSetting& known : knownSettings()) {
            const std::string key{known.key};
            if (known.without.empty() || !settings.value(key).empty()) continue;
            const auto line = last.find(key);
            const bool isThere = line != last.end();
            if (!isThere && isPerhapsUnread(key)) continue;
            problem(isThere ? place(*line->second) : place(FileKind::STATIC),
                    key + (isThere ? " is empty: " : " is missing: ") + std::string{known.without});
        }
        if (settings.value("MANUAL_PORT_FORWARD") != "TRUE") return;
        for (const char* key : {"MANUAL_EXTERNAL_HTTP_PORT", "MANUAL_EXTERNAL_HTTPS_PORT"}) {
            if (!settings.value(key).empty() || isPerhapsUnread(key)) continue;
            problem(place(settings.dynamicSource()),
                    std::string{key} + " is missing: no port forwarded by hand is used");
        }
    }

    // It may be in the file that could not be read.
    [[nodiscard]] bool isPerhapsUnread(const std::string& key) const {
        return !settings.isWhole() && !settings.merged.isReserved(key);
    }

    // While there is a copy, the dynamic file has no effect.
    void checkDifferences() {
        if (settings.dynamicSource() != FileKind::COPY) return;
        if (!settings.dynamicFile.content.text) {
            remark(place(FileKind::DYNAMIC), "cannot be read; the copy is used");
            return;
        }
        const auto copyLines = linesOf(settings.copy, FileKind::COPY);
        const auto fileLines = linesOf(settings.dynamicFile, FileKind::DYNAMIC);
        const LastLines inCopy = lastLines(copyLines);
        const LastLines inFile = lastLines(fileLines);
        for (const auto& [key, line] : inFile) {
            const auto other = inCopy.find(key);
            if (other == inCopy.end()) {
                remark(place(*line), shownKey(key) + " is not in the copy, which counts");
            } else if (other->second->value != line->value) {
                remark(place(*line),
                       shownKey(key) + " differs from " + place(*other->second) + ", which counts");
            }
        }
        for (const auto& [key, line] : inCopy) {
            if (inFile.count(key) == 0) {
                remark(place(*line), shownKey(key) + " is only in the copy");
            }
        }
    }

    void checkSafety() {
        const Writers staticWriters = writersOf(settings.staticFile.path);
        if (staticWriters == Writers::SOME || staticWriters == Writers::EVERYBODY) {
            problem(
                place(FileKind::STATIC),
                "others than root can change it or a folder on the way to it, and its commands run as root");
        }
        const FileKind source = settings.dynamicSource();
        Writers writers = writersOf(settings.file(source).path);
        if (writers == Writers::EVERYBODY)
            problem(place(source), "everybody can write or replace it");
        if (!settings.copy.path.empty() && creatorsOf(settings.copy.path) == Writers::EVERYBODY) {
            problem(
                place(FileKind::COPY),
                "everybody can take its name before the daemon starts; it belongs into a folder that only root and the web back end can enter");
            writers = Writers::EVERYBODY;
        }
        checkReserved(writers);
    }

    void checkReserved(Writers writers) {
        std::string open;
        bool isCommandOpen = false;
        for (const KnownSetting& known : knownSettings()) {
            if (!isDangerous(known) || settings.merged.isReserved(std::string{known.key})) continue;
            open += " " + std::string{known.key};
            isCommandOpen |= known.kind == SettingKind::COMMAND;
        }
        if (open.empty()) return;
        const std::string text = "STATIC_ONLY_KEYS lacks" + open;
        if (writers == Writers::EVERYBODY || (writers == Writers::SOME && isCommandOpen)) {
            problem(place(FileKind::STATIC),
                    text + ": whoever writes " + place(settings.dynamicSource()) + " sets them");
        } else {
            remark(place(FileKind::STATIC), text);
        }
    }

    const DeviceSettings settings;
    // A line shows keys and paths, and somebody may have written a secret there.
    const SecretMasks masks{settings.secrets()};
    SettingsReport report;
};

}  // namespace

SettingsReport checkSettings(const std::string& staticFile) {
    return SettingsCheck{staticFile}.run();
}

}  // namespace pelorus::doctor
