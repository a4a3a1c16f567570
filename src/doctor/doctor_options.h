// The doctor's command line.
#ifndef PELORUS_DOCTOR_DOCTOR_OPTIONS_H
#define PELORUS_DOCTOR_DOCTOR_OPTIONS_H

#include <optional>
#include <string>
#include <vector>

namespace pelorus::doctor {

inline constexpr int kWrongUsage = 64;
inline constexpr int kNotWritten = 73;

struct DoctorOptions {
    std::vector<std::string> logs;  ///< "-" is standard input
    bool probes = true;
    bool askService = false;
    bool settingsOnly = false;
    bool json = false;
    bool share = false;
    std::string picture{};            ///< path; empty: none
    std::optional<int> exitStatus{};  ///< set: there is nothing else to do
};

/// Reads the command line. Help and version go to standard output; of wrong usage one line says on
/// standard error what is wrong.
[[nodiscard]] DoctorOptions parseDoctorOptions(int argc, char** argv);

}  // namespace pelorus::doctor

#endif
