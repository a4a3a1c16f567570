// Writing to the system log.
#ifndef PELORUS_COMMON_LOG_H
#define PELORUS_COMMON_LOG_H

#include <syslog.h>

#include <cstdarg>
#include <cstddef>

namespace pelorus {

/// Size of the buffer a log line is formatted into, terminator included; longer lines are
/// truncated.
inline constexpr std::size_t kLogLineSize = 1280;

/// Formats one line and sends it to syslog with @p priority (LOG_ERR, LOG_INFO, ...).
///
/// Text from outside (answers, configured values, names) must be an argument, never the format.
/// Control characters other than line feeds become blanks.
/// Safe to call from the termination signal handler, which cannot interrupt a holder of the locks
/// that the C library takes here: see TerminationBlock. A short line allocates nothing there.
void logLine(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

/// As logLine, with LOG_ERR, LOG_WARNING, LOG_NOTICE, LOG_INFO and LOG_DEBUG.
void logError(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logWarning(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logNotice(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logInfo(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logDebug(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// For a module that has its own log calls: the line is truncated to @p size bytes (at most
/// kLogLineSize), terminator included.
void vlogLine(std::size_t size, int priority, const char* format, va_list args)
    __attribute__((format(printf, 3, 0)));

}  // namespace pelorus

#endif
