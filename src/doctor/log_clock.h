// The device's clock, as the stamps of a log show it.
#ifndef PELORUS_DOCTOR_LOG_CLOCK_H
#define PELORUS_DOCTOR_LOG_CLOCK_H

#include <optional>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// A clock that jumps by more than this, right after a start, was not set before.
inline constexpr std::chrono::hours kUnsetClock{24 * 90};

/// Turns stamps into times that only go back where the clock was set right.
class LogClock {
public:
    /// What was told to have begun at `from` or later began at `to`.
    struct Correction {
        Time from{}, to{};
    };

    /// The time of the next line, stamped @p stamp. @p start is when the daemon's current run
    /// began, if that was logged. `correction` is set if earlier times were wrong.
    Time take(Time stamp, std::optional<Time> start);

    std::optional<Correction> correction;  ///< of the last take()
    int jumps = 0;                         ///< how often the clock was set, or lost

private:
    void jumpBack(Time stamp);
    void goOnLost(Time stamp);

    std::optional<Time> last;         // as stamped
    Time now{};                       // as told
    std::optional<Time> lostSince{};  // as stamped: a machine without its own clock was restarted
};

}  // namespace pelorus::doctor

#endif
