// Words for the ways in which a device is reached.
#ifndef PELORUS_DOCTOR_REACH_WORDS_H
#define PELORUS_DOCTOR_REACH_WORDS_H

#include <array>

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct ReachWords {
    Reach reach{};
    const char* name{};     ///< stable: for programs
    const char* shortly{};  ///< "direct"
    const char* fully{};    ///< "reached directly"
};

/// In the order in which a legend lists them.
inline constexpr std::array<ReachWords, 6> kReachWords{{
    {Reach::DIRECT, "direct", "direct", "reached directly"},
    {Reach::RELAYED, "relayed", "relayed", "relayed"},
    {Reach::NOT_REACHED, "not-reached", "not reached", "not reached"},
    {Reach::SWITCHED_OFF, "switched-off", "switched off", "switched off"},
    {Reach::NOT_RUNNING, "not-running", "not running", "not running"},
    {Reach::UNKNOWN, "unknown", "unknown", "not known"},
}};

/// The words for @p reach.
[[nodiscard]] constexpr const ReachWords& wordsFor(Reach reach) {
    for (const ReachWords& words : kReachWords) {
        if (words.reach == reach) return words;
    }
    return kReachWords.back();
}

}  // namespace pelorus::doctor

#endif
