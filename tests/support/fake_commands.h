// The shell of a test: system, popen and pclose end here and nothing is run.
#ifndef PELORUS_SUPPORT_FAKE_COMMANDS_H
#define PELORUS_SUPPORT_FAKE_COMMANDS_H

#include <cstdio>
#include <functional>
#include <map>

#include "support/fake.h"

namespace pelorus::support {

struct CommandAnswer {
    std::string output{};  ///< what a popen reader reads
    int exitStatus = 0;
    bool fails = false;                                ///< system returns -1, popen null
    std::function<void(const std::string&)> action{};  ///< runs as the command
};

/// What nobody answers succeeds without output. A command that starts while a termination signal
/// or SIGPIPE is blocked fails the test: the child would inherit the mask. So does a pipe not
/// opened close-on-exec.
class FakeCommands : public Single<FakeCommands>, public Script<CommandAnswer> {
public:
    using Answer = CommandAnswer;
    using Script::answer;
    void answer(const std::string& part, const std::string& output, int exitStatus = 0) {
        answer(part, Answer{output, exitStatus});
    }
    /// Lets the real shell run the system calls that hold @p part.
    void runForReal(const std::string& part) { realPart = part; }
    [[nodiscard]] const std::vector<std::string>& lines() const { return asked; }
    /// Fails the test when a pipe was not closed with pclose.
    void checkClosed() const;
    Answer run(const char* command);

    std::map<std::FILE*, int> openPipes;  ///< with the exit status
    std::string realPart = "\n";          ///< in no command
};

}  // namespace pelorus::support

#endif
