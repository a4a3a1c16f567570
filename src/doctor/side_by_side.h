// Running probes side by side, each in a process of its own: a library that hangs, crashes or
// floods the memory takes only its own probe with it.
#ifndef PELORUS_DOCTOR_SIDE_BY_SIDE_H
#define PELORUS_DOCTOR_SIDE_BY_SIDE_H

#include <chrono>
#include <functional>
#include <vector>

#include "doctor/findings.h"

namespace pelorus::doctor {

/// A probe. It runs in a child process: what it changes in memory is lost, except its findings. It
/// has default signals and the null device as its standard files, and cannot write to the log.
using Probe = std::function<void(Findings& findings)>;

/// Starts all @p probes at once and waits until all have ended, at most @p limit, then kills the
/// rest. The findings are in the order of the probes; those that are not finished() are what a
/// probe had found before it was killed or crashed, or empty if it gave rubbish. No process is left
/// behind.
[[nodiscard]] std::vector<Findings> runSideBySide(const std::vector<Probe>& probes,
                                                  std::chrono::milliseconds limit);

/// Makes a child process that was just forked die with @p parent, gives it default signals, and
/// opens the null device in place of its standard files.
void settleChild(pid_t parent);

}  // namespace pelorus::doctor

#endif
