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
        bool fails = false;  ///< system returns -1, popen null
        /// Runs as the command, e.g. makes a file; gets the command line.
        std::function<void(const std::string&)> action{};
    };

    static FakeCommands& get();

    /// Answers every command that holds @p part. A later rule goes before an earlier one.
    void answer(const std::string& part, Answer answer);
    /// Shorthand for output and exit status.
    void answer(const std::string& part, const std::string& output, int exitStatus = 0);
    /// Answers the next command that holds @p part, once, before any standing rule. Several for
    /// one part are used in the order in which they were given.
    void answerOnce(const std::string& part, Answer answer);

    /// All command lines so far, in order.
    [[nodiscard]] const std::vector<std::string>& lines() const { return commands; }
    /// How many of them hold @p part.
    [[nodiscard]] int count(const std::string& part) const;
    /// Forgets the lines, not the answers.
    void clear() { commands.clear(); }

    /// Lets the real shell run the commands that hold @p part; nothing else answers them then.
    void runForReal(const std::string& part = "") { realParts.push_back(part); }

    /// Fails the test when a pipe was not closed with pclose.
    void checkClosed() const;
    void reset();

    int runSystem(const char* command);
    std::FILE* openPipe(const char* command, const char* mode);
    int closePipe(std::FILE* pipe);

private:
    FakeCommands() = default;
    [[nodiscard]] bool isReal(const std::string& command) const;
    Answer take(const std::string& command);

    std::vector<std::string> commands;
    std::vector<std::pair<std::string, Answer>> rules;
    std::vector<std::pair<std::string, Answer>> once;
    std::map<std::FILE*, int> openPipes;  // with the exit status
    std::vector<std::string> realParts;
};

}  // namespace pelorus::support

#endif
