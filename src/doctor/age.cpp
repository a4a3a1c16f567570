#include "doctor/age.h"

#include <algorithm>

namespace pelorus::doctor {

namespace {

constexpr auto kMinute = std::chrono::seconds{60}.count();
constexpr auto kHour = 60 * kMinute;
constexpr auto kDay = 24 * kHour;
constexpr auto kWeek = 7;  // days: from then on the hours do not matter

}  // namespace

std::string ageInWords(std::chrono::seconds age) {
    const auto seconds = std::max(age, std::chrono::seconds{0}).count();
    if (seconds < kMinute) return std::to_string(seconds) + " s";
    if (seconds < kHour) return std::to_string(seconds / kMinute) + " min";
    if (seconds < kDay) {
        const auto minutes = seconds % kHour / kMinute;
        const std::string hours = std::to_string(seconds / kHour) + " h";
        return minutes == 0 ? hours : hours + " " + std::to_string(minutes) + " min";
    }
    const auto days = seconds / kDay;
    const auto hours = seconds % kDay / kHour;
    const std::string text = std::to_string(days) + (days == 1 ? " day" : " days");
    return days >= kWeek || hours == 0 ? text : text + " " + std::to_string(hours) + " h";
}

}  // namespace pelorus::doctor
