// Time of a test: time, gettimeofday, sleep and ppoll end here. Only pauses and advance() move it,
// so that instants are exact.
#ifndef PELORUS_SUPPORT_VIRTUAL_CLOCK_H
#define PELORUS_SUPPORT_VIRTUAL_CLOCK_H

#include <cstdint>
#include <ctime>
#include <map>

#include "support/fake.h"

namespace pelorus::support {

constexpr std::int64_t kMicrosPerSecond = 1'000'000;

class VirtualClock : public Single<VirtualClock> {
public:
    using Action = std::function<void()>;
    static constexpr time_t kStart = 1'700'000'000;  ///< what time() says when a test begins

    /// Seconds since the epoch, and since the test began.
    [[nodiscard]] time_t now() const { return static_cast<time_t>(micros / kMicrosPerSecond); }
    [[nodiscard]] time_t elapsed() const { return now() - kStart; }
    void advance(time_t seconds) { micros += seconds * kMicrosPerSecond; }
    void set(time_t seconds) { micros = seconds * kMicrosPerSecond; }

    /// The length of every sleep and timed ppoll so far, as asked for, in whole seconds.
    [[nodiscard]] const std::vector<long>& pauses() const { return asked; }

    /// Runs @p action as the @p number th pause from now begins. A blocked signal raised there ends
    /// the pause if its mask lets it in; one that is not blocked comes too early to end it.
    void duringPause(int number, Action action) {
        actions[asked.size() + static_cast<std::size_t>(number)] = std::move(action);
    }

    /// Runs @p action, with the length in seconds, as each following pause begins.
    void onPause(std::function<void(long)> action) { hook = std::move(action); }
    /// Forgets the lengths of the pauses so far, not the time.
    void clear() { asked.clear(); }

    /// Pauses; true when a signal ended it, at once. A null mask lets none in.
    bool wait(std::int64_t waitMicros, const sigset_t* mask);

    std::int64_t micros = kStart * kMicrosPerSecond;

private:
    std::vector<long> asked;
    std::map<std::size_t, Action> actions;
    std::function<void(long)> hook;
};

}  // namespace pelorus::support

#endif
