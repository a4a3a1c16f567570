// The system log of a test: syslog, openlog and setlogmask end here.
#ifndef PELORUS_SUPPORT_LOG_CAPTURE_H
#define PELORUS_SUPPORT_LOG_CAPTURE_H

#include <syslog.h>

#include <ostream>

#include "support/fake.h"

namespace pelorus::support {

/// The priority, and the text as handed to syslog, final newline included.
struct LogLine {
    int priority;
    std::string text;
    bool operator==(const LogLine& other) const {
        return priority == other.priority && text == other.text;
    }
    friend void PrintTo(const LogLine& line, std::ostream* out) {
        *out << "<" << line.priority << "> " << ::testing::PrintToString(line.text);
    }
};

inline bool holds(const LogLine& line, const std::string& part) {
    return holds(line.text, part);
}

/// Fails the test on a line that holds a secret, or while a termination signal could come: the
/// handler's own line would wait for the log's lock forever.
class LogCapture : public Single<LogCapture>, public Calls<LogLine> {
public:
    [[nodiscard]] const Lines& lines() const { return calls(); }
    [[nodiscard]] Texts texts() const;
    /// How often exactly this line came, and how many lines hold @p part.
    [[nodiscard]] int count(int priority, const std::string& text) const;
    [[nodiscard]] int countPart(const std::string& part) const { return Calls::count(part); }
    /// All lines, for failure messages.
    [[nodiscard]] std::string dump() const;
    /// Runs @p action inside every following syslog call, as a signal would.
    void onLine(std::function<void(const LogLine&)> action) { onCall(std::move(action)); }
    /// Takes every line in place of the record, without allocating: for a signal at any moment.
    void (*sink)(int priority, const char* text) = nullptr;
    void addSecret(const std::string& secret) { secrets.push_back(secret); }
    void take(const LogLine& line);

    Texts setup;  ///< "level MASK" and "openlog IDENT OPTION FACILITY"

private:
    Texts secrets;
};

/// Fails unless the lines are exactly these.
inline void expectLogIs(const std::vector<LogLine>& lines) {
    EXPECT_EQ(LogCapture::get().lines(), lines);
}

}  // namespace pelorus::support

#endif
