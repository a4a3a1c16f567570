// The changes of status as a table for people.
#ifndef PELORUS_DOCTOR_HISTORY_TEXT_H
#define PELORUS_DOCTOR_HISTORY_TEXT_H

#include <cstddef>
#include <string>
#include <vector>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

/// The last @p most periods, the newest last, in lines of at most @p width characters; days are
/// named from @p today.
[[nodiscard]] std::vector<std::string> historyText(const Diagnosis& diagnosis,
                                                   std::size_t most,
                                                   std::size_t width,
                                                   Time today);

}  // namespace pelorus::doctor

#endif
