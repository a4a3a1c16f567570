#include "doctor/history_text.h"

#include <algorithm>

#include "doctor/lines.h"
#include "doctor/local_time.h"
#include "doctor/reach_words.h"

namespace pelorus::doctor {

namespace {

using Lines = std::vector<std::string>;

constexpr std::size_t kGap = 2;
constexpr std::size_t kLeastCauseWidth = 24;
constexpr const char* kSource = "log";

struct Row {
    std::string when, change, lasted, cause;
};

struct Widths {
    std::size_t when = 0, change = 0, lasted = 0, cause = 0;

    explicit Widths(const std::vector<Row>& rows) {
        for (const Row& row : rows) {
            when = std::max(when, letters(row.when));
            change = std::max(change, letters(row.change));
            lasted = std::max(lasted, letters(row.lasted));
            cause = std::max(cause, letters(row.cause));
        }
    }
};

std::vector<Row> lastRows(const Diagnosis& diagnosis, std::size_t most, Time today) {
    const std::vector<Period>& all = diagnosis.history;
    std::vector<Row> rows;
    for (std::size_t index = all.size() - std::min(all.size(), most); index < all.size(); ++index) {
        const Period& period = all[index];
        const Time until = index + 1 < all.size() ? all[index + 1].since : diagnosis.now;
        std::string change = wordsFor(period.reach).shortly;
        if (index > 0) {
            change.insert(0, std::string{wordsFor(all[index - 1].reach).shortly} + " -> ");
        }
        rows.push_back({momentShortly(period.since, today), std::move(change),
                        timeBetween(period.since, until), period.cause});
    }
    return rows;
}

// A cause that has no place beside the other columns stands below them.
Lines narrowLines(const Row& row, const Widths& widths, std::size_t width) {
    const std::string label = padded(row.when, widths.when + kGap);
    Lines lines = hang(label, row.change + ", " + row.lasted, width);
    if (!row.cause.empty()) {
        const Lines cause = hang(std::string(label.size(), ' '), row.cause, width);
        lines.insert(lines.end(), cause.begin(), cause.end());
    }
    return lines;
}

}  // namespace

std::vector<std::string> historyText(const Diagnosis& diagnosis,
                                     std::size_t most,
                                     std::size_t width,
                                     Time today) {
    const std::vector<Row> rows = lastRows(diagnosis, most, today);
    const Widths widths{rows};
    const std::size_t causeAt = widths.when + widths.change + widths.lasted + 3 * kGap;
    const std::size_t mostForCause = width - std::min(width, causeAt + 1 + letters(kSource));
    const std::size_t causeWidth = std::min(widths.cause, mostForCause);
    Lines lines;
    if (const std::size_t earlier = diagnosis.history.size() - rows.size(); earlier > 0) {
        lines.push_back("(" + std::to_string(earlier) + " earlier: see --json or --svg)");
    }
    for (const Row& row : rows) {
        Lines some;
        if (mostForCause < std::min(widths.cause, kLeastCauseWidth) || causeAt > width) {
            some = narrowLines(row, widths, width);
        } else {
            const std::string label = padded(row.when, widths.when + kGap) +
                                      padded(row.change, widths.change + kGap) +
                                      padded(row.lasted, widths.lasted + kGap);
            some = hang(label, row.cause, causeAt + causeWidth);
            some.front() = padded(some.front(), causeAt + causeWidth + 1) + kSource;
        }
        lines.insert(lines.end(), some.begin(), some.end());
    }
    return lines;
}

}  // namespace pelorus::doctor
