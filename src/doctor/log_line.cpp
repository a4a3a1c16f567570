#include "doctor/log_line.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cstdint>
#include <ctime>
#include <string>

#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr int kEarliestYear = 1970;
constexpr int kLatestYear = 9999;
constexpr int kTmYear = 1900;
constexpr int kYearsBack = 4;  // the last 29 February may be that far away
// Clocks and time zones of two devices differ by less.
constexpr auto kFuture = 24h;
// A host name may stand before the program, and a "facility.severity" between the two.
constexpr int kMostWords = 3;
constexpr std::string_view kMonths = "JanFebMarAprMayJunJulAugSepOctNovDec";
constexpr std::string_view kNewline = "#012";  // as some system loggers write it
constexpr std::string_view kVersion = "1 ";
constexpr std::string_view kRepeated = "message repeated ";

bool isDigit(char character) {
    return std::isdigit(static_cast<unsigned char>(character)) != 0;
}

bool take(std::string_view& text, char wanted) {
    if (text.empty() || text.front() != wanted) return false;
    text.remove_prefix(1);
    return true;
}

// Exactly @p digits digits.
std::optional<int> takeNumber(std::string_view& text, std::size_t digits, int least, int most) {
    if (text.size() < digits) return std::nullopt;
    int number = 0;
    for (std::size_t i = 0; i < digits; ++i) {
        if (!isDigit(text[i])) return std::nullopt;
        number = number * 10 + (text[i] - '0');
    }
    if (number < least || number > most) return std::nullopt;
    text.remove_prefix(digits);
    return number;
}

bool takeClock(std::string_view& text, std::tm& parts) {
    const auto hour = takeNumber(text, 2, 0, 23);
    if (!hour || !take(text, ':')) return false;
    const auto minute = takeNumber(text, 2, 0, 59);
    if (!minute || !take(text, ':')) return false;
    const auto second = takeNumber(text, 2, 0, 60);
    if (!second) return false;
    parts.tm_hour = *hour;
    parts.tm_min = *minute;
    parts.tm_sec = *second;
    return true;
}

// Seconds east of Greenwich. Empty when no zone follows, which is no error.
std::optional<int> takeZone(std::string_view& text) {
    if (take(text, 'Z')) return 0;
    if (text.empty() || (text.front() != '+' && text.front() != '-')) return std::nullopt;
    std::string_view rest = text;
    const int sign = rest.front() == '-' ? -1 : 1;
    rest.remove_prefix(1);
    const auto hours = takeNumber(rest, 2, 0, 23);
    if (!hours) return std::nullopt;
    take(rest, ':');
    const auto minutes = takeNumber(rest, 2, 0, 59);
    if (!minutes) return std::nullopt;
    text = rest;
    return sign * (*hours * 3600 + *minutes * 60);
}

struct Stamp {
    Time when{};
    bool isTwice = false;  // an hour later the clock showed the same
};

bool shows(std::time_t seconds, const std::tm& parts) {
    std::tm shown{};
    return localtime_r(&seconds, &shown) != nullptr && shown.tm_hour == parts.tm_hour &&
           shown.tm_mday == parts.tm_mday;
}

// Normalises @p parts.
Stamp localTime(std::tm& parts) {
    constexpr std::time_t kHour = 3600;
    parts.tm_isdst = -1;
    const std::time_t seconds = std::mktime(&parts);
    const bool isSecond = shows(seconds - kHour, parts);
    const Time when{std::chrono::seconds{isSecond ? seconds - kHour : seconds}};
    return {when, isSecond || shows(seconds + kHour, parts)};
}

void skipFraction(std::string_view& text) {
    if (!take(text, '.') && !take(text, ',')) return;
    while (!text.empty() && isDigit(text.front())) text.remove_prefix(1);
}

// "1795316400.123456".
std::optional<Stamp> takeUnixStamp(std::string_view& line, Time now) {
    constexpr std::size_t kDigits = 10;
    std::string_view rest = line;
    std::int64_t seconds = 0;
    const auto [end, error] = std::from_chars(rest.data(), rest.data() + rest.size(), seconds);
    rest.remove_prefix(static_cast<std::size_t>(end - rest.data()));
    if (error != std::errc{} || line.size() - rest.size() > kDigits) return std::nullopt;
    if (rest.empty() || rest.front() != '.') return std::nullopt;
    skipFraction(rest);
    const Time when{std::chrono::seconds{seconds}};
    if (!take(rest, ' ') || when > now + kFuture) return std::nullopt;
    line = rest;
    return Stamp{when};
}

std::optional<Stamp> takeIsoStamp(std::string_view& line, Time now) {
    std::string_view rest = line;
    std::tm parts{};
    const auto year = takeNumber(rest, 4, kEarliestYear, kLatestYear);
    if (!year || !take(rest, '-')) return std::nullopt;
    const auto month = takeNumber(rest, 2, 1, 12);
    if (!month || !take(rest, '-')) return std::nullopt;
    const auto day = takeNumber(rest, 2, 1, 31);
    if (!day || !(take(rest, 'T') || take(rest, ' ')) || !takeClock(rest, parts)) {
        return std::nullopt;
    }
    skipFraction(rest);
    const auto zone = takeZone(rest);
    if (!take(rest, ' ')) return std::nullopt;
    parts.tm_year = *year - kTmYear;
    parts.tm_mon = *month - 1;
    parts.tm_mday = *day;
    const Stamp stamp =
        zone ? Stamp{Time{std::chrono::seconds{timegm(&parts) - *zone}}} : localTime(parts);
    if (stamp.when > now + kFuture) return std::nullopt;
    line = rest;
    return stamp;
}

std::optional<Stamp> latestNotInFuture(const std::tm& parts, Time now) {
    const auto seconds = static_cast<std::time_t>(now.time_since_epoch().count());
    std::tm today{};
    if (localtime_r(&seconds, &today) == nullptr) return std::nullopt;
    // A day that a year does not have becomes one of March.
    for (int back = -1; back <= kYearsBack; ++back) {
        std::tm tried = parts;
        tried.tm_year = today.tm_year - back;
        const Stamp stamp = localTime(tried);
        if (tried.tm_mday == parts.tm_mday && stamp.when <= now + kFuture) return stamp;
    }
    return std::nullopt;
}

// Time zones change on the hour: the lines of one hour share the costly part. Only hours that lie
// well in the past are kept.
std::optional<Stamp> classicTime(const std::tm& parts, Time now) {
    struct Hour {
        int month = -1, day = -1, hour = -1;
        Time now{}, begin{};
        bool isTwice = false;
    };
    thread_local Hour known;
    const auto within = std::chrono::seconds{parts.tm_min * 60 + parts.tm_sec};
    if (known.month == parts.tm_mon && known.day == parts.tm_mday && known.hour == parts.tm_hour &&
        known.now == now) {
        return Stamp{known.begin + within, known.isTwice};
    }
    const auto stamp = latestNotInFuture(parts, now);
    if (stamp && stamp->when + std::chrono::hours{1} <= now + kFuture) {
        known = {parts.tm_mon, parts.tm_mday,        parts.tm_hour,
                 now,          stamp->when - within, stamp->isTwice};
    }
    return stamp;
}

std::optional<Stamp> takeClassicStamp(std::string_view& line, Time now) {
    constexpr std::size_t kName = 3;
    if (line.size() < kName + 1) return std::nullopt;
    const std::size_t month = kMonths.find(line.substr(0, kName));
    if (month == std::string_view::npos || month % kName != 0) return std::nullopt;
    std::string_view rest = line.substr(kName);
    if (!take(rest, ' ')) return std::nullopt;
    std::tm parts{};
    const auto day = take(rest, ' ') ? takeNumber(rest, 1, 1, 9) : takeNumber(rest, 2, 1, 31);
    if (!day || !take(rest, ' ') || !takeClock(rest, parts)) return std::nullopt;
    skipFraction(rest);
    if (!take(rest, ' ')) return std::nullopt;
    parts.tm_mon = static_cast<int>(month / kName);
    parts.tm_mday = *day;
    const auto stamp = classicTime(parts, now);
    if (stamp) line = rest;
    return stamp;
}

// True if the header of RFC 5424 follows: the priority has a version behind it.
bool skipPriority(std::string_view& line) {
    if (line.empty() || line.front() != '<') return false;
    const std::size_t end = line.find_first_not_of("0123456789", 1);
    if (end == std::string_view::npos || end == 1 || line[end] != '>') return false;
    line.remove_prefix(end + 1);
    const bool isVersioned = line.substr(0, kVersion.size()) == kVersion;
    if (isVersioned) line.remove_prefix(kVersion.size());
    return isVersioned;
}

// Skips process, message id and structured data: RFC 5424 has them between program and text, which
// may begin with a byte order mark.
std::string_view withoutHeader(std::string_view rest) {
    constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";
    for (const bool isData : {false, false, true}) {
        const std::string_view end = isData && rest.substr(0, 1) == "[" ? "] " : " ";
        const std::size_t found = rest.find(end);
        if (found == std::string_view::npos) return {};
        rest.remove_prefix(found + end.size());
    }
    if (startsWith(rest, kByteOrderMark)) rest.remove_prefix(kByteOrderMark.size());
    return rest;
}

// "Pelorus:" or "Pelorus[123]:".
bool isDaemon(std::string_view word) {
    constexpr std::string_view kRest = "elorus";
    if (word.size() < kRest.size() + 2 || word.back() != ':') return false;
    if ((word.front() != 'P' && word.front() != 'p') || word.substr(1, kRest.size()) != kRest) {
        return false;
    }
    std::string_view pid = word.substr(kRest.size() + 1, word.size() - kRest.size() - 2);
    if (pid.empty()) return true;
    if (pid.size() < 3 || pid.front() != '[' || pid.back() != ']') return false;
    pid = pid.substr(1, pid.size() - 2);
    return pid.find_first_not_of("0123456789") == std::string_view::npos;
}

std::string_view withoutEnd(std::string_view text) {
    for (;;) {
        while (!text.empty() && static_cast<unsigned char>(text.back()) <= ' ') {
            text.remove_suffix(1);
        }
        if (text.size() < kNewline.size() ||
            text.substr(text.size() - kNewline.size()) != kNewline) {
            return text;
        }
        text.remove_suffix(kNewline.size());
    }
}

// A system logger may write what comes again and again only once.
std::string_view withoutRepetition(std::string_view text) {
    constexpr std::string_view kTimes = " times: [ ";
    if (text.substr(0, kRepeated.size()) != kRepeated || text.back() != ']') return text;
    const std::size_t times = text.find_first_not_of("0123456789", kRepeated.size());
    if (text.substr(std::min(times, text.size()), kTimes.size()) != kTimes) return text;
    return text.substr(times + kTimes.size(), text.size() - times - kTimes.size() - 1);
}

std::optional<Stamp> takeAnyStamp(std::string_view& line, Time now) {
    skipPriority(line);
    if (line.empty() || !isDigit(line.front())) return takeClassicStamp(line, now);
    const auto stamp = takeIsoStamp(line, now);
    return stamp ? stamp : takeUnixStamp(line, now);
}

}  // namespace

std::optional<Time> takeStamp(std::string_view& line, Time now) {
    const auto stamp = takeAnyStamp(line, now);
    return stamp ? std::optional{stamp->when} : std::nullopt;
}

bool lacksStamp(std::string_view line, Time now) {
    constexpr int kMostWordsBefore = 10;  // blanks within brackets included
    if (takeStamp(line, now)) return false;
    for (int words = 0; words <= kMostWordsBefore && !line.empty(); ++words) {
        const std::size_t end = line.find(' ');
        const std::string_view word = line.substr(0, end);
        if (isDaemon(word)) return true;
        line.remove_prefix(end == std::string_view::npos ? line.size() : end + 1);
    }
    return false;
}

std::optional<LogLine> readLogLine(std::string_view line, Time now) {
    const bool isVersioned = skipPriority(line);
    const bool isYearKnown = !line.empty() && isDigit(line.front());
    const auto stamp = takeAnyStamp(line, now);
    if (!stamp) return std::nullopt;
    std::string_view host;
    const auto found = [&](std::string_view text) {
        return LogLine{stamp->when, withoutRepetition(withoutEnd(text)), host, isYearKnown,
                       stamp->isTwice};
    };
    for (int words = 0; words < kMostWords; ++words) {
        const std::size_t end = line.find(' ');
        const std::string_view word = line.substr(0, end);
        line.remove_prefix(end == std::string_view::npos ? line.size() : end + 1);
        if (isDaemon(word)) return found(line);
        if (isVersioned && words == 1 && isDaemon(std::string{word} + ":")) {
            return found(withoutHeader(line));
        }
        if (words == 0) host = word;
        if (word.empty() || word.back() == ':' || line.empty()) return std::nullopt;
        // Between host and program only "facility.severity".
        if (words == 1 && word.find('.') == std::string_view::npos) return std::nullopt;
    }
    return std::nullopt;
}

}  // namespace pelorus::doctor
