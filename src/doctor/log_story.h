// The story that a log tells, from the daemon's lines in their order.
#ifndef PELORUS_DOCTOR_LOG_STORY_H
#define PELORUS_DOCTOR_LOG_STORY_H

#include <array>
#include <deque>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "doctor/evidence.h"
#include "doctor/log_line.h"
#include "doctor/log_rules.h"

namespace pelorus::doctor {

/// Follows what the daemon did. Its memory does not grow with the length of the log.
class LogStory {
public:
    /// Whether the device's settings have ports that are forwarded by hand.
    enum class Ports { AUTOMATIC, MANUAL };

    explicit LogStory(Ports kind = Ports::AUTOMATIC) : ports{kind} {}

    /// The next line.
    void take(const LogLine& line);

    /// Adds what is known after the last line to @p evidence, whose `now` is set. The next cycle is
    /// told only if `now` lies in the pause before it.
    void finish(Evidence& evidence);

    [[nodiscard]] int starts() const { return startCount; }
    [[nodiscard]] std::optional<Time> begin() const { return firstLine; }
    [[nodiscard]] std::optional<Time> end() const { return lastLine; }

private:
    // A change that becomes true unless the next lines speak of a failure.
    struct Pending {
        Reach reach{};
        Time since{};
    };

    void settlePending(std::string_view text, Time when);
    void becomePending();
    void apply(const LogRule& rule, Time when, const LogValues& values);
    void keep(const LogRule& rule, std::string_view value);
    void setSigns(const LogRule& rule, Time when, const LogValues& values);
    void set(Sign sign, Time when, const std::string& text);
    void happen(LogEvent event, Time when, const LogValues& values);
    void happenAtGateway(LogEvent event, Time when);
    void concludeGateway();
    void happenInLife(LogEvent event, Time when);
    void happenInRelay(LogEvent event, Time when);
    void clear(const std::vector<Sign>& cleared);
    void start(Time when);
    void switchOff(Time when);
    void end(Time when);
    void endCycle(Time when, std::string_view seconds);
    void takeStatus(std::string_view word, Time when);
    void takeTestAnswer(std::string_view answer, Time when);
    void takeRefusal(std::string_view answer, Time when);
    void failTest(Time when);
    void failService(Time when);
    void blameForPublishing();
    void lose(Time when);
    void failRelay(Time when);
    void explainStart();
    void assumeFrom(std::string_view status);
    void assume(Reach status);
    void become(Reach next, Time when, const std::string& cause);
    [[nodiscard]] bool isInBetween(Reach next, Time when) const;
    [[nodiscard]] Reach reach() const;
    [[nodiscard]] std::string reasonText() const;
    [[nodiscard]] bool serviceFails() const;
    [[nodiscard]] std::string& value(Kept what) { return kept[static_cast<std::size_t>(what)]; }
    [[nodiscard]] std::string filled(std::string_view words, const LogValues& values) const;
    [[nodiscard]] std::string filledWording(std::string_view words, const LogValues& values) const;

    std::map<Sign, Fact> signs;
    std::deque<Period> history;
    std::array<std::string, static_cast<std::size_t>(Kept::COUNT)> kept{};
    std::optional<Pending> pending;
    const Ports ports;
    std::optional<Time> firstLine, lastLine, since, pauseBegin, nextCycle;
    std::optional<Sign> reason;  // the first thing that went wrong in this cycle
    bool passing = false;        // the last period began in this cycle, and may not last
    bool announced = false;      // the last line was a start's first one
    bool signalled = false;      // told to end
    bool ended = true;           // no daemon is there, or it is on its way out
    bool progress = false;       // since the last start there was a line of severity 6
    bool natpmp = false;         // the gateway speaks it, as far as the log tells
    bool published = false;      // since the last start
    bool orphan = false;         // an earlier daemon ended suddenly and left its tunnel
    bool tornDown = false;       // no connection of this cycle's beginning is left
    int startCount = 0;
};

}  // namespace pelorus::doctor

#endif
