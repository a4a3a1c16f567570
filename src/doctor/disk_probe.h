// The state of the disk. hdparm -C does not wake it.
#ifndef PELORUS_DOCTOR_DISK_PROBE_H
#define PELORUS_DOCTOR_DISK_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

enum class DiskState { UNKNOWN, STANDBY, ACTIVE };

/// The state that the output of hdparm -C tells.
[[nodiscard]] DiskState readDiskState(const std::string& output);
/// That of the disk the daemon looks at. Takes at most two seconds.
[[nodiscard]] DiskState diskState();

void lookAtDisk(Findings& findings);

}  // namespace pelorus::doctor

#endif
