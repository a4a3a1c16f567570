#include "common/log.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdio>

#include "common/signal_block.h"

namespace pelorus {

namespace {

// No control character reaches a terminal, but the texts keep their line feeds. UTF-8 writes those
// beyond ASCII as 0xC2 and a byte from 0x80 to 0x9F.
void blankControlCharacters(char* text) {
    const auto code = [&](int at) { return static_cast<unsigned char>(text[at]); };
    for (; *text != '\0'; ++text) {
        if (std::iscntrl(code(0)) != 0 && *text != '\n') *text = ' ';
        if (code(0) == 0xC2 && code(1) >= 0x80 && code(1) < 0xA0) text[0] = text[1] = ' ';
    }
}

}  // namespace

void vlogLine(std::size_t size, int priority, const char* format, va_list args) {
    std::array<char, kLogLineSize> line{};
    const std::size_t capacity = std::min(size, line.size());
    if (std::vsnprintf(line.data(), capacity, format, args) < 0) return;
    blankControlCharacters(line.data());
    const TerminationBlock held;
    syslog(priority, "%s", line.data());
}

void logLine(int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, priority, format, args);
    va_end(args);
}

void logError(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, LOG_ERR, format, args);
    va_end(args);
}

void logWarning(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, LOG_WARNING, format, args);
    va_end(args);
}

void logNotice(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, LOG_NOTICE, format, args);
    va_end(args);
}

void logInfo(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, LOG_INFO, format, args);
    va_end(args);
}

void logDebug(const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, LOG_DEBUG, format, args);
    va_end(args);
}

}  // namespace pelorus
