// The settings that the daemon reads: one table.
#ifndef PELORUS_DOCTOR_KNOWN_SETTINGS_H
#define PELORUS_DOCTOR_KNOWN_SETTINGS_H

#include <string_view>
#include <vector>

namespace pelorus::doctor {

enum class SettingKind {
    TEXT,
    SECRET,  ///< must not be shown
    SWITCH,  ///< 1 or anything else
    TRUTH,   ///< TRUE or anything else
    NUMBER,
    PORT,
    STATUS,   ///< a status word
    PATH,     ///< of a file or folder, absolute
    COMMAND,  ///< for the shell
    SERVER,   ///< URL of the central service
    SERVICE_TEMPLATE,
    BACK_END_TEMPLATE,
};

struct KnownSetting {
    std::string_view key;
    SettingKind kind;
    /// What happens without it; empty when nothing is wrong then.
    std::string_view without;
    /// Of a template: the values that it is given, in order, "s" a text, "d" a number.
    std::string_view takes;
};

const std::vector<KnownSetting>& knownSettings();

/// Null when the daemon does not read @p key.
[[nodiscard]] const KnownSetting* findKnownSetting(std::string_view key);

/// True when whoever sets it controls commands, paths, hosts or URLs: it belongs into
/// STATIC_ONLY_KEYS.
[[nodiscard]] bool isDangerous(const KnownSetting& setting);

/// True for what the local back end keeps in the settings for itself.
[[nodiscard]] bool isOfBackEnd(std::string_view key);

}  // namespace pelorus::doctor

#endif
