#include "support/fake_commands.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cerrno>
#include <csignal>

using pelorus::support::FakeCommands;

extern "C" {
int __real_system(const char* command);

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

namespace pelorus::support {

FakeCommands::Answer FakeCommands::run(const char* command) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    for (const int signal : {SIGINT, SIGTERM, SIGQUIT, SIGPIPE}) {
        EXPECT_EQ(sigismember(&mask, signal), 0)
            << "signal " << signal << " is blocked while this child starts: " << command;
    }
    const Answer answer = take(command, {});
    if (answer.action) answer.action(command);
    return answer;
}

int FakeCommands::runSystem(const char* command) {
    const Answer answer = run(command);
    if (std::string{command}.find(realPart) != std::string::npos) return __real_system(command);
    return answer.fails ? -1 : W_EXITCODE(answer.exitStatus, 0);
}

std::FILE* FakeCommands::openPipe(const char* command, const char* mode) {
    EXPECT_STREQ(mode, "re") << "pipe of: " << command;
    const Answer answer = run(command);
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
