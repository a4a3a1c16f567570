// The daemon's process.
#ifndef PELORUS_DOCTOR_DAEMON_LOOK_H
#define PELORUS_DOCTOR_DAEMON_LOOK_H

#include <optional>
#include <string>

#include "doctor/evidence.h"
#include "doctor/process_table.h"

namespace pelorus::doctor {

/// The daemon's process: the one that @p pidFile names, else any that is called like it.
[[nodiscard]] std::optional<Process> findDaemon(const ProcessTable& processes,
                                                const std::string& pidFile);

/// Adds DAEMON_RUNS or DAEMON_GONE, a check and `evidence.daemon`.
void lookAtDaemon(const ProcessTable& processes, const std::string& pidFile, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
