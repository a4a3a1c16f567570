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
};

/// Reads both files as the daemon would. No line holds a secret; each list has at most 100 lines,
/// and one more that counts the rest. When this user may not read the files, that is a problem, and
/// they count as not usable.
[[nodiscard]] SettingsReport checkSettings(const std::string& staticFile);

}  // namespace pelorus::doctor

#endif
