#include "support/log_capture.h"

#include <array>
#include <cstdarg>
#include <cstdio>

namespace pelorus::support {

Texts LogCapture::texts() const {
    Texts result;
    for (const LogLine& line : lines()) result.push_back(line.text);
    return result;
}

int LogCapture::count(int priority, const std::string& text) const {
    return static_cast<int>(std::count(lines().begin(), lines().end(), LogLine{priority, text}));
}

std::string LogCapture::dump() const {
    std::string all = "the log:\n";
    for (const LogLine& line : lines()) all += "  " + ::testing::PrintToString(line) + "\n";
    return all;
}

void LogCapture::take(const LogLine& line) {
    for (const std::string& secret : secrets) {
        if (secret.size() < 3) continue;  // turns up in ordinary words
        EXPECT_FALSE(holds(line, secret)) << secret << " in: " << line.text;
    }
    note(line);
}

extern "C" {
__attribute__((format(printf, 2, 3))) void __wrap_syslog(int priority, const char* format, ...) {
    expectTerminationHeld();
    std::array<char, 16384> text{};
    va_list args;
    va_start(args, format);
    static_cast<void>(std::vsnprintf(text.data(), text.size(), format, args));
    va_end(args);
    if (const auto sink = LogCapture::get().sink) return sink(priority, text.data());
    LogCapture::get().take({priority, text.data()});
}

void __wrap_openlog(const char* ident, int option, int facility) {
    expectTerminationHeld();
    LogCapture::get().setup.push_back(std::string{"openlog "} + ident + " " +
                                      std::to_string(option) + " " + std::to_string(facility));
}

int __wrap_setlogmask(int mask) {
    expectTerminationHeld();
    LogCapture::get().setup.push_back("level " + std::to_string(mask));
    return 0xff;
}
}

}  // namespace pelorus::support
