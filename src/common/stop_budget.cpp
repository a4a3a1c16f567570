#include "common/stop_budget.h"

#include <algorithm>
#include <chrono>
#include <limits>
#include <optional>

#include "common/termination.h"

namespace pelorus {

namespace {

using Clock = std::chrono::steady_clock;

std::optional<Clock::time_point> budgetEnd;

}  // namespace

int stopBudgetLeft() {
    if (!terminationRequested()) return std::numeric_limits<int>::max();
    if (!budgetEnd) renewStopBudget(kCycleBudget);
    const auto left = std::chrono::ceil<std::chrono::seconds>(*budgetEnd - Clock::now());
    return std::max(0, static_cast<int>(left.count()));
}

bool stopBudgetSpent() {
    return stopBudgetLeft() == 0;
}

void renewStopBudget(int seconds) {
    budgetEnd = Clock::now() + std::chrono::seconds(seconds);
}

}  // namespace pelorus
