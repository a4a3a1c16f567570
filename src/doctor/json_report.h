// The diagnosis for programs.
#ifndef PELORUS_DOCTOR_JSON_REPORT_H
#define PELORUS_DOCTOR_JSON_REPORT_H

#include <string>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

/// Everything in @p diagnosis as one JSON object, with a newline at its end; docs/doctor.md
/// describes it. What is not UTF-8 is replaced.
[[nodiscard]] std::string jsonReport(const Diagnosis& diagnosis);

}  // namespace pelorus::doctor

#endif
