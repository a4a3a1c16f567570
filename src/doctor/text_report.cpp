#include "doctor/text_report.h"

#include <algorithm>
#include <cctype>
#include <string_view>

#include "doctor/check_words.h"
#include "doctor/history_text.h"
#include "doctor/lines.h"
#include "doctor/local_time.h"
#include "doctor/reach_words.h"

namespace pelorus::doctor {

namespace {

using Lines = std::vector<std::string>;
using Verdict = Check::Verdict;

constexpr std::size_t kMostFacts = 3;
constexpr std::size_t kVerdictWidth = 9;
constexpr std::size_t kSourceWidth = 8;
constexpr const char* kEndOfColour = "\033[0m";

const char* verdictColour(Verdict verdict) {
    if (verdict == Verdict::OK) return "\033[32m";
    return verdict == Verdict::PROBLEM ? "\033[1;31m" : "\033[33m";
}

const char* headlineColour(Reach reach) {
    if (reach == Reach::DIRECT) return "\033[1;32m";
    return reach == Reach::RELAYED || reach == Reach::UNKNOWN ? "\033[1;33m" : "\033[1;31m";
}

std::string withoutFullStop(std::string text) {
    constexpr std::string_view kCut = "...";
    const bool isCut = text.size() >= kCut.size() &&
                       text.compare(text.size() - kCut.size(), kCut.size(), kCut) == 0;
    while (!isCut && !text.empty() && (text.back() == '.' || text.back() == ' ')) text.pop_back();
    return text;
}

std::string withFullStop(const std::string& text) {
    return !text.empty() && text.back() == '.' ? text : text + ".";
}

void append(Lines& lines, const Lines& more) {
    lines.insert(lines.end(), more.begin(), more.end());
}

// How much of the report is left out or drawn together so that it fits on a screen.
struct Compactness {
    bool joinsNeighbours;
    bool joinsAll;
    bool showsOk;
    std::size_t mostPeriods, mostFurtherCauses;
};

constexpr Compactness kCompactness[]{{false, false, true, 8, 3}, {true, false, true, 8, 3},
                                     {true, true, true, 8, 3},   {true, true, true, 3, 3},
                                     {true, true, true, 3, 1},   {true, true, true, 1, 0},
                                     {true, true, false, 1, 0}};

struct ShownChecks {
    std::vector<Check> checks;
    std::size_t hidden = 0;  // that are ok
};

class TextReport {
public:
    TextReport(const Diagnosis& subject, const Layout& layout)
        : diagnosis{subject},
          width{
              static_cast<std::size_t>(std::clamp(layout.width, kLeastTextWidth, kMostTextWidth))},
          colours{layout.colours},
          height{static_cast<std::size_t>(std::max(layout.height, kLeastTextHeight))},
          today{layout.today.value_or(subject.now)} {}

    [[nodiscard]] std::string text() const {
        Lines lines;
        for (const Compactness& compactness : kCompactness) {
            lines = report(compactness);
            if (lines.size() <= height) break;
        }
        std::string text;
        for (const std::string& line : lines) text += line + '\n';
        return text;
    }

private:
    [[nodiscard]] Lines report(const Compactness& compactness) const;
    [[nodiscard]] Lines headline() const;
    [[nodiscard]] std::string state() const;
    [[nodiscard]] std::string sinceWhen() const;
    [[nodiscard]] std::string howBefore() const;
    [[nodiscard]] Lines causes(std::size_t mostFurther) const;
    [[nodiscard]] std::string sentenceWithFacts(const NamedCause& named, std::size_t most) const;
    [[nodiscard]] std::string factWithSource(const Fact& fact) const;
    [[nodiscard]] std::string nextCycle() const;
    void addNextCycle(std::vector<Check>& all) const;
    [[nodiscard]] ShownChecks checksToShow(const Compactness& compactness) const;
    [[nodiscard]] Lines checks(const Compactness& compactness) const;
    // Room for the text of a check between its verdict and its source.
    [[nodiscard]] std::size_t checkWidth() const {
        return width - kVerdictWidth - 1 - kSourceWidth;
    }

    const Diagnosis& diagnosis;
    std::size_t width;
    bool colours;
    std::size_t height;
    Time today;
};

std::string TextReport::state() const {
    if (diagnosis.reach == Reach::UNKNOWN) return "IT COULD NOT BE TOLD";
    std::string words = wordsFor(diagnosis.reach).fully;
    for (char& letter : words) {
        letter = static_cast<char>(std::toupper(static_cast<unsigned char>(letter)));
    }
    return words;
}

std::string TextReport::sinceWhen() const {
    std::string text;
    if (diagnosis.reach == Reach::UNKNOWN) text += " how the device is reached";
    if (diagnosis.reach == Reach::DIRECT && !diagnosis.address.empty()) {
        text += " on " + diagnosis.address;
        if (!diagnosis.ports.empty()) {
            const bool isSeveral = diagnosis.ports.find(' ') != std::string::npos;
            text += (isSeveral ? ", ports " : ", port ") + diagnosis.ports;
        }
    }
    if (diagnosis.fromElsewhere) {
        text += " as of " + momentInWords(diagnosis.now, today) + ", where the log ends";
    }
    if (diagnosis.since && diagnosis.reach != Reach::UNKNOWN) {
        if (!text.empty()) text += diagnosis.fromElsewhere ? ";" : ",";
        text += diagnosis.isSinceAtLeast ? " since at least " : " since ";
        text += momentInWords(*diagnosis.since, today) + " (" +
                timeBetween(*diagnosis.since, diagnosis.now) + ")";
    } else if (diagnosis.reach != Reach::UNKNOWN && !diagnosis.fromElsewhere) {
        text += ", since when could not be told";
    }
    return text + ".";
}

std::string TextReport::howBefore() const {
    if (!diagnosis.before || diagnosis.before->reach == Reach::UNKNOWN) return "";
    const Period& before = *diagnosis.before;
    std::string text = std::string{" Before that "} + wordsFor(before.reach).fully;
    if (!before.address.empty()) text += " on " + before.address;
    if (diagnosis.since) text += ", " + timeBetween(before.since, *diagnosis.since);
    return text + ".";
}

Lines TextReport::headline() const {
    Lines lines = wrap(state() + sinceWhen() + howBefore(), width);
    if (colours) {
        // The state is short enough for the first line.
        std::string& first = lines.front();
        first.insert(std::min(first.size(), state().size()), kEndOfColour);
        first.insert(0, headlineColour(diagnosis.reach));
    }
    return lines;
}

std::string TextReport::factWithSource(const Fact& fact) const {
    std::string text = withoutFullStop(fact.text);
    if (fact.source == Source::SETTINGS) return text + " (settings)";
    if (fact.source != Source::LOG) return text;
    return text + (fact.when ? " (log, " + momentShortly(*fact.when, today) + ")" : " (log)");
}

std::string TextReport::sentenceWithFacts(const NamedCause& named, std::size_t most) const {
    std::string sentence{named.cause->sentence};
    std::vector<std::string> facts;
    for (const Fact& fact : named.proofs) {
        std::string text = factWithSource(fact);
        const bool isNew = std::find(facts.begin(), facts.end(), text) == facts.end();
        if (facts.size() < most && isNew && !fact.text.empty()) facts.push_back(std::move(text));
    }
    if (facts.empty()) return sentence;
    std::string text = withoutFullStop(sentence);
    // One colon is enough in a sentence.
    std::string separator = text.find(": ") == std::string::npos ? ": " : "; ";
    for (const std::string& fact : facts) {
        text += separator + fact;
        separator = "; ";
    }
    return withFullStop(text);
}

Lines TextReport::causes(std::size_t mostFurther) const {
    const std::vector<NamedCause>& all = diagnosis.causes;
    const bool isDirect = diagnosis.reach == Reach::DIRECT;
    Lines lines;
    if (all.empty()) {
        if (isDirect || diagnosis.reach == Reach::UNKNOWN) return {};
        return hang("Why    ", "No cause shows in what could be looked at.", width);
    }
    const std::string why = sentenceWithFacts(all.front(), kMostFacts);
    append(lines, hang(isDirect ? "But    " : "Why    ", why, width));
    if (!all.front().cause->remedy.empty()) {
        append(lines, hang("Helps  ", all.front().cause->remedy, width));
    }
    std::string unnamed;
    for (std::size_t index = 1; index < all.size(); ++index) {
        if (index <= mostFurther) {
            append(lines, hang("Also   ", sentenceWithFacts(all[index], 1), width));
        } else {
            unnamed += (unnamed.empty() ? "" : ", ") + std::string{all[index].cause->name};
        }
    }
    if (!unnamed.empty()) append(lines, hang("And    ", unnamed + ".", width));
    return lines;
}

// Empty if it is not known, or was that of a log's end.
std::string TextReport::nextCycle() const {
    const auto& when = diagnosis.daemon.nextCycle;
    if (!when || diagnosis.fromElsewhere || diagnosis.reach == Reach::NOT_RUNNING) return "";
    const bool isDue = *when <= diagnosis.now;
    return "next cycle " + (isDue ? "due now" : "in " + timeBetween(diagnosis.now, *when));
}

// Beside the daemon it takes no line of its own.
void TextReport::addNextCycle(std::vector<Check>& all) const {
    const std::string text = nextCycle();
    if (text.empty()) return;
    const auto daemon = std::find_if(all.begin(), all.end(), [](const Check& check) {
        return check.text.rfind(kDaemonUp, 0) == 0;
    });
    if (daemon == all.end()) {
        all.push_back({Verdict::OK, Source::LOG, text});
    } else {
        daemon->text += ", " + text;
    }
}

ShownChecks TextReport::checksToShow(const Compactness& compactness) const {
    std::vector<Check> all = diagnosis.checks;
    addNextCycle(all);
    if (compactness.joinsAll) {
        std::stable_sort(all.begin(), all.end(), [](const Check& left, const Check& right) {
            const bool isLeftOk = left.verdict == Verdict::OK;
            if (!isLeftOk || right.verdict != Verdict::OK) {
                return !isLeftOk && right.verdict == Verdict::OK;
            }
            return left.source < right.source;
        });
    }
    if (!compactness.joinsNeighbours) return {std::move(all), 0};
    std::vector<Check> shown;
    std::size_t hidden = 0;
    for (Check& check : all) {
        if (!compactness.showsOk && check.verdict == Verdict::OK) {
            ++hidden;
            continue;
        }
        Check* before = shown.empty() ? nullptr : &shown.back();
        if (before != nullptr && before->verdict == Verdict::OK && check.verdict == Verdict::OK &&
            before->source == check.source &&
            letters(before->text) + 2 + letters(check.text) <= checkWidth()) {
            before->text += "; " + check.text;
        } else {
            shown.push_back(std::move(check));
        }
    }
    return {std::move(shown), hidden};
}

Lines TextReport::checks(const Compactness& compactness) const {
    const ShownChecks shown = checksToShow(compactness);
    std::size_t longest = 0;
    for (const Check& check : shown.checks) longest = std::max(longest, letters(check.text));
    const std::size_t textWidth = std::min(longest, checkWidth());
    Lines lines;
    for (const Check& check : shown.checks) {
        const std::string name{wordsFor(check.verdict).inReport};
        Lines wrapped =
            hang(std::string(kVerdictWidth, ' '), check.text, kVerdictWidth + textWidth);
        std::string& first = wrapped.front();
        first = padded(first, kVerdictWidth + textWidth + 1);
        first += wordsFor(check.source).inReport;
        first.replace(0, name.size(),
                      colours ? verdictColour(check.verdict) + name + kEndOfColour : name);
        append(lines, wrapped);
    }
    if (shown.hidden > 0) {
        append(lines, hang(padded("ok", kVerdictWidth),
                           std::to_string(shown.hidden) + " more that are ok: see --json", width));
    }
    for (const std::string& text : diagnosis.untold) append(lines, hang("unknown  ", text, width));
    return lines;
}

Lines TextReport::report(const Compactness& compactness) const {
    Lines lines;
    for (const Lines& part :
         {headline(), causes(compactness.mostFurtherCauses), checks(compactness),
          historyText(diagnosis, compactness.mostPeriods, width, today)}) {
        if (part.empty()) continue;
        if (!lines.empty()) lines.emplace_back();
        append(lines, part);
    }
    return lines;
}

}  // namespace

std::string textReport(const Diagnosis& diagnosis, const Layout& layout) {
    return TextReport{diagnosis, layout}.text();
}

}  // namespace pelorus::doctor
