// Reading the server's answer to the question whether to hold back.
#ifndef PELORUS_CLOUD_SLEEP_ANSWER_H
#define PELORUS_CLOUD_SLEEP_ANSWER_H

#include <optional>
#include <string>

namespace pelorus {

struct SleepAnswer {
    enum Kind {
        NO_ACTION,  ///< neither told to wait nor to proceed
        PROCEED,    ///< told not to wait
        WAIT,       ///< told to wait for a time, which may be 0
        NO_TIME,    ///< told to wait, but no time follows the action
        BAD_TIME,   ///< told to wait, but the time is negative or no number that fits
    };
    Kind kind = NO_ACTION;
    std::optional<int> seconds{};  ///< the wait; nothing when the answer does not settle it
};

/// Reads @p text, in which tags are searched, not parsed. A wait overrides a proceed.
[[nodiscard]] SleepAnswer readSleepAnswer(const std::string& text);

}  // namespace pelorus

#endif
