#include "doctor/diagnosis.h"

namespace pelorus::doctor {

Diagnosis diagnose(const Evidence& evidence) {
    Diagnosis diagnosis;
    diagnosis.now = evidence.now;
    return diagnosis;
}

int exitStatus(const Diagnosis& /*diagnosis*/) {
    return 3;
}

}  // namespace pelorus::doctor
