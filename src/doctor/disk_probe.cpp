#include "doctor/disk_probe.h"

#include "common/text.h"
#include "doctor/program.h"

namespace pelorus::doctor {

namespace {

DiskState diskState() {
    constexpr std::chrono::seconds kPatience{2};
    return readDiskState(outputOf({"hdparm", "-C", "/dev/sda"}, kPatience).value_or(""));
}

}  // namespace

DiskState readDiskState(const std::string& output) {
    if (contains(output, "standby")) return DiskState::STANDBY;
    const bool active = contains(output, "active") || contains(output, "idle");
    return active ? DiskState::ACTIVE : DiskState::UNKNOWN;
}

std::string diskObstacle(DiskState state, const Evidence& evidence) {
    if (state == DiskState::STANDBY) return "while the disk sleeps";
    const bool isAwake = state == DiskState::ACTIVE || evidence.has(Sign::DISK_IN_USE);
    return isAwake ? "" : "as nothing tells whether the disk sleeps";
}

std::string diskObstacle(const Evidence& evidence) {
    return diskObstacle(diskState(), evidence);
}

void lookAtDisk(Findings& findings) {
    switch (diskState()) {
        case DiskState::STANDBY:
            findings.ok("disk in standby");
            return;
        case DiskState::ACTIVE:
            findings.add(Sign::DISK_ACTIVE, "disk active");
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
