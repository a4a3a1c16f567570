// How long gateways may hold up a daemon that is told to end.
#ifndef PELORUS_COMMON_STOP_BUDGET_H
#define PELORUS_COMMON_STOP_BUDGET_H

namespace pelorus {

/// Seconds for all that a cycle still asks of a gateway after a termination signal.
inline constexpr int kCycleBudget = 10;
/// Seconds for what the final clean-up asks of it.
inline constexpr int kCleanUpBudget = 50;

/// Seconds left, INT_MAX while no termination signal has arrived. The first call after the signal
/// starts a budget of kCycleBudget.
[[nodiscard]] int stopBudgetLeft();
/// True when nothing is left: searches and enumerations end. A request may still be made; it fails
/// unless it is answered at once.
[[nodiscard]] bool stopBudgetSpent();
/// Replaces what is left by @p seconds from now.
void renewStopBudget(int seconds);

}  // namespace pelorus

#endif
