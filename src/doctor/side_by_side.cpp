#include "doctor/side_by_side.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <string>
#include <utility>

namespace pelorus::doctor {

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kMostSent = 64UL * 1024;  // bytes of one probe

// A line is shorter than what a pipe takes at once, so that it is sent whole.
void sendLine(int pipe, const std::string& line) {
    const ssize_t sent = write(pipe, line.data(), line.size());
    if (sent != static_cast<ssize_t>(line.size())) _exit(EXIT_FAILURE);
}

[[noreturn]] void runChild(const Probe& probe, int pipe, pid_t parent) {
    settleChild(parent);
    try {
        Findings findings{[pipe](const std::string& line) { sendLine(pipe, line); }};
        probe(findings);
        findings.finish();
    } catch (...) {
        _exit(EXIT_FAILURE);
    }
    _exit(EXIT_SUCCESS);
}

// A probe's process and what it has sent. Destroying it ends the process.
class Child {
public:
    explicit Child(const Probe& probe) {
        std::array<int, 2> ends{};
        if (pipe2(ends.data(), O_CLOEXEC) != 0) return;
        const pid_t parent = getpid();
        pid = fork();
        if (pid == 0) runChild(probe, ends[1], parent);
        static_cast<void>(close(ends[1]));
        input = ends[0];
        if (pid < 0) closeInput();
    }
    ~Child() {
        closeInput();
        if (pid <= 0) return;
        static_cast<void>(kill(pid, SIGKILL));
        while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
        }
    }
    Child(Child&& other) noexcept
        : pid{std::exchange(other.pid, -1)},
          input{std::exchange(other.input, -1)},
          sent{std::move(other.sent)} {}
    Child& operator=(Child&&) = delete;
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    // -1 when nothing more can come.
    [[nodiscard]] int descriptor() const { return input; }

    void receive() {
        std::array<char, 4096> bytes{};
        const ssize_t size = ::read(input, bytes.data(), bytes.size());
        if (size < 0 && errno == EINTR) return;
        if (size > 0) sent.append(bytes.data(), static_cast<std::size_t>(size));
        if (size <= 0 || sent.size() > kMostSent) closeInput();
    }

    [[nodiscard]] Findings findings() const {
        Findings found;
        return sent.size() <= kMostSent && found.read(sent) ? found : Findings{};
    }

private:
    void closeInput() {
        if (input >= 0) static_cast<void>(close(std::exchange(input, -1)));
    }

    pid_t pid = -1;
    int input = -1;
    std::string sent;
};

// Negative descriptors are left out by poll.
std::vector<pollfd> waitedFor(const std::vector<Child>& children) {
    std::vector<pollfd> waited;
    waited.reserve(children.size());
    for (const Child& child : children) waited.push_back({child.descriptor(), POLLIN, 0});
    return waited;
}

bool allEnded(const std::vector<Child>& children) {
    return std::all_of(children.begin(), children.end(),
                       [](const Child& child) { return child.descriptor() < 0; });
}

void receiveUntil(Clock::time_point end, std::vector<Child>& children) {
    while (!allEnded(children)) {
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (left <= 0) return;
        std::vector<pollfd> waited = waitedFor(children);
        if (poll(waited.data(), waited.size(), static_cast<int>(left)) <= 0) continue;
        for (std::size_t i = 0; i < waited.size(); ++i) {
            if (waited[i].revents != 0) children[i].receive();
        }
    }
}

}  // namespace

void settleChild(pid_t parent) {
    static_cast<void>(prctl(PR_SET_PDEATHSIG, SIGKILL));
    if (getppid() != parent) _exit(EXIT_FAILURE);
    for (int number = 1; number <= SIGRTMAX; ++number) static_cast<void>(signal(number, SIG_DFL));
    sigset_t none;
    static_cast<void>(sigemptyset(&none));
    static_cast<void>(sigprocmask(SIG_SETMASK, &none, nullptr));
    const rlimit noCore{0, 0};
    static_cast<void>(setrlimit(RLIMIT_CORE, &noCore));
    const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    for (const int standard : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        if (null >= 0) static_cast<void>(dup2(null, standard));
    }
    // The shared modules log; nothing has this priority.
    static_cast<void>(setlogmask(LOG_MASK(LOG_EMERG)));
}

std::vector<Findings> runSideBySide(const std::vector<Probe>& probes,
                                    std::chrono::milliseconds limit) {
    const Clock::time_point end = Clock::now() + limit;
    std::vector<Child> children;
    children.reserve(probes.size());
    for (const Probe& probe : probes) children.emplace_back(probe);
    receiveUntil(end, children);
    std::vector<Findings> found;
    found.reserve(children.size());
    for (const Child& child : children) found.push_back(child.findings());
    return found;
}

}  // namespace pelorus::doctor
