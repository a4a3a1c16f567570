#include "doctor/disk_probe.h"

#include "common/text.h"
#include "doctor/program.h"

namespace pelorus::doctor {

DiskState readDiskState(const std::string& output) {
    if (contains(output, "standby")) return DiskState::STANDBY;
    const bool active = contains(output, "active") || contains(output, "idle");
    return active ? DiskState::ACTIVE : DiskState::UNKNOWN;
}

DiskState diskState() {
    constexpr std::chrono::seconds kPatience{2};
    return readDiskState(outputOf({"hdparm", "-C", "/dev/sda"}, kPatience).value_or(""));
}

void lookAtDisk(Findings& findings) {
    switch (diskState()) {
        case DiskState::STANDBY:
            findings.ok("disk in standby");
            return;
        case DiskState::ACTIVE:
            findings.ok("disk active");
            return;
        case DiskState::UNKNOWN:
            findings.notSeen(findProgram("hdparm").empty()
                                 ? "disk: there is no program hdparm"
                                 : "disk: hdparm does not tell its state (root only)");
            return;
    }
}

}  // namespace pelorus::doctor
