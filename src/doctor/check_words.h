// Words for what was checked, and for where it was seen.
#ifndef PELORUS_DOCTOR_CHECK_WORDS_H
#define PELORUS_DOCTOR_CHECK_WORDS_H

#include <string_view>

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct Words {
    std::string_view name;      ///< stable: for programs
    std::string_view inReport;  ///< for people
};

/// The words for @p source.
[[nodiscard]] constexpr Words wordsFor(Source source) {
    switch (source) {
        case Source::NOW:
            return {"now", "seen now"};
        case Source::LOG:
            return {"log", "log"};
        case Source::SETTINGS:
            break;
    }
    return {"settings", "settings"};
}

/// The words for @p verdict.
[[nodiscard]] constexpr Words wordsFor(Check::Verdict verdict) {
    switch (verdict) {
        case Check::Verdict::OK:
            return {"ok", "ok"};
        case Check::Verdict::PROBLEM:
            return {"problem", "PROBLEM"};
        case Check::Verdict::NOT_SEEN:
            break;
    }
    return {"not-seen", "not seen"};
}

}  // namespace pelorus::doctor

#endif
