#include "support/fake_commands.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <algorithm>
#include <cerrno>
#include <csignal>

// NOLINTNEXTLINE(bugprone-reserved-identifier): a name the linker gives
extern "C" int __real_system(const char* command);

namespace pelorus::support {

namespace {

void checkSignalMask(const char* command) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    for (const int signal : {SIGINT, SIGTERM, SIGQUIT, SIGPIPE}) {
        EXPECT_EQ(sigismember(&mask, signal), 0)
            << "signal " << signal << " is blocked while this child starts: " << command;
    }
}

}  // namespace

FakeCommands& FakeCommands::get() {
    static FakeCommands instance;
    return instance;
}

void FakeCommands::answer(const std::string& part, Answer answer) {
    rules.emplace(rules.begin(), part, std::move(answer));
}

void FakeCommands::answer(const std::string& part, const std::string& output, int exitStatus) {
    answer(part, Answer{output, exitStatus});
}

void FakeCommands::answerOnce(const std::string& part, Answer answer) {
    once.emplace_back(part, std::move(answer));
}

int FakeCommands::count(const std::string& part) const {
    return static_cast<int>(std::count_if(
        commands.begin(), commands.end(),
        [&](const std::string& command) { return command.find(part) != std::string::npos; }));
}

// Records the command and answers it.
FakeCommands::Answer FakeCommands::take(const char* command) {
    checkSignalMask(command);
    const std::string line = commands.emplace_back(command);
    const auto fits = [&](const auto& rule) { return line.find(rule.first) != std::string::npos; };
    Answer answer;
    if (const auto next = std::find_if(once.begin(), once.end(), fits); next != once.end()) {
        answer = next->second;
        once.erase(next);
    } else if (const auto rule = std::find_if(rules.begin(), rules.end(), fits);
               rule != rules.end()) {
        answer = rule->second;
    }
    if (answer.action) answer.action(line);
    return answer;
}

int FakeCommands::runSystem(const char* command) {
    const Answer answer = take(command);
    for (const std::string& part : realParts) {
        if (commands.back().find(part) != std::string::npos) return __real_system(command);
    }
    return answer.fails ? -1 : W_EXITCODE(answer.exitStatus, 0);
}

std::FILE* FakeCommands::openPipe(const char* command, const char* mode) {
    EXPECT_STREQ(mode, "re") << "pipe of: " << command;
    const Answer answer = take(command);
    errno = EMFILE;
    if (answer.fails) return nullptr;
    std::FILE* pipe = std::tmpfile();
    std::fwrite(answer.output.data(), 1, answer.output.size(), pipe);
    std::rewind(pipe);
    openPipes.emplace(pipe, answer.exitStatus);
    return pipe;
}

int FakeCommands::closePipe(std::FILE* pipe) {
    const int status = openPipes.at(pipe);
    openPipes.erase(pipe);
    std::fclose(pipe);
    return W_EXITCODE(status, 0);
}

void FakeCommands::checkClosed() const {
    EXPECT_TRUE(openPipes.empty()) << "pipes left open: " << openPipes.size();
}

}  // namespace pelorus::support

using pelorus::support::FakeCommands;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
int __wrap_system(const char* command) {
    return FakeCommands::get().runSystem(command);
}

std::FILE* __wrap_popen(const char* command, const char* mode) {
    return FakeCommands::get().openPipe(command, mode);
}

int __wrap_pclose(std::FILE* pipe) {
    return FakeCommands::get().closePipe(pipe);
}
}
// NOLINTEND(bugprone-reserved-identifier)
