#include "support/fake_commands.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
int __real_system(const char* command);
std::FILE* __real_popen(const char* command, const char* mode);
int __real_pclose(std::FILE* pipe);
int __wrap_system(const char* command);
std::FILE* __wrap_popen(const char* command, const char* mode);
int __wrap_pclose(std::FILE* pipe);
}
// NOLINTEND(bugprone-reserved-identifier)

namespace pelorus::support {

namespace {

constexpr int kStatusShift = 8;  // a wait status holds the exit status in its second byte

void checkSignalMask(const char* command) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    for (const int signal : {SIGINT, SIGTERM, SIGQUIT, SIGPIPE}) {
        EXPECT_EQ(sigismember(&mask, signal), 0)
            << "signal " << signal << " is blocked while this child starts: " << command;
    }
}

bool holds(const std::string& command, const std::string& part) {
    return command.find(part) != std::string::npos;
}

}  // namespace

FakeCommands& FakeCommands::get() {
    static FakeCommands instance;
    return instance;
}

void FakeCommands::answer(const std::string& part, Answer answer) {
    rules.emplace_back(part, std::move(answer));
}

void FakeCommands::answer(const std::string& part, const std::string& output, int exitStatus) {
    Answer plain;
    plain.output = output;
    plain.exitStatus = exitStatus;
    answer(part, std::move(plain));
}

void FakeCommands::answerOnce(const std::string& part, Answer answer) {
    once.emplace_back(part, std::move(answer));
}

int FakeCommands::count(const std::string& part) const {
    return static_cast<int>(
        std::count_if(commands.begin(), commands.end(),
                      [&](const std::string& command) { return holds(command, part); }));
}

bool FakeCommands::isReal(const std::string& command) const {
    return std::any_of(realParts.begin(), realParts.end(),
                       [&](const std::string& part) { return holds(command, part); });
}

FakeCommands::Answer FakeCommands::take(const std::string& command) {
    const auto fits = [&](const auto& rule) { return holds(command, rule.first); };
    const auto next = std::find_if(once.begin(), once.end(), fits);
    if (next != once.end()) {
        Answer found = std::move(next->second);
        once.erase(next);
        return found;
    }
    const auto rule = std::find_if(rules.rbegin(), rules.rend(), fits);
    return rule == rules.rend() ? Answer{} : rule->second;
}

int FakeCommands::runSystem(const char* command) {
    checkSignalMask(command);
    commands.emplace_back(command);
    if (isReal(command)) return __real_system(command);
    const Answer answer = take(command);
    if (answer.fails) return -1;
    if (answer.action) answer.action(command);
    return answer.exitStatus << kStatusShift;
}

std::FILE* FakeCommands::openPipe(const char* command, const char* mode) {
    checkSignalMask(command);
    EXPECT_STREQ(mode, "re") << "pipe of: " << command;
    commands.emplace_back(command);
    if (isReal(command)) return __real_popen(command, mode);
    const Answer answer = take(command);
    if (answer.fails) {
        errno = EMFILE;
        return nullptr;
    }
    if (answer.action) answer.action(command);
    std::FILE* pipe = std::tmpfile();
    if (pipe == nullptr) return nullptr;
    EXPECT_EQ(std::fwrite(answer.output.data(), 1, answer.output.size(), pipe),
              answer.output.size());
    std::rewind(pipe);
    openPipes.emplace(pipe, answer.exitStatus);
    return pipe;
}

int FakeCommands::closePipe(std::FILE* pipe) {
    const auto found = openPipes.find(pipe);
    if (found == openPipes.end()) {
        if (!realParts.empty()) return __real_pclose(pipe);
        ADD_FAILURE() << "pclose of something that popen did not give";
        return -1;
    }
    const int status = found->second << kStatusShift;
    openPipes.erase(found);
    static_cast<void>(std::fclose(pipe));
    return status;
}

void FakeCommands::checkClosed() const {
    EXPECT_TRUE(openPipes.empty()) << "pipes left open: " << openPipes.size();
}

void FakeCommands::reset() {
    commands.clear();
    rules.clear();
    once.clear();
    openPipes.clear();
    realParts.clear();
}

}  // namespace pelorus::support

using pelorus::support::FakeCommands;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
int __wrap_system(const char* command) {
    return FakeCommands::get().runSystem(command);
}

std::FILE* __wrap_popen(const char* command, const char* mode) {
    return FakeCommands::get().openPipe(command, mode);
}

int __wrap_pclose(std::FILE* pipe) {
    return FakeCommands::get().closePipe(pipe);
}
// NOLINTEND(bugprone-reserved-identifier)
