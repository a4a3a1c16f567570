// One line of a system log.
#ifndef PELORUS_DOCTOR_LOG_LINE_H
#define PELORUS_DOCTOR_LOG_LINE_H

#include <optional>
#include <string_view>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// A line that the daemon logged.
struct LogLine {
    Time when{};
    std::string_view text;    ///< without trailing blanks; part of the line that was read
    std::string_view host{};  ///< that logged it; empty if the line does not tell
    bool isYearKnown = true;  ///< false: the stamp has none, see takeStamp()
    bool isTwice = false;     ///< at the end of summer time: it may be an hour later, too
};

/// Reads the time stamp at the start of @p line: classic ("Nov  2 12:07:01", local time, in the
/// latest year that does not lie in the future of @p now), RFC 3339 or seconds with a fraction, all
/// also after "<134>". Removes it from @p line. Empty when there is none, or it is more than a day after @p now.
std::optional<Time> takeStamp(std::string_view& line, Time now);

/// Reads @p line if it is the daemon's: the program must be called exactly "Pelorus" or "pelorus",
/// with or without a pid.
std::optional<LogLine> readLogLine(std::string_view line, Time now);

/// A line that the daemon seems to have logged, but whose stamp cannot be read, or is more than a day
/// after @p now.
bool lacksStamp(std::string_view line, Time now);

}  // namespace pelorus::doctor

#endif
