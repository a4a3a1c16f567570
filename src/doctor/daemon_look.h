// The daemon's process.
#ifndef PELORUS_DOCTOR_DAEMON_LOOK_H
#define PELORUS_DOCTOR_DAEMON_LOOK_H

#include <string>

#include "doctor/evidence.h"
#include "doctor/process_table.h"

namespace pelorus::doctor {

/// Adds DAEMON_RUNS or DAEMON_GONE, a check and `evidence.daemon`. A process counts that @p pidFile
/// names, else any that is called like the daemon.
void lookAtDaemon(const ProcessTable& processes, const std::string& pidFile, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
