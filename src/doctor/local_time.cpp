#include "doctor/local_time.h"

#include <algorithm>
#include <array>
#include <cstdlib>

#include "doctor/age.h"

namespace pelorus::doctor {

namespace {

constexpr int kFirstYear = 1900;  // of tm_year
constexpr int kMinute = 60;       // seconds, and of an hour

std::string digits(int number, std::size_t width) {
    std::string text = std::to_string(number);
    if (text.size() < width) text.insert(0, width - text.size(), '0');
    return text;
}

bool isSameDay(const std::tm& one, const std::tm& other) {
    return one.tm_year == other.tm_year && one.tm_yday == other.tm_yday;
}

}  // namespace

std::tm localTime(Time when) {
    const std::time_t seconds = std::chrono::system_clock::to_time_t(when);
    std::tm time{};
    static_cast<void>(localtime_r(&seconds, &time));
    return time;
}

std::string timeOfDay(Time when) {
    const std::tm time = localTime(when);
    return digits(time.tm_hour, 2) + ":" + digits(time.tm_min, 2);
}

std::string timeWithSeconds(Time when) {
    return timeOfDay(when) + ":" + digits(localTime(when).tm_sec, 2);
}

std::string dayInWords(Time when, Time today) {
    constexpr std::array<const char*, 12> kMonths{"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                                  "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
    const std::tm time = localTime(when);
    const std::string day =
        std::to_string(time.tm_mday) + " " + kMonths.at(static_cast<std::size_t>(time.tm_mon));
    const bool isThisYear = time.tm_year == localTime(today).tm_year;
    return isThisYear ? day : day + " " + digits(time.tm_year + kFirstYear, 4);
}

std::string momentInWords(Time when, Time today) {
    std::tm yesterday = localTime(today);
    if (isSameDay(localTime(when), localTime(today))) return timeOfDay(when) + " today";
    --yesterday.tm_mday;
    yesterday.tm_hour = 12;
    yesterday.tm_isdst = -1;
    static_cast<void>(std::mktime(&yesterday));
    if (isSameDay(localTime(when), yesterday)) return timeOfDay(when) + " yesterday";
    return timeOfDay(when) + " on " + dayInWords(when, today);
}

std::string momentShortly(Time when, Time today) {
    const std::string time = timeOfDay(when);
    return isSameDay(localTime(when), localTime(today)) ? time
                                                        : dayInWords(when, today) + " " + time;
}

std::string timeBetween(Time since, Time until) {
    return ageInWords(std::max(until - since, std::chrono::seconds{0}));
}

std::string rfc3339(Time when) {
    const std::tm time = localTime(when);
    const auto offset = static_cast<int>(std::labs(time.tm_gmtoff) / kMinute);
    return digits(time.tm_year + kFirstYear, 4) + "-" + digits(time.tm_mon + 1, 2) + "-" +
           digits(time.tm_mday, 2) + "T" + timeWithSeconds(when) +
           (time.tm_gmtoff < 0 ? "-" : "+") + digits(offset / kMinute, 2) + ":" +
           digits(offset % kMinute, 2);
}

}  // namespace pelorus::doctor
