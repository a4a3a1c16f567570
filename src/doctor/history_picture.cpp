#include "doctor/history_picture.h"

#include <algorithm>
#include <set>

#include "doctor/lines.h"
#include "doctor/local_time.h"
#include "doctor/picture_sheet.h"
#include "doctor/reach_words.h"
#include "doctor/time_axis.h"

namespace pelorus::doctor {

namespace {

using std::chrono::seconds;

constexpr double kWidth = 1200, kMargin = 30;
constexpr double kLeft = kMargin, kRight = kWidth - kMargin;
constexpr double kLetter = 8;       // mean width of 14 pixels in the widest of the usual fonts
constexpr double kSmallLetter = 7;  // of 12 pixels
constexpr double kLegendTop = 82, kLegendLine = 24, kBandHeight = 46;
constexpr double kMarkHeight = 18, kMarkAbove = 28;  // the top of a mark above the band
constexpr double kAxisHeight = 64;
constexpr double kLeastSliver = 1.5;  // a period of seconds can be seen
constexpr double kLine = 20, kEntryGap = 8, kColumn = 585, kTextAt = 40;
constexpr std::size_t kListLetters = 64, kSmallListLetters = 76, kNoteLetters = 160;
constexpr std::size_t kMostTicks = 12;
constexpr std::size_t kMostListed = 40;

const char* colourOf(Reach reach) {
    switch (reach) {
        case Reach::DIRECT:
            return "#2b8a4b";
        case Reach::RELAYED:
            return "#2b6cb0";
        case Reach::NOT_REACHED:
            return "#c53030";
        case Reach::SWITCHED_OFF:
            return "#718096";
        case Reach::NOT_RUNNING:
            return "#2d3748";
        case Reach::UNKNOWN:
            return "#cbd5e0";
    }
    return kPale;
}

struct Stretch {
    Reach reach{};
    Time since{}, until{};
    std::size_t cause = 0;  // its number, 0 for none
};

// A cause, and every time it set in.
struct Entry {
    Reach reach{};
    std::string text;
    std::vector<std::size_t> stretches;
};

// One or more numbers at a place of the band.
struct Mark {
    double left{}, right{};
    std::set<std::size_t> numbers;
    Reach reach{};
    double sum = 0;  // of the places
    std::size_t count = 0;

    [[nodiscard]] std::string label() const {
        if (numbers.size() > 3) {
            return std::to_string(*numbers.begin()) + "\xE2\x80\x93" +
                   std::to_string(*numbers.rbegin());
        }
        std::string text;
        for (const std::size_t number : numbers) {
            text += (text.empty() ? "" : ", ") + std::to_string(number);
        }
        return text;
    }

    // Around the middle of its places, within the band.
    void place() {
        const double width = static_cast<double>(letters(label())) * kSmallLetter + 12;
        left = std::clamp(sum / static_cast<double>(count) - width / 2, kLeft, kRight - width);
        right = left + width;
    }

    void absorb(const Mark& other) {
        if (reach != other.reach) reach = Reach::UNKNOWN;
        numbers.insert(other.numbers.begin(), other.numbers.end());
        sum += other.sum;
        count += other.count;
        place();
    }
};

std::string share(seconds part, seconds whole) {
    if (part >= whole) return "100 %";  // also of nothing
    const auto percent = (100 * part.count() + whole.count() / 2) / whole.count();
    if (percent < 1 && part.count() > 0) return "under 1 %";
    // Not all of it unless it is.
    return std::to_string(std::min<seconds::rep>(percent, 99)) + " %";
}

// Texts of causes differ in how long something took: "after 239 ms".
std::string withoutDurations(const std::string& text) {
    constexpr std::string_view kUnit = " ms";
    std::string result;
    for (std::size_t at = 0; at < text.size();) {
        const std::size_t end = std::min(text.find_first_not_of("0123456789", at), text.size());
        const bool isDuration = end > at && text.compare(end, kUnit.size(), kUnit) == 0;
        const std::size_t next = std::max(end, at + 1);
        result += isDuration ? "some" : text.substr(at, next - at);
        at = next;
    }
    return result;
}

class HistoryPicture {
public:
    explicit HistoryPicture(const Diagnosis& subject) : diagnosis{subject} { collect(); }

    [[nodiscard]] std::string svg() {
        drawHead();
        if (stretches.empty()) return sheet.svg(kWidth, kLegendTop + kMargin);
        drawLegend();
        drawAxis();
        drawBand();
        drawMarks();
        const double bottom = drawNotes(drawList());
        return sheet.svg(kWidth, bottom + kMargin / 2);
    }

private:
    void collect();
    std::size_t numberOf(const Period& period);
    void drawHead();
    void drawLegend();
    void drawAxis();
    void drawBand();
    void drawStretch(const Stretch& stretch);
    void drawMarks();
    [[nodiscard]] std::vector<Mark> marks() const;
    void drawMark(double left, double right, double top, const std::string& label, Reach reach);
    double drawList();
    double drawNotes(double bottom);
    double drawEntry(std::size_t number, double x, double y);
    [[nodiscard]] std::vector<std::string> linesOf(const Entry& entry) const;
    [[nodiscard]] std::string times(const Entry& entry) const;
    [[nodiscard]] double x(Time when) const {
        const auto span = static_cast<double>(std::max<seconds::rep>((end - begin).count(), 1));
        return kLeft + (kRight - kLeft) * static_cast<double>((when - begin).count()) / span;
    }

    const Diagnosis& diagnosis;
    Time begin{}, end{};
    std::vector<Stretch> stretches;
    std::vector<Entry> entries;
    double bandTop = 0, axisTop = 0;
    PictureSheet sheet;
};

// A clock that was set back must not turn time around.
void HistoryPicture::collect() {
    std::vector<Period> periods = diagnosis.history;
    if (periods.empty() && diagnosis.since) {
        periods.push_back({diagnosis.reach, *diagnosis.since, diagnosis.address, {}});
    }
    if (periods.empty()) return;
    begin = periods.front().since;
    end = std::max(begin, diagnosis.now);
    for (const Period& period : periods) end = std::max(end, period.since);
    Time last = begin;
    for (const Period& period : periods) {
        last = std::max(last, period.since);
        if (!stretches.empty()) stretches.back().until = last;
        stretches.push_back({period.reach, last, end, numberOf(period)});
    }
}

std::size_t HistoryPicture::numberOf(const Period& period) {
    if (period.cause.empty()) return 0;
    const std::string text = withoutDurations(period.cause);
    const auto found = std::find_if(entries.begin(), entries.end(), [&](const Entry& entry) {
        return entry.reach == period.reach && entry.text == text;
    });
    const auto index = static_cast<std::size_t>(found - entries.begin());
    if (found == entries.end()) entries.push_back({period.reach, text, {}});
    entries[index].stretches.push_back(stretches.size());
    return index + 1;
}

void HistoryPicture::drawHead() {
    sheet.write("How the device was reached", {kLeft, 36, 18, kInk, "start", true});
    std::string span = "No change of its status is known.";
    if (!stretches.empty()) {
        span = timeBetween(begin, end) + ", from " + dayInWords(begin, end) + " " +
               timeOfDay(begin) + " to " + dayInWords(end, end) + " " + timeOfDay(end) +
               ", in the device's local time.";
        if (!entries.empty()) span += " A number marks where a cause set in.";
    }
    sheet.write(span, {kLeft, 58, 14, kQuiet});
}

// Says how much of the time each status had, and where the band has its place.
void HistoryPicture::drawLegend() {
    double at = kLeft, top = kLegendTop;
    for (const ReachWords& words : kReachWords) {
        seconds total{0};
        bool isThere = false;
        for (const Stretch& stretch : stretches) {
            if (stretch.reach != words.reach) continue;
            isThere = true;
            total += stretch.until - stretch.since;
        }
        if (!isThere) continue;
        const std::string text = std::string{words.shortly} + " " + share(total, end - begin) +
                                 ", " + timeBetween(begin, begin + total);
        const double width = 21 + static_cast<double>(letters(text)) * kLetter;
        if (at + width > kRight) {
            at = kLeft;
            top += kLegendLine;
        }
        sheet.draw({at, top, 14, 14, colourOf(words.reach), 3});
        sheet.write(text, {at + 21, top + 12});
        at += width + 14;
    }
    bandTop = top + kLegendLine + 12 + (entries.empty() ? 0 : kMarkAbove);
    axisTop = bandTop + kBandHeight;
}

void HistoryPicture::drawAxis() {
    for (const Tick& tick : timeTicks(begin, end, kMostTicks)) {
        const double at = x(tick.when);
        sheet.drawVertical(at, bandTop - 4, axisTop + 8, "#a0aec0");
        const double half = static_cast<double>(tick.label.size()) * kSmallLetter / 2;
        const double middle = std::clamp(at, kLeft + half, kRight - half);
        sheet.write(tick.label, {middle, axisTop + 23, 12, kInk, "middle"});
    }
}

// What is too short for its place lies above, or the next one would cover it.
void HistoryPicture::drawBand() {
    const auto isSliver = [&](const Stretch& stretch) {
        return x(stretch.until) - x(stretch.since) < kLeastSliver;
    };
    for (const Stretch& stretch : stretches) {
        if (!isSliver(stretch)) drawStretch(stretch);
    }
    for (const Stretch& stretch : stretches) {
        if (!isSliver(stretch)) continue;
        const double left = std::min(x(stretch.since), kRight - kLeastSliver);
        sheet.draw({left, bandTop, kLeastSliver, kBandHeight, colourOf(stretch.reach)});
    }
}

void HistoryPicture::drawStretch(const Stretch& stretch) {
    const double left = x(stretch.since), width = x(stretch.until) - left;
    sheet.draw({left, bandTop, width, kBandHeight, colourOf(stretch.reach)});
    const std::string word = wordsFor(stretch.reach).shortly;
    const std::string age = timeBetween(stretch.since, stretch.until);
    const char* colour = stretch.reach == Reach::UNKNOWN ? kInk : kWhite;
    const auto fits = [&](const std::string& text, double letter) {
        return static_cast<double>(text.size()) * letter + 14 <= width;
    };
    if (!fits(word, kLetter + 1)) return;
    const bool hasAge = fits(age, kSmallLetter);
    sheet.write(word, {left + 7, bandTop + (hasAge ? 20 : 28), 14, colour, "start", true});
    if (hasAge) sheet.write(age, {left + 7, bandTop + 37, 12, colour});
}

std::vector<Mark> HistoryPicture::marks() const {
    std::vector<Mark> placed;
    for (const Stretch& stretch : stretches) {
        if (stretch.cause == 0) continue;
        Mark mark;
        mark.numbers = {stretch.cause};
        mark.reach = stretch.reach;
        mark.sum = x(stretch.since);
        mark.count = 1;
        mark.place();
        placed.push_back(std::move(mark));
        while (placed.size() > 1 && placed[placed.size() - 2].right + 2 > placed.back().left) {
            placed[placed.size() - 2].absorb(placed.back());
            placed.pop_back();
        }
    }
    return placed;
}

void HistoryPicture::drawMarks() {
    for (const Stretch& stretch : stretches) {
        if (stretch.cause == 0) continue;
        sheet.drawVertical(x(stretch.since), bandTop - kMarkAbove + kMarkHeight, bandTop,
                           colourOf(stretch.reach));
    }
    for (const Mark& mark : marks()) {
        drawMark(mark.left, mark.right, bandTop - kMarkAbove, mark.label(), mark.reach);
    }
}

void HistoryPicture::drawMark(
    double left, double right, double top, const std::string& label, Reach reach) {
    const char* colour = reach == Reach::UNKNOWN ? kQuiet : colourOf(reach);
    sheet.draw({left, top, right - left, kMarkHeight, colour, kMarkHeight / 2});
    sheet.write(label, {(left + right) / 2, top + 13, 12, kWhite, "middle", true});
}

std::string HistoryPicture::times(const Entry& entry) const {
    const Stretch& first = stretches[entry.stretches.front()];
    const std::string word = wordsFor(entry.reach).shortly;
    const auto moment = [&](const Stretch& stretch) {
        return dayInWords(stretch.since, end) + " " + timeOfDay(stretch.since);
    };
    if (entry.stretches.size() == 1) {
        return moment(first) + ", " + word + " for " + timeBetween(first.since, first.until);
    }
    seconds total{0};
    for (const std::size_t index : entry.stretches) {
        total += stretches[index].until - stretches[index].since;
    }
    return std::to_string(entry.stretches.size()) + " times from " + moment(first) + " to " +
           moment(stretches[entry.stretches.back()]) + ", " + word + " for " +
           timeBetween(begin, begin + total) + " in all";
}

std::vector<std::string> HistoryPicture::linesOf(const Entry& entry) const {
    return wrap(entry.text, kListLetters);
}

double HistoryPicture::drawEntry(std::size_t number, double x, double y) {
    const Entry& entry = entries[number - 1];
    const std::string label = std::to_string(number);
    const double width = static_cast<double>(label.size()) * kSmallLetter + 12;
    drawMark(x, x + width, y, label, entry.reach);
    y += 14;
    for (const std::string& line : linesOf(entry)) {
        sheet.write(line, {x + kTextAt, y});
        y += kLine;
    }
    for (const std::string& line : wrap(times(entry), kSmallListLetters)) {
        sheet.write(line, {x + kTextAt, y, 12, kQuiet});
        y += kLine;
    }
    return y - 14 + kEntryGap;
}

// In two columns of about the same height.
double HistoryPicture::drawList() {
    if (entries.empty()) return axisTop + 30;
    const std::size_t most = std::min(entries.size(), kMostListed);
    std::size_t lines = 0;
    for (std::size_t index = 0; index < most; ++index) lines += linesOf(entries[index]).size() + 1;
    double bottom = axisTop + kAxisHeight, y = axisTop + kAxisHeight;
    std::size_t drawn = 0;
    double column = kLeft;
    for (std::size_t number = 1; number <= most; ++number) {
        if (column == kLeft && 2 * drawn >= lines) {
            column += kColumn;
            y = axisTop + kAxisHeight;
        }
        y = drawEntry(number, column, y);
        drawn += linesOf(entries[number - 1]).size() + 1;
        bottom = std::max(bottom, y);
    }
    if (entries.size() > most) {
        const std::string more = std::to_string(entries.size() - most) + " more: see --json";
        sheet.write("and " + more, {kLeft, bottom + 14, 12, kQuiet});
        bottom += kLine;
    }
    return bottom;
}

// What is not known may be missing in the band.
double HistoryPicture::drawNotes(double bottom) {
    for (const std::string& text : diagnosis.untold) {
        for (const std::string& line : wrap("Unknown: " + text, kNoteLetters)) {
            sheet.write(line, {kLeft, bottom + 14, 12, kQuiet});
            bottom += kLine;
        }
    }
    return bottom;
}

}  // namespace

std::string historyPicture(const Diagnosis& diagnosis) {
    return HistoryPicture{diagnosis}.svg();
}

}  // namespace pelorus::doctor
