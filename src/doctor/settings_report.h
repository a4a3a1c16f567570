// What is wrong with the settings of a device, before anything is started.
#ifndef PELORUS_DOCTOR_SETTINGS_REPORT_H
#define PELORUS_DOCTOR_SETTINGS_REPORT_H

#include <string>
#include <vector>

namespace pelorus::doctor {

struct SettingsReport {
    std::vector<std::string> problems;  ///< missing, wrong or unsafe: "FILE:LINE: ..."
    std::vector<std::string> remarks;   ///< unknown, overridden or ignored
    bool usable = false;                ///< the daemon would start
    bool needsRoot = false;             ///< this user may not read a file: not known if it would
};

/// Reads both files as the daemon would. No line holds a secret; each list has at most 100 lines,
/// and one more that counts the rest. A file that cannot be read is one problem, and no key that may
/// be in it is missing.
[[nodiscard]] SettingsReport checkSettings(const std::string& staticFile);

}  // namespace pelorus::doctor

#endif
