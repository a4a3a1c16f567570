#include "doctor/log_source.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <utility>

#include "doctor/log_clock.h"
#include "doctor/log_line.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kChunk = std::size_t{256} * 1024;
constexpr std::size_t kHead = std::size_t{64} * 1024;
constexpr std::size_t kTail = std::size_t{16} * 1024;
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

// What follows the name of a log that was rotated: ".1", "-20261101", both also with ".gz".
bool isRotated(std::string_view end) {
    constexpr std::size_t kDate = 8;
    const std::string_view mark = end.substr(0, 1);
    if (mark != "." && mark != "-") return false;
    end.remove_prefix(mark.size());
    const std::size_t digits = std::min(end.find_first_not_of("0123456789"), end.size());
    if (digits < (mark == "-" ? kDate : 1)) return false;
    end.remove_prefix(digits);
    return end.empty() || end == ".gz";
}

bool isContinuation(std::string_view line) {
    return !line.empty() && (line.front() == ' ' || line.front() == '\t');
}

void addTo(std::string& line, std::string_view continuation) {
    const std::size_t begin = std::min(continuation.find_first_not_of(" \t"), continuation.size());
    continuation.remove_prefix(begin);
    line.append(" ").append(continuation);
    line.resize(std::min(line.size(), kLongestLine));
}

}  // namespace

void LineFilter::take(std::string_view piece) {
    const std::size_t first = piece.find('\n');
    const std::string_view rest = piece.substr(0, first);
    open.append(rest.substr(0, kLongestLine - std::min(open.size(), kLongestLine)));
    if (first == std::string_view::npos) return;
    endOpenLine();
    piece.remove_prefix(first + 1);
    const std::size_t last = piece.rfind('\n');
    const std::size_t whole = last == std::string_view::npos ? 0 : last + 1;
    takeWholeLines(piece.substr(0, whole));
    open.assign(piece.substr(whole, kLongestLine));
}

void LineFilter::finish() {
    endOpenLine();
    pass();
}

void LineFilter::endOpenLine() {
    if (held.empty() || !isContinuation(open)) {
        pass();
        if (find(open, kMark) != nullptr) held = open;
    } else {
        addTo(held, open);
    }
    open.clear();
}

// Every line ends in a newline.
void LineFilter::takeWholeLines(std::string_view lines) {
    if (!held.empty()) lines.remove_prefix(takeContinuation(lines));
    while (const char* const hit = find(lines, kMark)) {
        const auto at = static_cast<std::size_t>(hit - lines.data());
        const std::size_t before = lines.rfind('\n', at);
        const std::size_t begin = before == std::string_view::npos ? 0 : before + 1;
        const std::size_t end = lines.find('\n', at);
        held.assign(lines.substr(begin, std::min(end - begin, kLongestLine)));
        lines.remove_prefix(end + 1);
        lines.remove_prefix(takeContinuation(lines));
    }
}

// How much of @p lines continues the line that is held. It is passed on unless all does.
std::size_t LineFilter::takeContinuation(std::string_view lines) {
    std::size_t begin = 0;
    while (begin < lines.size() && isContinuation(lines.substr(begin))) {
        const std::size_t end = lines.find('\n', begin);
        addTo(held, lines.substr(begin, end - begin));
        begin = end + 1;
    }
    if (begin < lines.size()) pass();
    return begin;
}

void LineFilter::pass() {
    if (!held.empty()) taker(held);
    held.clear();
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
    std::optional<Time> first, previous;
    std::string_view rest = head;
    while (!rest.empty()) {
        const std::size_t end = std::min(rest.find('\n'), rest.size() - 1);
        std::string_view line = rest.substr(0, end + 1);
        const auto stamp = takeStamp(line, now);
        if (stamp && (!first || *stamp - *previous > kUnsetClock)) first = stamp;
        if (stamp) previous = stamp;
        rest.remove_prefix(end + 1);
    }
    return first;
}

std::optional<Time> LogStream::lastStamp(Time now) const {
    std::string_view rest = tail;
    while (!rest.empty()) {
        if (rest.back() == '\n') rest.remove_suffix(1);
        const std::size_t end = rest.rfind('\n');
        const std::size_t begin = end == std::string_view::npos ? 0 : end + 1;
        std::string_view line = rest.substr(begin);
        if (const auto stamp = takeStamp(line, now)) return stamp;
        rest = rest.substr(0, begin);
    }
    return std::nullopt;
}

bool LogStream::read(const LineFilter::Taker& taker) {
    LineFilter filter{taker};
    const auto take = [&](std::string_view piece) {
        filter.take(piece);
        tail.append(piece.substr(piece.size() - std::min(piece.size(), kTail)));
        tail.erase(0, tail.size() - std::min(tail.size(), kTail));
    };
    take(std::exchange(head, {}));
    std::vector<char> chunk(kChunk);
    int length = 0;
    while ((length = gzread(file.get(), chunk.data(), kChunk)) > 0) {
        take({chunk.data(), static_cast<std::size_t>(length)});
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

RotatedName rotationOf(const std::string& path) {
    constexpr std::string_view kZipped = ".gz";
    std::string_view name = path;
    const std::size_t zipped = name.size() - std::min(name.size(), kZipped.size());
    if (name.substr(zipped) == kZipped) name = name.substr(0, zipped);
    const std::size_t digits = name.find_last_not_of("0123456789") + 1;
    int number = 0;
    const bool isNumbered = digits > 1 && name[digits - 1] == '.';
    if (isNumbered) std::from_chars(name.data() + digits, name.data() + name.size(), number);
    constexpr int kMostRotations = 1000;  // more is a date
    if (number == 0 || number > kMostRotations) return {std::string{name}, 0};
    return {std::string{name.substr(0, digits - 1)}, number};
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
