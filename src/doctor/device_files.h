// The settings files, the processes and the small files that tell how a device is doing.
#ifndef PELORUS_DOCTOR_DEVICE_FILES_H
#define PELORUS_DOCTOR_DEVICE_FILES_H

#include <string>

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct DevicePaths {
    std::string staticFile;
    std::string pidFile = "/tmp/tavik_cm_pid";
    std::string minutesFile = "/tmp/minutes_since_disk_access";
    std::string processes = "/proc";
};

/// Adds to @p evidence, whose `now` must be set: the settings as the daemon merges them, its
/// process, the tunnel's process and files, how long the disk has been unused. Writes and creates
/// nothing. What only root can see becomes a Check NOT_SEEN, never a sign.
void lookAtFiles(const DevicePaths& paths, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
