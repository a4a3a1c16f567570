// Time of a test: time, gettimeofday, sleep and ppoll end here. It moves by pauses and by
// advance() only, so that instants are exact.
#ifndef PELORUS_SUPPORT_VIRTUAL_CLOCK_H
#define PELORUS_SUPPORT_VIRTUAL_CLOCK_H

#include <sys/time.h>

#include <csignal>
#include <ctime>
#include <functional>
#include <map>
#include <vector>

namespace pelorus::support {

class VirtualClock {
public:
    using Action = std::function<void()>;
    static constexpr time_t kStart = 1'700'000'000;  ///< what time() says when a test begins
    static constexpr int kMostPauses = 100'000;      ///< more are taken for an endless loop

    static VirtualClock& get();

    /// Seconds since the epoch, and since the test began.
    [[nodiscard]] time_t now() const { return static_cast<time_t>(micros / kMicrosPerSecond); }
    [[nodiscard]] time_t elapsed() const { return now() - kStart; }
    void advance(time_t seconds) { micros += seconds * kMicrosPerSecond; }
    /// Jumps, also backwards, without running the actions in between.
    void set(time_t seconds) { micros = seconds * kMicrosPerSecond; }

    /// The length of every sleep and timed ppoll so far, as asked for, in whole seconds.
    [[nodiscard]] const std::vector<long>& pauses() const { return asked; }

    /// Runs @p action as the @p number th pause (1: the next one) is entered, when the sleep or
    /// ppoll call was made but does not wait yet: a signal raised here and not blocked is missed
    /// by the pause, as in the real world.
    void beforePause(int number, Action action);
    /// Runs @p action within the @p number th pause from now, when nothing of it has passed. A
    /// signal raised here by raiseSignal() ends the pause.
    void duringPause(int number, Action action);
    /// Runs @p action when a pause reaches the instant @p seconds (as of now()).
    void at(time_t seconds, Action action) { timed.emplace(seconds, std::move(action)); }
    /// Delivers @p signal to this process. Use it in the actions above.
    void raiseSignal(int signal);

    void reset();

    struct Waited {
        bool interrupted;  ///< by a signal
        long left;         ///< microseconds that did not pass
    };
    /// Pauses, for fakes of other waiting calls. Pending signals that @p mask lets through are
    /// delivered, as in ppoll; null leaves the mask of the process.
    Waited wait(long waitMicros, const sigset_t* mask);

    [[nodiscard]] timeval timeOfDay() const;

private:
    static constexpr long kMicrosPerSecond = 1'000'000;
    VirtualClock() = default;

    void enterPause(long waitMicros);
    static bool deliverPending(const sigset_t* mask);

    long micros = kStart * kMicrosPerSecond;
    std::vector<long> asked;
    std::multimap<std::size_t, Action> before;
    std::multimap<std::size_t, Action> during;
    std::multimap<time_t, Action> timed;
    bool interrupted = false;
};

}  // namespace pelorus::support

#endif
