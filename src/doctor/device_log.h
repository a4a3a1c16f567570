// The daemon's log on this device, or files with the log of another one.
#ifndef PELORUS_DOCTOR_DEVICE_LOG_H
#define PELORUS_DOCTOR_DEVICE_LOG_H

#include <chrono>
#include <string>
#include <vector>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// What to read.
struct LogChoice {
    /// In any order; compressed by gzip or not; "-" is standard input. Empty: the journal when it
    /// has lines of the daemon, else the system logger's files.
    std::vector<std::string> files;
    std::string folder = "/var/log";                   ///< where the system logger keeps its files
    std::chrono::milliseconds journalPatience{10000};  ///< with a journal that gives no line
};

/// Adds what the log tells: history, signs, when the daemon started and goes on. For a log from
/// elsewhere it sets `now` to the time of the last line. Files that cannot be read become checks.
void lookAtLog(const LogChoice& choice, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
