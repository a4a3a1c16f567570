// The story that a log tells, from the daemon's lines in their order.
#ifndef PELORUS_DOCTOR_LOG_STORY_H
#define PELORUS_DOCTOR_LOG_STORY_H

#include <optional>
#include <string>
#include <string_view>

#include "doctor/evidence.h"
#include "doctor/log_clock.h"
#include "doctor/log_gateway.h"
#include "doctor/log_line.h"
#include "doctor/log_rules.h"
#include "doctor/log_signs.h"
#include "doctor/reach_history.h"

namespace pelorus::doctor {

/// Follows what the daemon did. Its memory does not grow with the length of the log.
class LogStory {
public:
    using Ports = LogGateway::Ports;

    explicit LogStory(Ports kind = Ports::AUTOMATIC) : gateway{kind} {}

    /// The next line.
    void take(const LogLine& line);

    /// Adds what is known after the last line to @p evidence, whose `now` is set. The next cycle is
    /// told only if `now` lies in the pause before it.
    void finish(Evidence& evidence);

    [[nodiscard]] int clockJumps() const { return clock.jumps; }
    [[nodiscard]] int starts() const { return startCount; }
    /// Too few lines are logged to follow what happens: no results, by what the last start said.
    [[nodiscard]] bool isQuiet() const { return level < kLeastLevel; }
    /// A log from elsewhere goes on for long after the daemon's last line.
    [[nodiscard]] bool isSilent() const { return silent; }
    /// The severity up to which the daemon logs.
    [[nodiscard]] int severity() const { return level; }
    [[nodiscard]] std::optional<Time> begin() const { return firstLine; }
    [[nodiscard]] std::optional<Time> end() const { return lastLine; }

private:
    static constexpr int kLeastLevel = 5;  // the daemon's default

    // A change that becomes true unless the next lines speak of a failure.
    struct Pending {
        Reach reach{};
        Time since{};
    };

    [[nodiscard]] Time timeOf(const LogLine& line);
    void correct(const LogClock::Correction& correction);
    void takeText(std::string_view text, Time when);
    void settleTest(Time when);
    void endInSilence(const Evidence& evidence);
    void settlePending(std::string_view text, Time when);
    void becomePending();
    void tearDown(Time when);
    [[nodiscard]] bool isPending(Reach reach) const { return pending && pending->reach == reach; }
    void apply(const LogRule& rule, Time when, const LogValues& values);
    void happen(LogEvent event, Time when, const LogValues& values);
    void happenInLife(LogEvent event, Time when);
    void happenInRelay(LogEvent event, Time when);
    void start(Time when);
    void endSuddenly(Time when);
    void switchOff(Time when);
    void end(Time when);
    void endCycle(Time when, std::string_view seconds);
    void takeStatus(std::string_view word, Time when);
    void takeTestAnswer(std::string_view answer, Time when);
    void lose(Time when);
    void giveUp(Time when);
    void failRelay(Time when);
    void assumeFrom(std::string_view status);
    void assume(Reach status);
    void become(Reach next, Time when, const std::string& cause);
    [[nodiscard]] std::string addressOf(Reach reach) const;

    LogClock clock;
    LogSigns signs;
    ReachHistory history;
    std::optional<Pending> pending;
    LogGateway gateway;
    std::optional<Time> firstLine, lastLine, since, pauseBegin, nextCycle;
    std::optional<Time> lastOfRun;    // the last line, but for those that precede a start
    std::optional<Time> steadySince;  // no long pause from here to lastOfRun
    std::optional<Time> passed;       // a port, in a log that has not told yet how it was before
    int level = kLeastLevel;
    bool announced = false;  // the last line was a start's first one
    bool signalled = false;  // told to end
    bool ended = true;       // no daemon is there, or it is on its way out
    bool progress = false;   // since the last start there was a line of severity 6
    bool silent = false;
    bool orphan = false;    // an earlier daemon ended suddenly and may have left its tunnel
    bool tornDown = false;  // no connection of this cycle's beginning is left
    Reach tornFrom = Reach::UNKNOWN;  // how it was reached before the names, or the address, failed
    int startCount = 0;
};

}  // namespace pelorus::doctor

#endif
