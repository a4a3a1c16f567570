// Moments for people, in local time, and for programs.
#ifndef PELORUS_DOCTOR_LOCAL_TIME_H
#define PELORUS_DOCTOR_LOCAL_TIME_H

#include <ctime>
#include <string>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// @p when in local time.
[[nodiscard]] std::tm localTime(Time when);

/// "12:07".
[[nodiscard]] std::string timeOfDay(Time when);

/// "12:07:31".
[[nodiscard]] std::string timeWithSeconds(Time when);

/// "21 Nov", with the year unless it is that of @p today.
[[nodiscard]] std::string dayInWords(Time when, Time today);

/// "12:07 today", "12:07 yesterday", "12:07 on 21 Nov".
[[nodiscard]] std::string momentInWords(Time when, Time today);

/// "12:07" of today, otherwise "21 Nov 12:07".
[[nodiscard]] std::string momentShortly(Time when, Time today);

/// "3 h 20 min"; "0 s" where @p until is not after @p since, as when the clock was set.
[[nodiscard]] std::string timeBetween(Time since, Time until);

/// "2026-11-21T12:07:00+01:00".
[[nodiscard]] std::string rfc3339(Time when);

}  // namespace pelorus::doctor

#endif
