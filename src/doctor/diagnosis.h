// The doctor's conclusion.
#ifndef PELORUS_DOCTOR_DIAGNOSIS_H
#define PELORUS_DOCTOR_DIAGNOSIS_H

#include <optional>
#include <string>
#include <vector>

#include "doctor/causes.h"
#include "doctor/evidence.h"

namespace pelorus::doctor {

/// Everything the outputs show. Points into the table of causes only.
struct Diagnosis {
    Time now{};
    bool fromElsewhere = false;  ///< only the log of another device was read; `now` is its end
    Reach reach = Reach::UNKNOWN;
    std::string address{};  ///< where it is reached directly; empty otherwise
    std::string ports{};    ///< "9091 and 9444"; empty otherwise
    std::optional<Time> since{};
    bool isSinceAtLeast = false;     ///< it may have been so before `since`, too
    std::optional<Period> before{};  ///< how it was before `since`
    std::vector<NamedCause> causes;  ///< the first is the answer; the others lie behind it
    std::vector<Check> checks;
    std::vector<Period> history;  ///< oldest first
    DaemonState daemon{};
    std::vector<std::string> untold;  ///< what could not be told, and how to get it
};

/// Concludes from what was @p seen.
Diagnosis diagnose(const Evidence& seen);

/// Exit status of a diagnosis: 0 reached directly, 1 relayed, 2 not reached, 3 not known.
int exitStatus(const Diagnosis& diagnosis);

}  // namespace pelorus::doctor

#endif
