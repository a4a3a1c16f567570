// The lines of several log files as those of one log.
#ifndef PELORUS_DOCTOR_LINE_ORDER_H
#define PELORUS_DOCTOR_LINE_ORDER_H

#include <array>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "doctor/log_line.h"
#include "doctor/log_story.h"

namespace pelorus::doctor {

/// Which lines were read. One in a hundred is taken for known and is not, in a log of a million.
class KnownLines {
public:
    void add(const LogLine& line);
    [[nodiscard]] bool has(const LogLine& line) const;

private:
    static constexpr unsigned kBits = 24;

    [[nodiscard]] static std::array<std::size_t, 2> places(const LogLine& line);

    std::vector<bool> bits = std::vector<bool>(std::size_t{1} << kBits);
};

/// Passes on the daemon's lines of several files, without what a file repeats of the ones before.
class LineOrder {
public:
    /// @p today: the time by which stamps without a year are read.
    LineOrder(LogStory& listener, Time today) : story{listener}, now{today} {}

    void beginFile();

    /// @p stamp: the last one of the file, of any program.
    void endFile(std::optional<Time> stamp);

    /// The next line, of any program.
    void take(std::string_view text);

    /// The last stamp of the newest file, of any program; unset if none has ended.
    [[nodiscard]] std::optional<Time> end() const { return last; }

    /// How many lines of the daemon were left out, because their stamps cannot be read.
    [[nodiscard]] int unstamped() const { return left; }

    /// Whose lines were passed on; at most a thousand.
    [[nodiscard]] const std::set<std::string>& hosts() const { return met; }

private:
    void meet(std::string_view host);

    LogStory& story;
    Time now;
    std::optional<Time> last;
    Time newest{};
    KnownLines known;
    std::string lastHost;
    std::set<std::string> met;
    int left = 0;
    bool isFirst = true;     // of its file
    bool repeating = false;  // so far all lines of this file were in others
};

}  // namespace pelorus::doctor

#endif
