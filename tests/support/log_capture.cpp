#include "support/log_capture.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdarg>
#include <cstdio>
#include <regex>

namespace pelorus::support {

namespace {

constexpr std::size_t kLongestLine = 16384;
constexpr std::size_t kShortestSecret = 3;  // shorter ones turn up in ordinary words

std::string replaceTokens(std::string text, const Tokens& tokens) {
    for (const auto& [pattern, token] : tokens) {
        text = std::regex_replace(text, std::regex{pattern}, token);
    }
    return text;
}

}  // namespace

bool operator==(const LogLine& left, const LogLine& right) {
    return left.priority == right.priority && left.text == right.text;
}

void PrintTo(const LogLine& line, std::ostream* out) {
    *out << "<" << line.priority << "> " << ::testing::PrintToString(line.text);
}

LogCapture& LogCapture::get() {
    static LogCapture instance;
    return instance;
}

std::vector<std::string> LogCapture::texts(const Tokens& tokens) const {
    std::vector<std::string> result;
    for (const LogLine& line : captured) result.push_back(replaceTokens(line.text, tokens));
    return result;
}

int LogCapture::count(int priority, const std::string& text) const {
    return static_cast<int>(std::count(captured.begin(), captured.end(), LogLine{priority, text}));
}

int LogCapture::countPart(const std::string& part) const {
    return static_cast<int>(std::count_if(
        captured.begin(), captured.end(),
        [&](const LogLine& line) { return line.text.find(part) != std::string::npos; }));
}

std::string LogCapture::dump() const {
    std::string all = "the log:\n";
    for (const LogLine& line : captured) {
        all += "  " + ::testing::PrintToString(line) + "\n";
    }
    return all;
}

void LogCapture::addSecret(const std::string& secret) {
    if (secret.size() >= kShortestSecret) secrets.push_back(secret);
}

void LogCapture::checkSecrets() const {
    for (const std::string& text : everything) {
        for (const std::string& secret : secrets) {
            EXPECT_EQ(text.find(secret), std::string::npos)
                << "secret \"" << secret << "\" in log line: " << text;
        }
    }
}

void LogCapture::reset() {
    captured.clear();
    everything.clear();
    opened.clear();
    masks.clear();
    secrets.clear();
    hook = nullptr;
}

void LogCapture::take(int priority, const char* text) {
    if (depth > 0) {
        ADD_FAILURE() << "line sent while another one held the log: " << text;
        return;
    }
    ++depth;
    const LogLine line{priority, text};
    captured.push_back(line);
    everything.push_back(line.text);
    if (hook) hook(line);
    --depth;
}

void LogCapture::takeOpen(const char* ident, int option, int facility) {
    opened.push_back({ident, option, facility});
}

int LogCapture::takeMask(int mask) {
    constexpr int kEverything = 0xff;
    const int before = masks.empty() ? kEverything : masks.back();
    masks.push_back(mask);
    return before;
}

void expectLogged(int priority, const std::string& text) {
    const LogCapture& log = LogCapture::get();
    EXPECT_GT(log.count(priority, text), 0)
        << "never logged: " << ::testing::PrintToString(LogLine{priority, text}) << "\n"
        << log.dump();
}

void expectNotLogged(const std::string& part) {
    const LogCapture& log = LogCapture::get();
    EXPECT_EQ(log.countPart(part), 0) << "unwanted line: " << part << "\n" << log.dump();
}

void expectLoggedInOrder(const std::vector<std::string>& texts, const Tokens& tokens) {
    const std::vector<std::string> all = LogCapture::get().texts(tokens);
    auto from = all.begin();
    for (const std::string& text : texts) {
        const auto found = std::find(from, all.end(), text);
        if (found == all.end()) {
            ADD_FAILURE() << "not logged, or not in this place: " << text << "\n"
                          << LogCapture::get().dump();
            return;
        }
        from = found + 1;
    }
}

void expectLogIs(const std::vector<LogLine>& lines, const Tokens& tokens) {
    std::vector<LogLine> all = LogCapture::get().lines();
    for (LogLine& line : all) line.text = replaceTokens(line.text, tokens);
    EXPECT_EQ(all, lines);
}

ExpectLogged::ExpectLogged(int priority, std::string text)
    : wanted{priority, std::move(text)}, before{LogCapture::get().count(priority, wanted.text)} {
}

ExpectLogged::~ExpectLogged() {
    EXPECT_GT(LogCapture::get().count(wanted.priority, wanted.text), before)
        << "never logged: " << ::testing::PrintToString(wanted) << "\n"
        << LogCapture::get().dump();
}

ExpectNotLogged::ExpectNotLogged(std::string part)
    : unwanted{std::move(part)}, before{LogCapture::get().countPart(unwanted)} {
}

ExpectNotLogged::~ExpectNotLogged() {
    EXPECT_EQ(LogCapture::get().countPart(unwanted), before)
        << "unwanted line: " << unwanted << "\n"
        << LogCapture::get().dump();
}

}  // namespace pelorus::support

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
void __wrap_syslog(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));
void __wrap_openlog(const char* ident, int option, int facility);
int __wrap_setlogmask(int mask);
}

void __wrap_syslog(int priority, const char* format, ...) {
    std::array<char, pelorus::support::kLongestLine> text{};
    va_list args;
    va_start(args, format);
    static_cast<void>(std::vsnprintf(text.data(), text.size(), format, args));
    va_end(args);
    pelorus::support::LogCapture::get().take(priority, text.data());
}

void __wrap_openlog(const char* ident, int option, int facility) {
    pelorus::support::LogCapture::get().takeOpen(ident, option, facility);
}

int __wrap_setlogmask(int mask) {
    return pelorus::support::LogCapture::get().takeMask(mask);
}
// NOLINTEND(bugprone-reserved-identifier)
