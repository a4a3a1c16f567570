#include "doctor/setting_value.h"

#include <algorithm>
#include <array>

#include "common/text.h"

namespace pelorus::doctor {

namespace {

constexpr int kHighestPort = 65535;
constexpr std::array<std::string_view, 5> kStatusWords{"disabled", "connecting", "portforwarded",
                                                       "relayed", "failed"};

bool beginsWith(const std::string& text, std::string_view beginning) {
    return text.compare(0, beginning.size(), beginning) == 0;
}

std::string numberFault(const std::string& value, bool isForPort) {
    const auto number = scanInt(value.c_str());
    if (!number) return "is no number";
    if (isForPort && (*number < 1 || *number > kHighestPort)) return "is no port, 1 to 65535";
    const bool isPlain = value.find_first_not_of("0123456789") == std::string::npos;
    return isPlain ? "" : "has more than digits; only the number at its beginning counts";
}

// What follows the first two slashes is the host.
std::string serverFault(const std::string& value) {
    const std::size_t slashes = value.find("//");
    if (slashes == std::string::npos) return "has no // in front of the host";
    return slashes + 3 < value.size() ? "" : "names no host";
}

std::string wordFault(SettingKind kind, const std::string& value) {
    if (kind == SettingKind::SWITCH) {
        return value == "1" || value == "0" ? "" : "is not 1, so remote access is off";
    }
    if (kind == SettingKind::TRUTH) {
        return value == "TRUE" || value == "FALSE" || value == "0" ? ""
                                                                   : "is not TRUE, so it is off";
    }
    const bool isKnown =
        std::find(kStatusWords.begin(), kStatusWords.end(), value) != kStatusWords.end();
    return isKnown ? "" : "is no status word";
}

}  // namespace

std::string templateFault(std::string_view text, std::string_view takes) {
    std::size_t next = 0;
    for (std::size_t at = text.find('%'); at != std::string_view::npos;
         at = text.find('%', at + 2)) {
        const char letter = at + 1 < text.size() ? text[at + 1] : '\0';
        if (letter == '%') continue;
        const bool isNumber = letter == 'd' || letter == 'i' || letter == 'u';
        if (!isNumber && letter != 's') {
            return "has a percent sign that is neither %s, %d, %i, %u nor %%: no URL is built";
        }
        if (next == takes.size()) {
            return "has more than " + std::to_string(takes.size()) +
                   " placeholders: no URL is built";
        }
        if (isNumber != (takes[next++] == 'd')) {
            return "has the wrong kind of placeholder as number " + std::to_string(next) +
                   ": no URL is built";
        }
    }
    return {};
}

std::string valueFault(const KnownSetting& setting, const std::string& value) {
    if (value.empty()) return {};
    switch (setting.kind) {
        case SettingKind::SWITCH:
        case SettingKind::TRUTH:
        case SettingKind::STATUS:
            return wordFault(setting.kind, value);
        case SettingKind::NUMBER:
        case SettingKind::PORT:
            return numberFault(value, setting.kind == SettingKind::PORT);
        case SettingKind::PATH:
            return value.front() == '/' || value == "empty" ? "" : "is no absolute path";
        case SettingKind::SERVER:
            return serverFault(value);
        case SettingKind::SERVICE_TEMPLATE:
            if (value.front() != '/') return "does not begin with /";
            return templateFault(value, setting.takes);
        case SettingKind::BACK_END_TEMPLATE:
            if (!beginsWith(value, "http://")) return "does not begin with http://";
            return templateFault(value, setting.takes);
        case SettingKind::TEXT:
        case SettingKind::SECRET:
        case SettingKind::COMMAND:
            break;
    }
    return {};
}

bool isShowable(const KnownSetting& setting) {
    switch (setting.kind) {
        case SettingKind::SWITCH:
        case SettingKind::TRUTH:
        case SettingKind::NUMBER:
        case SettingKind::PORT:
        case SettingKind::STATUS:
        case SettingKind::PATH:
            return true;
        default:
            return false;
    }
}

}  // namespace pelorus::doctor
