#include "common/stop_budget.h"

#include <algorithm>
#include <optional>

#include "common/termination.h"

namespace pelorus {

namespace {

using std::chrono::nanoseconds;

std::optional<nanoseconds> left;

}  // namespace

nanoseconds stopBudgetLeft() {
    if (!terminationRequested()) return nanoseconds::max();
    if (!left) left = kCycleBudget;
    return std::max(*left, nanoseconds::zero());
}

bool stopBudgetSpent() {
    return stopBudgetLeft() == nanoseconds::zero();
}

void spendStopBudget(nanoseconds time) {
    if (left) *left -= time;
}

void renewStopBudget(nanoseconds budget) {
    left = budget;
}

}  // namespace pelorus
