#include "support/fake_commands.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cerrno>

namespace pelorus::support {

FakeCommands::Answer FakeCommands::run(const char* command) {
    EXPECT_FALSE(isBlocked(SIGTERM) || isBlocked(SIGPIPE)) << "inherited by: " << command;
    Answer answer = take(command, {});
    if (answer.action) answer.action(command);
    return answer;
}

void FakeCommands::checkClosed() const {
    EXPECT_TRUE(openPipes.empty()) << "pipes left open: " << openPipes.size();
}

extern "C" {
int __real_system(const char* command);

int __wrap_system(const char* command) {
    FakeCommands& fake = FakeCommands::get();
    EXPECT_TRUE(isBlocked(SIGINT) && isBlocked(SIGQUIT)) << "would be lost during: " << command;
    const FakeCommands::Answer answer = fake.run(command);
    if (std::string{command}.find(fake.realPart) != std::string::npos) {
        return __real_system(command);
    }
    return answer.fails ? -1 : W_EXITCODE(answer.exitStatus, 0);
}

std::FILE* __wrap_popen(const char* command, const char* mode) {
    EXPECT_STREQ(mode, "re") << "pipe of: " << command;
    const FakeCommands::Answer answer = FakeCommands::get().run(command);
    errno = EMFILE;
    if (answer.fails) return nullptr;
    std::FILE* pipe = std::tmpfile();
    std::fwrite(answer.output.data(), 1, answer.output.size(), pipe);
    std::rewind(pipe);
    FakeCommands::get().openPipes.emplace(pipe, answer.exitStatus);
    return pipe;
}

int __wrap_pclose(std::FILE* pipe) {
    const auto open = FakeCommands::get().openPipes.extract(pipe);
    std::fclose(pipe);
    return W_EXITCODE(open.mapped(), 0);
}
}

}  // namespace pelorus::support
