// Other programs on the device.
#ifndef PELORUS_DOCTOR_PROGRAM_H
#define PELORUS_DOCTOR_PROGRAM_H

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace pelorus::doctor {

/// Where @p name is: a path is taken as it is, else it is looked for in PATH and the folders of
/// administrators. Empty when there is no such executable file.
[[nodiscard]] std::string findProgram(const std::string& name);

/// Runs @p words without a shell and returns the beginning of its output. Nothing when it could not
/// be run or took longer than @p limit; it is then killed. Only for a process without other threads.
[[nodiscard]] std::optional<std::string> outputOf(const std::vector<std::string>& words,
                                                  std::chrono::milliseconds limit);

}  // namespace pelorus::doctor

#endif
