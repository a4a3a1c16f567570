#include "common/log.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdio>

#include "common/signal_block.h"

namespace pelorus {

void vlogLine(std::size_t size, int priority, const char* format, va_list args) {
    std::array<char, kLogLineSize> line{};
    const std::size_t capacity = std::min(size, line.size());
    if (std::vsnprintf(line.data(), capacity, format, args) < 0) return;
    // The texts have line feeds of their own; no other control character reaches a terminal.
    for (char& letter : line) {
        if (letter != '\n' && letter != '\0' &&
            std::iscntrl(static_cast<unsigned char>(letter)) != 0) {
            letter = ' ';
        }
    }
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
