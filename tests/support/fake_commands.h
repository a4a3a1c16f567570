// The shell of a test: system, popen and pclose end here and nothing is run.
#ifndef PELORUS_SUPPORT_FAKE_COMMANDS_H
#define PELORUS_SUPPORT_FAKE_COMMANDS_H

#include <cstdio>

#include "support/fake.h"

namespace pelorus::support {

struct CommandAnswer {
    std::string output{};                              ///< what a popen reader reads
    int exitStatus = 0;                                ///< of system
    bool fails = false;                                ///< system returns -1, popen null
    std::function<void(const std::string&)> action{};  ///< runs as the command
};

/// A command without a rule succeeds with no output. Fails the test when a command starts while a
/// termination signal or SIGPIPE is blocked, or a pipe is not close-on-exec: a child inherits both.
class FakeCommands : public Single<FakeCommands>, public Script<CommandAnswer> {
public:
    using Answer = CommandAnswer;
    using Script::answer;
    void answer(const std::string& part, const std::string& output, int exitStatus = 0) {
        answer(part, Answer{output, exitStatus});
    }
    [[nodiscard]] const Texts& lines() const { return calls(); }
    /// Fails the test when a pipe was not closed with pclose.
    void checkClosed() const { EXPECT_TRUE(openPipes.empty()); }
    Answer run(const char* command);

    std::string realPart = "\n";  ///< the real shell runs the system calls that hold it
    std::set<std::FILE*> openPipes;
};

}  // namespace pelorus::support

#endif
