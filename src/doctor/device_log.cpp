#include "doctor/device_log.h"

#include <algorithm>
#include <array>
#include <ctime>
#include <memory>
#include <set>
#include <utility>

#include "doctor/journal.h"
#include "doctor/line_order.h"
#include "doctor/log_source.h"
#include "doctor/log_story.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::array<const char*, 3> kSystemLogs{"syslog", "messages", "user.log"};

std::string shownTime(Time when) {
    const auto seconds = static_cast<std::time_t>(when.time_since_epoch().count());
    std::tm parts{};
    std::array<char, 32> text{};
    if (localtime_r(&seconds, &parts) == nullptr) return "?";
    text[std::strftime(text.data(), text.size() - 1, "%Y-%m-%d %H:%M", &parts)] = '\0';
    return text.data();
}

std::string shownPath(const std::string& path) {
    constexpr std::size_t kLongestPath = 100;
    return path == "-" ? "standard input" : shownText(path, kLongestPath);
}

void cannotSee(const std::string& text, Evidence& evidence) {
    evidence.checks.push_back({Check::Verdict::NOT_SEEN, Source::LOG, text});
}

struct Entry {
    std::string path;
    RotatedName name;
    Time begin{};
    std::unique_ptr<LogStream> stream;  // only of what cannot be read twice
};

bool areRotated(const std::vector<Entry>& entries) {
    std::set<int> numbers;
    for (const Entry& entry : entries) {
        if (entry.name.log != entries.front().name.log) return false;
        numbers.insert(entry.name.number);
    }
    return numbers.size() == entries.size();
}

// Files are closed in between: there may be many.
std::vector<Entry> inOrder(const std::vector<std::string>& files, Evidence& evidence) {
    std::vector<Entry> entries;
    for (const std::string& path : files) {
        auto stream = std::make_unique<LogStream>(path, true);
        if (!stream->isOpen()) {
            cannotSee("log " + shownPath(path) + ": " + stream->problem, evidence);
            continue;
        }
        const Time begin = stream->firstStamp(evidence.now).value_or(Time::max());
        if (!stream->isPipe()) stream.reset();
        entries.push_back({path, rotationOf(path), begin, std::move(stream)});
    }
    const bool isRotation = areRotated(entries);
    std::stable_sort(entries.begin(), entries.end(), [&](const Entry& a, const Entry& b) {
        return isRotation ? a.name.number > b.name.number : a.begin < b.begin;
    });
    return entries;
}

// Empty when it was read to its end.
std::string readFile(LogStream& stream, const std::string& path, LineOrder& order, Time now) {
    order.beginFile();
    const bool whole =
        stream.isOpen() && stream.read([&order](std::string_view line) { order.take(line); });
    order.endFile(stream.lastStamp(now));
    return whole ? std::string{} : "log " + shownPath(path) + ": " + stream.problem;
}

void readChosen(const LogChoice& choice, LineOrder& order, Evidence& evidence) {
    for (Entry& entry : inOrder(choice.files, evidence)) {
        if (!entry.stream) entry.stream = std::make_unique<LogStream>(entry.path, true);
        const std::string problem = readFile(*entry.stream, entry.path, order, evidence.now);
        if (!problem.empty()) cannotSee(problem, evidence);
        entry.stream.reset();
    }
}

// Each of the system's logs may hold the same lines: the first that has any is enough.
void readSystemLogs(const std::string& folder,
                    const LogStory& story,
                    LineOrder& order,
                    Evidence& evidence) {
    for (const char* const name : kSystemLogs) {
        std::string problem;
        for (const std::string& path : rotatedLogs(folder, name)) {
            LogStream stream{path, false};
            const std::string found = readFile(stream, path, order, evidence.now);
            if (!found.empty()) problem = found;
        }
        // The rotated ones mostly have the newest one's fault.
        if (!problem.empty()) cannotSee(problem, evidence);
        if (story.end()) return;
    }
}

std::string startsInWords(int starts) {
    if (starts == 0) return "without a start of the daemon";
    return std::to_string(starts) + (starts == 1 ? " start" : " starts") + " of the daemon";
}

std::string jumpsInWords(int jumps) {
    if (jumps == 0) return "";
    return ", the clock jumped " + (jumps == 1 ? "once" : std::to_string(jumps) + " times");
}

void tellHosts(Evidence& evidence) {
    if (evidence.logHosts.size() < 2) return;
    constexpr std::size_t kMostNames = 3;
    std::string names;
    std::size_t shown = 0;
    for (const std::string& host : evidence.logHosts) {
        if (shown++ < kMostNames) names += (names.empty() ? "" : ", ") + shownText(host);
    }
    if (shown > kMostNames) names += " and " + std::to_string(shown - kMostNames) + " more";
    evidence.untold.push_back("whether this is one device: the log has lines of " + names +
                              "; if they are several, read the lines of one only");
}

void tellSilence(const LogStory& story, Evidence& evidence) {
    const std::string when = "its last line is of " + shownTime(*story.end()) +
                             ", though the log goes on until " + shownTime(evidence.now);
    evidence.untold.push_back(evidence.hasProgressLines
                                  ? "how it is reached: the daemon logs each cycle, and " + when +
                                        "; nothing says why"
                                  : "whether the daemon still runs: " + when +
                                        "; such silence is normal at its severity");
}

void summarise(const LogStory& story, int unstamped, Evidence& evidence) {
    const std::string more = "run the daemon with -l 6";
    if (unstamped > 0) {
        cannotSee("log: the time stamp of " + std::to_string(unstamped) +
                      (unstamped == 1 ? " line" : " lines") +
                      " of the daemon is not understood, or lies ahead",
                  evidence);
    }
    if (!story.end()) {
        if (unstamped > 0) return;
        cannotSee("log: it has no line of the daemon", evidence);
        evidence.untold.push_back("how it was before: no log of the daemon was found; " + more);
        return;
    }
    evidence.checks.push_back({Check::Verdict::OK, Source::LOG,
                               "log from " + shownTime(*story.begin()) + " to " +
                                   shownTime(*story.end()) + ", " + startsInWords(story.starts()) +
                                   jumpsInWords(story.clockJumps())});
    tellHosts(evidence);
    if (story.isQuiet()) {
        evidence.untold.push_back("how it is reached: the daemon logs up to severity " +
                                  std::to_string(story.severity()) + " only, and no results; " +
                                  more);
        return;
    }
    if (story.isSilent()) tellSilence(story, evidence);
    if (evidence.hasProgressLines) return;
    evidence.untold.push_back(
        "whether a tunnel came up or was kept, and when the next cycle comes: the log has errors "
        "and notices only; " +
        more + " to have the rest logged");
}

}  // namespace

void lookAtLog(const LogChoice& choice, Evidence& evidence) {
    const bool isKnown = !evidence.fromElsewhere && evidence.hasSettings();
    LogStory story{evidence.has(Sign::MANUAL_MODE) ? LogStory::Ports::MANUAL
                   : isKnown                       ? LogStory::Ports::AUTOMATIC
                                                   : LogStory::Ports::UNKNOWN};
    LineOrder order{story, evidence.now};
    if (!choice.files.empty()) {
        readChosen(choice, order, evidence);
    } else {
        const std::string problem = readJournal(
            [&order](std::string_view line) { order.take(line); }, choice.journalPatience);
        if (!problem.empty()) cannotSee("journal: " + problem, evidence);
        if (!story.end()) readSystemLogs(choice.folder, story, order, evidence);
    }
    if (evidence.fromElsewhere && story.end()) {
        evidence.now = std::max(*story.end(), order.end().value_or(*story.end()));
    }
    story.finish(evidence);
    evidence.logHosts = order.hosts();
    summarise(story, order.unstamped(), evidence);
}

}  // namespace pelorus::doctor
