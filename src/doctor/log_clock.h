// The device's clock, as the stamps of a log show it.
#ifndef PELORUS_DOCTOR_LOG_CLOCK_H
#define PELORUS_DOCTOR_LOG_CLOCK_H

#include <optional>

#include "doctor/log_line.h"

namespace pelorus::doctor {

/// A clock that jumps by more than this, right after a start, was not set before.
inline constexpr std::chrono::hours kUnsetClock{24 * 90};

/// Turns stamps into times that only go back where the clock was set right.
class LogClock {
public:
    /// What was told to have been at `from` or later was at `to`; all else was `back` earlier.
    struct Correction {
        Time from{}, to{};
        std::chrono::seconds back{};

        [[nodiscard]] Time of(Time when) const { return when >= from ? to : when - back; }
    };

    /// The time of @p line. @p start is when the daemon's current run began, if that was logged.
    /// `correction` is set if earlier times were wrong.
    Time take(const LogLine& line, std::optional<Time> start);

    /// The machine was restarted, and its clock is not set yet.
    [[nodiscard]] bool isLost() const { return lostSince.has_value(); }

    std::optional<Correction> correction;  ///< of the last take()
    int jumps = 0;                         ///< how often the clock was set, or lost

private:
    [[nodiscard]] Time stampOf(const LogLine& line) const;
    void jumpBack(const LogLine& line);
    void goOnLost(Time stamp);

    std::optional<Time> last;         // as stamped
    Time now{};                       // as told
    std::optional<Time> lostSince{};  // as stamped: a machine without its own clock was restarted
};

}  // namespace pelorus::doctor

#endif
