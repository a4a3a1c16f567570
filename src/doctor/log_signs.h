// What a log last said about each matter that causes are concluded from.
#ifndef PELORUS_DOCTOR_LOG_SIGNS_H
#define PELORUS_DOCTOR_LOG_SIGNS_H

#include <array>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "doctor/evidence.h"
#include "doctor/log_clock.h"
#include "doctor/log_rules.h"

namespace pelorus::doctor {

/// Whether @p sign says how an attempt at the direct way ended.
bool isOutcome(Sign sign);

/// The signs of the LOGGED_... kind, each with the time of the last line that showed it, the values
/// that later lines need, and the reason: the first thing that went wrong in the current cycle, or,
/// where cycles are not logged, in the last minutes.
class LogSigns {
public:
    /// Keeps, clears and sets what @p rule says of a line with these @p values.
    void take(const LogRule& rule, Time when, const LogValues& values);

    /// Sets @p sign. Becomes the reason if there is none yet and it explains anything.
    void set(Sign sign, Time when, const std::string& text);

    /// Takes them away. Unless a test failed by it, one that was the reason leaves that to the next
    /// thing that went wrong.
    void clear(const std::vector<Sign>& cleared);

    /// A new run of the daemon: no sign and no reason is left.
    void forget();

    /// The clock was wrong.
    void correct(const LogClock::Correction& correction);

    /// A new cycle, or a device that is reached directly.
    void forgetReason() { reason.reset(); }

    /// The service's answer to a port test. True if the port passed.
    bool takeTestAnswer(std::string_view answer, Time when);

    /// The port test as a whole failed. @p byHand: it needed no gateway that speaks a protocol.
    void failTest(Time when, bool byHand);

    /// A request to the service got no answer.
    void failService(Time when);

    /// No answer to a port test.
    void failTestRequest(Time when);

    /// The answer with which the back end refused what it was told.
    void takeRefusal(std::string_view answer, Time when);

    /// The ports could not be published. @p stored: when the service had taken their record; unset
    /// if it had not.
    void failPublishing(std::optional<Time> stored);

    /// NAT-PMP, the last thing tried, does not answer either.
    void failGateway();

    /// @p sign is the reason from now on, whatever was it before.
    void blame(Sign sign);

    /// From @p when on, the next cycle looks at the names. A failure is logged at every severity.
    void expectLook(Time when) { lookExpected = when; }

    /// The relay failed too. It is the reason where a relay would have been the way out.
    void blameRelay();

    [[nodiscard]] bool has(Sign sign) const { return signs.count(sign) != 0; }

    /// The reason's text; empty if there is none.
    [[nodiscard]] std::string reasonText() const;

    /// The address that was tested last, else the gateway's; empty if neither was logged.
    [[nodiscard]] std::string address() const;

    /// What still holds at @p now: without what a later attempt has replaced, and what a daemon that
    /// still runs would have logged again. @p byHand: ports are forwarded by hand, so that the
    /// gateway's signs replace nothing.
    [[nodiscard]] std::map<Sign, Fact> lasting(Time now, bool byHand) const;

private:
    struct Reason {
        Sign sign{};
        Time when{};
        std::string text{};  // set when a test failed by it: then it outlives its sign
    };

    [[nodiscard]] std::string& value(Kept what) { return kept[static_cast<std::size_t>(what)]; }
    [[nodiscard]] const std::string& value(Kept what) const {
        return kept[static_cast<std::size_t>(what)];
    }
    [[nodiscard]] bool serviceFails() const;
    [[nodiscard]] bool isOfAttempt(Sign sign, Time when) const;
    [[nodiscard]] bool isReplaced(Sign sign, bool byHand) const;
    [[nodiscard]] bool isEarlier(Sign sign, Sign later) const;
    [[nodiscard]] bool isNameRight(Sign sign, Time when, Time now) const;
    void concludeBackEnd(const LogRule& rule);
    [[nodiscard]] std::string filled(std::string_view words, const LogValues& values) const;
    [[nodiscard]] std::string filledWording(std::string_view words, const LogValues& values) const;

    std::map<Sign, Fact> signs;
    std::map<Sign, int> cycles;  // in which each was last shown
    std::array<std::string, static_cast<std::size_t>(Kept::COUNT)> kept{};
    std::optional<Reason> reason;
    std::optional<Time> lookExpected;
    int cycle = 0;             // of this run; 0 as long as none was logged
    bool backEndTold = false;  // a failure to do so would be the next thing logged
};

}  // namespace pelorus::doctor

#endif
