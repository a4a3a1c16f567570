#include "common/log.h"

#include <algorithm>
#include <array>
#include <cstdarg>
#include <cstdio>

#include "common/signal_block.h"

namespace pelorus {

namespace {

__attribute__((format(printf, 3, 0))) void vlogLine(std::size_t size,
                                                    int priority,
                                                    const char* format,
                                                    va_list args) {
    std::array<char, kLogLineSize> line{};
    const std::size_t room = std::min(size, line.size());
    if (std::vsnprintf(line.data(), room, format, args) < 0) return;
    const SignalBlock noTermination{SIGINT, SIGTERM, SIGQUIT};
    syslog(priority, "%s", line.data());
}

}  // namespace

void logLine(int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(kLogLineSize, priority, format, args);
    va_end(args);
}

void logLineCut(std::size_t size, int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    vlogLine(size, priority, format, args);
    va_end(args);
}

}  // namespace pelorus
