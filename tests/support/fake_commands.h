// The shell of a test: system, popen and pclose end here and nothing is run.
#ifndef PELORUS_SUPPORT_FAKE_COMMANDS_H
#define PELORUS_SUPPORT_FAKE_COMMANDS_H

#include <cstdio>
#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

/// Records command lines and answers them. What nobody answers succeeds without output. A
/// command that starts while a termination signal or SIGPIPE is blocked fails the test: the
/// child would inherit the mask. So does a pipe not opened close-on-exec.
class FakeCommands {
public:
    struct Answer {
        std::string output{};  ///< what a popen reader reads
        int exitStatus = 0;
        bool fails = false;                                ///< system returns -1, popen null
        std::function<void(const std::string&)> action{};  ///< runs as the command
    };

    static FakeCommands& get();

    /// Answers every command that holds @p part. A later rule goes before an earlier one.
    void answer(const std::string& part, Answer answer);
    void answer(const std::string& part, const std::string& output, int exitStatus = 0);
    /// Answers the next command that holds @p part, before any standing rule; several for one
    /// part in the order in which they were given.
    void answerOnce(const std::string& part, Answer answer);
    /// Lets the real shell run the system calls that hold @p part.
    void runForReal(const std::string& part) { realParts.push_back(part); }

    [[nodiscard]] const std::vector<std::string>& lines() const { return commands; }
    /// How many command lines hold @p part.
    [[nodiscard]] int count(const std::string& part) const;
    /// Forgets the lines, not the answers.
    void clear() { commands.clear(); }

    /// Fails the test when a pipe was not closed with pclose.
    void checkClosed() const;
    void reset() { *this = FakeCommands{}; }

    int runSystem(const char* command);
    std::FILE* openPipe(const char* command, const char* mode);
    int closePipe(std::FILE* pipe);

private:
    FakeCommands() = default;
    Answer take(const char* command);

    std::vector<std::string> commands;
    std::vector<std::pair<std::string, Answer>> rules;
    std::vector<std::pair<std::string, Answer>> once;
    std::map<std::FILE*, int> openPipes;  // with the exit status
    std::vector<std::string> realParts;
};

}  // namespace pelorus::support

#endif
