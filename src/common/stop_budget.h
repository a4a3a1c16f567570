// How long gateways may hold up a daemon that is told to end.
#ifndef PELORUS_COMMON_STOP_BUDGET_H
#define PELORUS_COMMON_STOP_BUDGET_H

#include <chrono>

namespace pelorus {

/// What the calls of a gateway may take together in the cycle that a termination signal ends.
inline constexpr std::chrono::seconds kCycleBudget{10};
/// What they may take together in the final clean-up.
inline constexpr std::chrono::seconds kCleanUpBudget{120};

/// What is left for the calls of a gateway, at least 0; without end while no termination signal has
/// arrived. The first call after the signal starts a budget of kCycleBudget.
[[nodiscard]] std::chrono::nanoseconds stopBudgetLeft();
/// True when nothing is left: searches and enumerations end. A request may still be made: through UPnP it
/// fails unless it is answered at once, through NAT-PMP it waits as usual.
[[nodiscard]] bool stopBudgetSpent();
/// Takes @p time from what is left. Pauses, and what the daemon asks of others, do not count.
void spendStopBudget(std::chrono::nanoseconds time);
/// Replaces what is left.
void renewStopBudget(std::chrono::nanoseconds budget);

}  // namespace pelorus

#endif
