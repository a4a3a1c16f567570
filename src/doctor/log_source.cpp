#include "doctor/log_source.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <utility>

#include "doctor/log_line.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kChunk = std::size_t{256} * 1024;
constexpr std::size_t kHead = std::size_t{64} * 1024;
constexpr std::size_t kLongestLine = std::size_t{8} * 1024;
constexpr std::string_view kMark = "elorus";  // however the name begins

const char* find(std::string_view text, std::string_view wanted) {
    return static_cast<const char*>(memmem(text.data(), text.size(), wanted.data(), wanted.size()));
}

// What reading takes part in may be anything but a device, which could hang or act.
int openToRead(const std::string& path, bool orPipe, std::string& problem) {
    if (path == "-") return dup(STDIN_FILENO);
    const int descriptor = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
    if (descriptor < 0) {
        problem = std::generic_category().message(errno);
        return -1;
    }
    struct stat status {};
    const bool known = fstat(descriptor, &status) == 0;
    if (known && S_ISREG(status.st_mode)) return descriptor;
    if (known && orPipe && S_ISFIFO(status.st_mode)) {
        static_cast<void>(fcntl(descriptor, F_SETFL, O_RDONLY));
        return descriptor;
    }
    close(descriptor);
    problem = "it is no regular file";
    return -1;
}

// The journal's reader, whose output and complaints come through two pipes.
class JournalProcess {
public:
    JournalProcess() = default;
    ~JournalProcess() {
        for (pollfd& end : ends) closeEnd(end);
        if (child > 0) static_cast<void>(finish());
    }
    JournalProcess(const JournalProcess&) = delete;
    JournalProcess& operator=(const JournalProcess&) = delete;

    // False when it does not start; `problem` is empty if there is no such program.
    bool start();
    // The problem, empty if there is none. Patience is with a reader that writes nothing.
    std::string read(const LineFilter::Taker& taker, std::chrono::milliseconds patience);

    std::string problem;

private:
    [[nodiscard]] bool isOpen() const { return ends[0].fd >= 0 || ends[1].fd >= 0; }
    static void closeEnd(pollfd& end) {
        if (end.fd >= 0) close(std::exchange(end.fd, -1));
    }
    void takeOutput(LineFilter& filter);
    void takeComplaint();
    int finish();

    pid_t child = 0;
    std::array<pollfd, 2> ends{{{-1, POLLIN, 0}, {-1, POLLIN, 0}}};
    std::vector<char> chunk = std::vector<char>(kChunk);
    std::string complaint;
};

bool JournalProcess::start() {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    std::array<int, 2> inner{-1, -1};
    for (std::size_t i = 0; i < ends.size(); ++i) {
        std::array<int, 2> both{-1, -1};
        if (pipe2(both.data(), O_CLOEXEC) != 0) continue;
        ends[i].fd = both[0];
        inner[i] = both[1];
        posix_spawn_file_actions_adddup2(&actions, both[1], static_cast<int>(i) + STDOUT_FILENO);
    }
    std::array<std::string, 9> words{"journalctl", "-q", "-o",      "short-iso", "-t",
                                     "Pelorus",    "-t", "pelorus", "--no-pager"};
    std::array<char*, 10> arguments{};
    std::transform(words.begin(), words.end(), arguments.begin(),
                   [](std::string& word) { return word.data(); });
    const int error =
        posix_spawnp(&child, arguments[0], &actions, nullptr, arguments.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    for (const int end : inner) {
        if (end >= 0) close(end);
    }
    if (error == 0) return true;
    child = 0;
    if (error != ENOENT) problem = std::generic_category().message(error);
    return false;
}

std::string JournalProcess::read(const LineFilter::Taker& taker,
                                 std::chrono::milliseconds patience) {
    LineFilter filter{taker};
    while (isOpen() && problem.empty()) {
        const int ready = poll(ends.data(), ends.size(), static_cast<int>(patience.count()));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) {
            kill(child, SIGKILL);
            problem =
                "no line for " +
                std::to_string(std::chrono::duration_cast<std::chrono::seconds>(patience).count()) +
                " s";
            break;
        }
        if (ends[0].revents != 0) takeOutput(filter);
        if (ends[1].revents != 0) takeComplaint();
    }
    filter.finish();
    const int status = finish();
    if (problem.empty() && status != 0) {
        problem = shownText(std::string_view{complaint}.substr(0, complaint.find('\n')));
        if (problem.empty()) problem = "journalctl ended with status " + std::to_string(status);
    }
    return problem;
}

void JournalProcess::takeOutput(LineFilter& filter) {
    const ssize_t length = ::read(ends[0].fd, chunk.data(), chunk.size());
    if (length > 0) {
        filter.take({chunk.data(), static_cast<std::size_t>(length)});
    } else {
        closeEnd(ends[0]);
    }
}

void JournalProcess::takeComplaint() {
    constexpr std::size_t kMostOfComplaint = 1024;
    const ssize_t length = ::read(ends[1].fd, chunk.data(), chunk.size());
    if (length <= 0) {
        closeEnd(ends[1]);
    } else if (complaint.size() < kMostOfComplaint) {
        complaint.append(chunk.data(), static_cast<std::size_t>(length));
    }
}

// Its exit status; that of a signal is as in a shell.
int JournalProcess::finish() {
    constexpr int kBySignal = 128;
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    child = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : kBySignal + WTERMSIG(status);
}

// What follows the name of a log that was rotated: ".1", "-20261101", both also with ".gz".
bool isRotated(std::string_view end) {
    constexpr std::size_t kDate = 8;
    if (end.empty() || (end.front() != '.' && end.front() != '-')) return false;
    const std::size_t digits = std::min(end.find_first_not_of("0123456789", 1), end.size()) - 1;
    if (digits < (end.front() == '-' ? kDate : 1)) return false;
    end.remove_prefix(digits + 1);
    return end.empty() || end == ".gz";
}

}  // namespace

void LineFilter::take(std::string_view piece) {
    const void* const last = memrchr(piece.data(), '\n', piece.size());
    if (last == nullptr) {
        open.append(piece.substr(0, kLongestLine - std::min(open.size(), kLongestLine)));
        return;
    }
    const std::size_t whole =
        static_cast<std::size_t>(static_cast<const char*>(last) - piece.data());
    if (!open.empty()) {
        const std::size_t first = piece.find('\n');
        open.append(
            piece.substr(0, std::min(first, kLongestLine - std::min(open.size(), kLongestLine))));
        finish();
        piece.remove_prefix(first + 1);
        takeWholeLines(piece.substr(0, whole < first + 1 ? 0 : whole - first));
        piece.remove_prefix(whole < first + 1 ? 0 : whole - first);
    } else {
        takeWholeLines(piece.substr(0, whole + 1));
        piece.remove_prefix(whole + 1);
    }
    open.assign(piece.substr(0, kLongestLine));
}

void LineFilter::finish() {
    if (find(open, kMark) != nullptr) pass(open);
    open.clear();
}

// Every line ends in a newline.
void LineFilter::takeWholeLines(std::string_view lines) {
    while (const char* const hit = find(lines, kMark)) {
        const auto at = static_cast<std::size_t>(hit - lines.data());
        const std::size_t before = lines.rfind('\n', at);
        const std::size_t begin = before == std::string_view::npos ? 0 : before + 1;
        const std::size_t end = lines.find('\n', at);
        pass(lines.substr(begin, end - begin));
        lines.remove_prefix(end + 1);
    }
}

void LineFilter::pass(std::string_view line) {
    taker(line.substr(0, kLongestLine));
}

LogStream::LogStream(const std::string& path, bool orPipe) {
    const int descriptor = openToRead(path, orPipe, problem);
    if (descriptor < 0) return;
    struct stat status {};
    pipe = fstat(descriptor, &status) != 0 || !S_ISREG(status.st_mode) || path == "-";
    file.reset(gzdopen(descriptor, "rb"));
    if (!file) close(descriptor);
}

LogStream::LogStream(int descriptor) : file{gzdopen(descriptor, "rb")} {
    if (!file) close(descriptor);
}

std::optional<Time> LogStream::firstStamp(Time now) {
    head.resize(kHead);
    const int length = gzread(file.get(), head.data(), kHead);
    head.resize(length < 0 ? 0 : static_cast<std::size_t>(length));
    std::string_view rest = head;
    while (!rest.empty()) {
        const std::size_t end = std::min(rest.find('\n'), rest.size() - 1);
        std::string_view line = rest.substr(0, end + 1);
        if (const auto stamp = takeStamp(line, now)) return stamp;
        rest.remove_prefix(end + 1);
    }
    return std::nullopt;
}

bool LogStream::read(const LineFilter::Taker& taker) {
    LineFilter filter{taker};
    filter.take(std::exchange(head, {}));
    std::vector<char> chunk(kChunk);
    int length = 0;
    while ((length = gzread(file.get(), chunk.data(), kChunk)) > 0) {
        filter.take({chunk.data(), static_cast<std::size_t>(length)});
    }
    filter.finish();
    int code = Z_OK;
    const char* const message = gzerror(file.get(), &code);
    if (length == 0 && (code == Z_OK || code == Z_STREAM_END)) return true;
    problem = code == Z_BUF_ERROR ? std::string{"its end is missing"}
              : code == Z_ERRNO   ? std::string{"it cannot be read"}
                                  : std::string{"it is damaged: "} + message;
    return false;
}

std::string readJournal(const LineFilter::Taker& taker, std::chrono::milliseconds patience) {
    JournalProcess journal;
    return journal.start() ? journal.read(taker, patience) : journal.problem;
}

std::vector<std::string> rotatedLogs(const std::string& folder, const std::string& name) {
    namespace fs = std::filesystem;
    std::vector<std::pair<fs::file_time_type, std::string>> found;
    std::error_code error;
    for (fs::directory_iterator entry{folder, error}; !error && entry != fs::directory_iterator{};
         entry.increment(error)) {
        const std::string file = entry->path().filename();
        if (file.compare(0, name.size(), name) != 0) continue;
        const std::string end = file.substr(name.size());
        if (!end.empty() && !isRotated(end)) continue;
        std::error_code ignored;
        found.emplace_back(entry->last_write_time(ignored), entry->path());
    }
    std::sort(found.begin(), found.end());
    std::vector<std::string> paths;
    paths.reserve(found.size());
    for (auto& [when, path] : found) paths.push_back(std::move(path));
    return paths;
}

}  // namespace pelorus::doctor
