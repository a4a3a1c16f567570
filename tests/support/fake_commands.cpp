#include "support/fake_commands.h"

#include <sys/wait.h>

#include <cerrno>

namespace pelorus::support {

FakeCommands::Answer FakeCommands::run(const char* command) {
    EXPECT_FALSE(areBlocked({SIGTERM}) || areBlocked({SIGPIPE})) << "inherited by: " << command;
    Answer answer = take(command, {});
    if (answer.action) answer.action(command);
    return answer;
}

extern "C" {
int __real_system(const char* command);

int __wrap_system(const char* command) {
    FakeCommands& fake = FakeCommands::get();
    EXPECT_TRUE(areBlocked({SIGINT, SIGQUIT})) << "would be lost during: " << command;
    const FakeCommands::Answer answer = fake.run(command);
    if (holds(command, fake.realPart)) return __real_system(command);
    errno = ECHILD;
    // Where that is ignored the C library waits in vain for the shell, which has run.
    struct sigaction child {};
    sigaction(SIGCHLD, nullptr, &child);
    return answer.fails || child.sa_handler == SIG_IGN ? -1 : W_EXITCODE(answer.exitStatus, 0);
}

std::FILE* __wrap_popen(const char* command, const char* mode) {
    EXPECT_STREQ(mode, "re") << "pipe of: " << command;
    const FakeCommands::Answer answer = FakeCommands::get().run(command);
    errno = EMFILE;
    if (answer.fails) return nullptr;
    std::FILE* pipe = std::tmpfile();
    if (pipe == nullptr) return nullptr;
    std::fwrite(answer.output.data(), 1, answer.output.size(), pipe);
    std::rewind(pipe);
    return *FakeCommands::get().openPipes.insert(pipe).first;
}

int __wrap_pclose(std::FILE* pipe) {
    EXPECT_EQ(FakeCommands::get().openPipes.erase(pipe), 1U) << "closed a pipe that is not open";
    return std::fclose(pipe);
}
}

}  // namespace pelorus::support
