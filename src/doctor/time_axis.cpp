#include "doctor/time_axis.h"

#include <algorithm>

#include "doctor/local_time.h"

namespace pelorus::doctor {

namespace {

constexpr int kMinute = 60, kHour = 60 * kMinute, kDay = 24 * kHour;

constexpr int kSteps[]{
    1,         2,           5,           10,           15,           30,
    kMinute,   2 * kMinute, 5 * kMinute, 10 * kMinute, 15 * kMinute, 30 * kMinute,
    kHour,     2 * kHour,   3 * kHour,   6 * kHour,    12 * kHour,   kDay,
    2 * kDay,  7 * kDay,    14 * kDay,   28 * kDay,    91 * kDay,    182 * kDay,
    365 * kDay};

// The first step of which few enough fit; years where none does.
int stepFor(std::chrono::seconds span, std::size_t most) {
    for (const int step : kSteps) {
        if (static_cast<std::size_t>(span.count() / step) < most) return step;
    }
    const auto least = static_cast<int>(span.count() / (365L * kDay) / static_cast<long>(most)) + 1;
    return least * 365 * kDay;
}

// Some days after the midnight that begins a moment's day, whatever the length of those days.
Time midnight(Time of, int daysLater) {
    std::tm day = localTime(of);
    day.tm_mday += daysLater;
    day.tm_hour = day.tm_min = day.tm_sec = 0;
    day.tm_isdst = -1;
    const std::time_t seconds = std::mktime(&day);
    return std::chrono::time_point_cast<std::chrono::seconds>(
        std::chrono::system_clock::from_time_t(seconds));
}

std::string labelFor(Time when, Time end, int step) {
    const std::tm time = localTime(when);
    if (step < kMinute && time.tm_sec != 0) return timeWithSeconds(when);
    const bool isMidnight = time.tm_hour == 0 && time.tm_min == 0 && time.tm_sec == 0;
    if (step < kDay && !isMidnight) return timeOfDay(when);
    return dayInWords(when, end);
}

}  // namespace

std::vector<Tick> timeTicks(Time begin, Time end, std::size_t most) {
    const int step = stepFor(end - begin, most);
    std::vector<Tick> ticks;
    const Time first = midnight(begin, 0);
    for (int number = 0; ticks.size() <= most; ++number) {
        const Time when = step < kDay ? first + std::chrono::seconds{step} * number
                                      : midnight(first, number * (step / kDay));
        if (when > end) break;
        if (when >= begin) ticks.push_back({when, labelFor(when, end, step)});
    }
    return ticks;
}

}  // namespace pelorus::doctor
