// The state of the disk. hdparm -C does not wake it.
#ifndef PELORUS_DOCTOR_DISK_PROBE_H
#define PELORUS_DOCTOR_DISK_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

enum class DiskState { UNKNOWN, STANDBY, ACTIVE };

/// The state that the output of hdparm -C tells.
[[nodiscard]] DiskState readDiskState(const std::string& output);
/// Why no request may be sent that might touch a disk in @p state: "while the disk sleeps". Empty
/// when it is awake for certain.
[[nodiscard]] std::string diskObstacle(DiskState state, const Evidence& evidence);
/// The same for the disk the daemon looks at. Takes at most two seconds.
[[nodiscard]] std::string diskObstacle(const Evidence& evidence);

void lookAtDisk(Findings& findings);

}  // namespace pelorus::doctor

#endif
