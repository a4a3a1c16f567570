#include "support/log_capture.h"

#include <array>
#include <cstdarg>
#include <cstdio>

namespace pelorus::support {

std::vector<std::string> LogCapture::texts() const {
    std::vector<std::string> result;
    for (const LogLine& line : captured) result.push_back(line.text);
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
    for (const LogLine& line : captured) all += "  " + ::testing::PrintToString(line) + "\n";
    return all;
}

void LogCapture::take(const LogLine& line) {
    EXPECT_EQ(depth, 0) << "sent while another line held the log: " << line.text;
    if (depth > 0) return;
    for (const std::string& secret : secrets) {
        if (secret.size() < 3) continue;  // turns up in ordinary words
        EXPECT_EQ(line.text.find(secret), std::string::npos) << secret << " in: " << line.text;
    }
    ++depth;
    captured.push_back(line);
    if (hook) hook(line);
    --depth;
}

void expectLogged(int priority, const std::string& text) {
    EXPECT_GT(LogCapture::get().count(priority, text), 0)
        << "never logged: <" << priority << "> " << text << LogCapture::get().dump();
}

void expectLoggedInOrder(const std::vector<std::string>& texts) {
    const std::vector<std::string> all = LogCapture::get().texts();
    auto from = all.begin();
    for (const std::string& text : texts) {
        from = std::find(from, all.end(), text);
        ASSERT_NE(from, all.end()) << "not logged, or not in this place: " << text << "\n"
                                   << LogCapture::get().dump();
        ++from;
    }
}

extern "C" {
__attribute__((format(printf, 2, 3))) void __wrap_syslog(int priority, const char* format, ...) {
    std::array<char, 16384> text{};
    va_list args;
    va_start(args, format);
    static_cast<void>(std::vsnprintf(text.data(), text.size(), format, args));
    va_end(args);
    LogCapture::get().take({priority, text.data()});
}

void __wrap_openlog(const char* ident, int option, int facility) {
    LogCapture::get().setup.push_back(std::string{"openlog "} + ident + " " +
                                      std::to_string(option) + " " + std::to_string(facility));
}

int __wrap_setlogmask(int mask) {
    LogCapture::get().setup.push_back("level " + std::to_string(mask));
    return 0xff;
}
}

}  // namespace pelorus::support
