#include "doctor/program.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <sstream>

#include "common/text.h"
#include "doctor/side_by_side.h"

namespace pelorus::doctor {

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kMoreFolders =
    ":/usr/local/sbin:/usr/sbin:/sbin:/usr/local/bin:/usr/bin:/bin";
constexpr std::size_t kMostOutput = 4096;

bool isProgram(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
           access(path.c_str(), X_OK) == 0;
}

[[noreturn]] void execute(const std::string& program,
                          std::vector<std::string> words,
                          int output,
                          pid_t parent) {
    settleChild(parent);
    static_cast<void>(dup2(output, STDOUT_FILENO));
    std::vector<char*> arguments;
    arguments.reserve(words.size() + 1);
    for (std::string& word : words) arguments.push_back(word.data());
    arguments.push_back(nullptr);
    execv(program.c_str(), arguments.data());
    _exit(EXIT_FAILURE);
}

// Until its end, the most that is taken, or the limit; nothing in the last case.
std::optional<std::string> readAll(int input, Clock::time_point end) {
    std::string text;
    while (text.size() < kMostOutput) {
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (left <= 0) return std::nullopt;
        pollfd waited{input, POLLIN, 0};
        if (poll(&waited, 1, static_cast<int>(left)) <= 0) continue;
        std::array<char, 512> bytes{};
        const ssize_t size = read(input, bytes.data(), bytes.size());
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) break;
        text.append(bytes.data(), static_cast<std::size_t>(size));
    }
    return text;
}

}  // namespace

std::string findProgram(const std::string& name) {
    if (contains(name, "/")) return isProgram(name) ? name : std::string{};
    const char* const path = std::getenv("PATH");
    std::istringstream folders{std::string{path == nullptr ? "" : path} + kMoreFolders};
    for (std::string folder; std::getline(folders, folder, ':');) {
        if (folder.empty()) continue;
        folder.append("/").append(name);
        if (isProgram(folder)) return folder;
    }
    return {};
}

std::optional<std::string> outputOf(const std::vector<std::string>& words,
                                    std::chrono::milliseconds limit) {
    const std::string program = findProgram(words.front());
    std::array<int, 2> ends{};
    if (program.empty() || pipe2(ends.data(), O_CLOEXEC) != 0) return std::nullopt;
    const pid_t parent = getpid();
    const pid_t pid = fork();
    if (pid == 0) execute(program, words, ends[1], parent);
    static_cast<void>(close(ends[1]));
    std::optional<std::string> output;
    if (pid > 0) output = readAll(ends[0], Clock::now() + limit);
    static_cast<void>(close(ends[0]));
    if (pid <= 0) return std::nullopt;
    static_cast<void>(kill(pid, SIGKILL));
    // A program that waits for a disk may not end at once, even so.
    static_cast<void>(waitpid(pid, nullptr, WNOHANG));
    return output;
}

}  // namespace pelorus::doctor
