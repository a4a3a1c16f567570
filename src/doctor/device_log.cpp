#include "doctor/device_log.h"

#include <algorithm>
#include <array>
#include <ctime>
#include <functional>
#include <memory>
#include <set>

#include "doctor/journal.h"
#include "doctor/log_line.h"
#include "doctor/log_source.h"
#include "doctor/log_story.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::array<const char*, 3> kSystemLogs{"syslog", "messages", "user.log"};
constexpr std::size_t kMostHashes = 4096;

// Passes on the lines of several files, without what a file repeats of the ones before.
class LineOrder {
public:
    LineOrder(LogStory& listener, Time today) : story{listener}, now{today} {}

    void beginFile() {
        repeating = story.end().has_value();
        // A clock that once ran ahead must not hide what came later.
        newest = std::min(story.end().value_or(Time{}), now);
    }

    void take(std::string_view text) {
        const auto line = readLogLine(text, now);
        if (!line) return;
        if (repeating && line->when <= newest && isRepeated(*line)) return;
        if (line->when > newest) repeating = false;
        remember(*line);
        if (line->host != lastHost) meet(line->host);
        story.take(*line);
    }

    [[nodiscard]] const std::set<std::string>& hosts() const { return met; }

private:
    void meet(std::string_view host) {
        constexpr std::size_t kMostHosts = 1000;
        lastHost = host;
        if (met.size() < kMostHosts) met.insert(lastHost);
    }

    [[nodiscard]] bool isRepeated(const LogLine& line) const {
        return line.when < newest || hashes.count(std::hash<std::string_view>{}(line.text)) != 0;
    }

    // The lines of the newest second.
    void remember(const LogLine& line) {
        if (line.when != hashTime) hashes.clear();
        hashTime = line.when;
        if (hashes.size() < kMostHashes) hashes.insert(std::hash<std::string_view>{}(line.text));
    }

    LogStory& story;
    Time now;
    Time newest{};
    Time hashTime{};
    std::set<std::size_t> hashes;
    std::string lastHost;
    std::set<std::string> met;
    bool repeating = false;
};

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
    Time begin{};
    std::unique_ptr<LogStream> stream;  // only of what cannot be read twice
};

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
        entries.push_back({path, begin, std::move(stream)});
    }
    std::stable_sort(entries.begin(), entries.end(),
                     [](const Entry& a, const Entry& b) { return a.begin < b.begin; });
    return entries;
}

// Empty when it was read to its end.
std::string readFile(LogStream& stream, const std::string& path, LineOrder& order) {
    order.beginFile();
    const bool whole =
        stream.isOpen() && stream.read([&order](std::string_view line) { order.take(line); });
    return whole ? std::string{} : "log " + shownPath(path) + ": " + stream.problem;
}

void readChosen(const LogChoice& choice, LineOrder& order, Evidence& evidence) {
    for (Entry& entry : inOrder(choice.files, evidence)) {
        if (!entry.stream) entry.stream = std::make_unique<LogStream>(entry.path, true);
        const std::string problem = readFile(*entry.stream, entry.path, order);
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
            const std::string found = readFile(stream, path, order);
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

void summarise(const LogStory& story, Evidence& evidence) {
    const std::string more = "run the daemon with -l 6";
    if (!story.end()) {
        cannotSee("log: it has no line of the daemon", evidence);
        evidence.untold.push_back("how it was before: no log of the daemon was found; " + more);
        return;
    }
    evidence.checks.push_back({Check::Verdict::OK, Source::LOG,
                               "log from " + shownTime(*story.begin()) + " to " +
                                   shownTime(*story.end()) + ", " + startsInWords(story.starts())});
    if (evidence.hasProgressLines) return;
    evidence.untold.push_back(
        "whether a tunnel came up or was kept, and when the next cycle comes: the log has errors "
        "and notices only; " +
        more + " to have the rest logged");
}

}  // namespace

void lookAtLog(const LogChoice& choice, Evidence& evidence) {
    LogStory story{evidence.has(Sign::MANUAL_MODE) ? LogStory::Ports::MANUAL
                                                   : LogStory::Ports::AUTOMATIC};
    LineOrder order{story, evidence.now};
    if (!choice.files.empty()) {
        readChosen(choice, order, evidence);
    } else {
        const std::string problem = readJournal(
            [&order](std::string_view line) { order.take(line); }, choice.journalPatience);
        if (!problem.empty()) cannotSee("journal: " + problem, evidence);
        if (!story.end()) readSystemLogs(choice.folder, story, order, evidence);
    }
    if (evidence.fromElsewhere && story.end()) evidence.now = *story.end();
    story.finish(evidence);
    evidence.logHosts = order.hosts();
    summarise(story, evidence);
}

}  // namespace pelorus::doctor
