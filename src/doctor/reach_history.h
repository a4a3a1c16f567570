// How a device was reached, one period after the other.
#ifndef PELORUS_DOCTOR_REACH_HISTORY_H
#define PELORUS_DOCTOR_REACH_HISTORY_H

#include <cstddef>
#include <deque>
#include <string>
#include <string_view>

#include "doctor/evidence.h"
#include "doctor/log_clock.h"

namespace pelorus::doctor {

/// A cycle may last that long without a result: a relay that does not come up takes nearly as long.
inline constexpr std::chrono::minutes kAttemptTime{6};
/// The cause of the period that a start of the daemon begins.
inline constexpr std::string_view kDaemonStarted = "the daemon started";

/// The last 2000 periods, drawn together: what lasts only until the next result of the same cycle
/// is part of the change.
class ReachHistory {
public:
    /// From @p next.since on it is so. Does nothing if it was so already.
    void add(Period next);

    /// How it was when the log began, unless something is known already.
    void assume(Period first);

    /// The clock was wrong.
    void correct(const LogClock::Correction& correction);

    /// The cycle, or the attempt, is over: what its last period says lasts.
    void settle() { passing = false; }

    /// Gives a period without a way in that began in this cycle the cause @p reason, if it has none.
    void explainLoss(const std::string& reason);

    /// The first cycle of a run ended without a way in: says why, unless @p reason is empty.
    void explainStart(const std::string& reason);

    /// UNKNOWN before the first period.
    [[nodiscard]] Reach reach() const;

    /// Nothing has come since a start of the daemon.
    [[nodiscard]] bool isAtStart() const;

    /// There is no result yet, and at @p now there should be one.
    [[nodiscard]] bool isOverdue(Time now) const;

    /// Oldest first.
    [[nodiscard]] const std::deque<Period>& periods() const { return all; }
    /// How many periods before these are not kept.
    [[nodiscard]] std::size_t dropped() const { return forgotten; }

private:
    [[nodiscard]] bool isInBetween(Reach next, Time when) const;

    std::deque<Period> all;
    std::size_t forgotten = 0;
    bool passing = false;  // the last period began in this cycle, and may not last
};

}  // namespace pelorus::doctor

#endif
