#include "doctor/reach_history.h"

#include <utility>

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr std::size_t kMostPeriods = 2000;
constexpr auto kShortRun = 1min;  // of a daemon that ends without a result

}  // namespace

void ReachHistory::add(Period next) {
    const Reach reached = next.reach;
    if (!all.empty()) {
        const Period& last = all.back();
        const bool isSame = last.reach == reached;
        if (isSame && (last.address == next.address || next.address.empty())) return;
        if (isSame && !last.address.empty()) next.cause = "the address changed";
    }
    if (!all.empty() && isInBetween(reached, next.since)) all.pop_back();
    const bool goesOn =
        !all.empty() && all.back().reach == reached && all.back().address == next.address;
    if (!goesOn) all.push_back(std::move(next));
    if (all.size() > kMostPeriods) {
        all.pop_front();
        ++forgotten;
    }
    passing = reached == Reach::NOT_REACHED;
}

void ReachHistory::assume(Period first) {
    if (!all.empty()) return;
    all.push_back(std::move(first));
    passing = false;
}

void ReachHistory::correct(const LogClock::Correction& correction) {
    for (Period& period : all) period.since = correction.of(period.since);
}

void ReachHistory::explainLoss(const std::string& reason) {
    const bool isOpen = passing && reach() == Reach::NOT_REACHED && all.back().cause.empty();
    if (isOpen) all.back().cause = reason;
}

void ReachHistory::explainStart(const std::string& reason) {
    if (passing && isAtStart() && !reason.empty()) all.back().cause = reason;
}

Reach ReachHistory::reach() const {
    return all.empty() ? Reach::UNKNOWN : all.back().reach;
}

bool ReachHistory::isAtStart() const {
    return reach() == Reach::NOT_REACHED && all.back().cause == kDaemonStarted;
}

bool ReachHistory::isOverdue(Time now) const {
    return passing && now - all.back().since > kAttemptTime;
}

// Unless it is all that shows that there was a change.
bool ReachHistory::isInBetween(Reach next, Time when) const {
    const Period& last = all.back();
    const auto length = when - last.since;
    if (!passing || last.reach != Reach::NOT_REACHED || length > kAttemptTime) return false;
    if (next != Reach::DIRECT && next != Reach::RELAYED) return isAtStart() && length <= kShortRun;
    return all.size() == 1 || all[all.size() - 2].reach != next;
}

}  // namespace pelorus::doctor
