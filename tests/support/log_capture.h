// The system log of a test: syslog, openlog and setlogmask end here.
#ifndef PELORUS_SUPPORT_LOG_CAPTURE_H
#define PELORUS_SUPPORT_LOG_CAPTURE_H

#include <syslog.h>

#include <functional>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

struct LogLine {
    int priority;
    std::string text;  ///< as handed to syslog, final newline included
};
bool operator==(const LogLine& left, const LogLine& right);
void PrintTo(const LogLine& line, std::ostream* out);

/// Pairs of (ECMAScript regular expression, replacement) for what differs between runs.
using Tokens = std::vector<std::pair<std::string, std::string>>;

/// All lines of the test so far. A line that is sent while another one is being sent is a
/// failure: with the real log it would wait for a lock for ever.
class LogCapture {
public:
    struct Opened {
        std::string ident;
        int option;
        int facility;
    };

    static LogCapture& get();

    [[nodiscard]] const std::vector<LogLine>& lines() const { return captured; }
    /// The texts alone, after replacing @p tokens.
    [[nodiscard]] std::vector<std::string> texts(const Tokens& tokens = {}) const;
    /// How often exactly this line came.
    [[nodiscard]] int count(int priority, const std::string& text) const;
    /// How many lines hold @p part.
    [[nodiscard]] int countPart(const std::string& part) const;
    /// All lines, readable, for failure messages.
    [[nodiscard]] std::string dump() const;

    [[nodiscard]] const std::vector<Opened>& openlogCalls() const { return opened; }
    [[nodiscard]] const std::vector<int>& setlogmaskCalls() const { return masks; }

    /// Forgets the lines; those of the next part of a test are then alone.
    void clear() { captured.clear(); }
    /// Runs @p action inside every following syslog call, as a signal would.
    void onLine(std::function<void(const LogLine&)> action) { hook = std::move(action); }

    /// A text that must be in no line, from the beginning of the test on (cleared lines
    /// included). The fixture registers what it configures and checks at the end of each test.
    void addSecret(const std::string& secret);
    /// Fails the test when a registered secret is or was in a line.
    void checkSecrets() const;

    /// Back to the state at the start of a process.
    void reset();

    void take(int priority, const char* text);
    void takeOpen(const char* ident, int option, int facility);
    int takeMask(int mask);

private:
    LogCapture() = default;

    std::vector<LogLine> captured;
    std::vector<std::string> everything;
    std::vector<Opened> opened;
    std::vector<int> masks;
    std::vector<std::string> secrets;
    std::function<void(const LogLine&)> hook;
    int depth = 0;
};

/// Fails unless exactly this line came (text with its final newline).
void expectLogged(int priority, const std::string& text);
/// Fails when a line holds @p part.
void expectNotLogged(const std::string& part);
/// Fails unless these lines came in this order, others possibly between them.
void expectLoggedInOrder(const std::vector<std::string>& texts, const Tokens& tokens = {});
/// Fails unless the lines since the last clear() are exactly these.
void expectLogIs(const std::vector<LogLine>& lines, const Tokens& tokens = {});

/// At the end of the scope: fails unless the line came within it.
class ExpectLogged {
public:
    ExpectLogged(int priority, std::string text);
    ~ExpectLogged();
    ExpectLogged(const ExpectLogged&) = delete;
    ExpectLogged& operator=(const ExpectLogged&) = delete;

private:
    LogLine wanted;
    int before;
};

/// At the end of the scope: fails when a line that holds the part came within it.
class ExpectNotLogged {
public:
    explicit ExpectNotLogged(std::string part);
    ~ExpectNotLogged();
    ExpectNotLogged(const ExpectNotLogged&) = delete;
    ExpectNotLogged& operator=(const ExpectNotLogged&) = delete;

private:
    std::string unwanted;
    int before;
};

}  // namespace pelorus::support

#endif
