// The system's journal, read through journalctl.
#ifndef PELORUS_DOCTOR_JOURNAL_H
#define PELORUS_DOCTOR_JOURNAL_H

#include <chrono>
#include <string>

#include "doctor/log_source.h"

namespace pelorus::doctor {

/// The lines of the system's journal that the daemon logged. Gives up when no line comes for
/// @p patience. Returns why the journal could not be read to its end; empty when it could, or when
/// there is no journal.
[[nodiscard]] std::string readJournal(const LineFilter::Taker& taker,
                                      std::chrono::milliseconds patience);

}  // namespace pelorus::doctor

#endif
