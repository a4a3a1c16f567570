#include "doctor/journal.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::size_t kChunk = std::size_t{256} * 1024;

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

}  // namespace

std::string readJournal(const LineFilter::Taker& taker, std::chrono::milliseconds patience) {
    JournalProcess journal;
    return journal.start() ? journal.read(taker, patience) : journal.problem;
}

}  // namespace pelorus::doctor
