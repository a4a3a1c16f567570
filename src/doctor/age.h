// Spans of time in words.
#ifndef PELORUS_DOCTOR_AGE_H
#define PELORUS_DOCTOR_AGE_H

#include <chrono>
#include <string>

namespace pelorus::doctor {

/// "40 s", "35 min", "3 h 20 min", "1 day", "12 days": rounded down, at most two units. A negative
/// age counts as 0.
[[nodiscard]] std::string ageInWords(std::chrono::seconds age);

}  // namespace pelorus::doctor

#endif
