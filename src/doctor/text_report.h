// The diagnosis as a note for people.
#ifndef PELORUS_DOCTOR_TEXT_REPORT_H
#define PELORUS_DOCTOR_TEXT_REPORT_H

#include <optional>
#include <string>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

inline constexpr int kLeastTextWidth = 40;
inline constexpr int kMostTextWidth = 200;
inline constexpr int kLeastTextHeight = 20;

/// How the text is laid out.
struct Layout {
    int width = 100;              ///< characters; taken as kLeastTextWidth to kMostTextWidth
    bool colours = false;         ///< of a terminal, for verdicts and the headline
    std::optional<Time> today{};  ///< the reader's clock; without it the diagnosis's
    int height = 40;              ///< lines, at least kLeastTextHeight; more only if it must be
};

/// @p diagnosis in about as many lines as a screen has, each with a newline.
[[nodiscard]] std::string textReport(const Diagnosis& diagnosis, const Layout& layout);

}  // namespace pelorus::doctor

#endif
