// The command line.
#ifndef PELORUS_DAEMON_COMMAND_LINE_H
#define PELORUS_DAEMON_COMMAND_LINE_H

#include <cstdint>
#include <optional>

namespace pelorus {

/// What the command line asks for. Durations in seconds.
struct Options {
    static constexpr int kDefaultFrequency = 30;
    static constexpr int kDefaultSeverity = 5;
    static constexpr std::int64_t kDefaultDnsCheckInterval = 86400;

    int frequency = kDefaultFrequency;  ///< time between cycles, 30 to 900
    int severity = kDefaultSeverity;    ///< highest syslog priority that is logged, 0 to 7
    std::int64_t dnsCheckInterval = kDefaultDnsCheckInterval;
    std::optional<unsigned> portMapLifetime;   ///< lease to ask for; unset: the built-in ones
    std::optional<int> publicIpCheckInterval;  ///< unset: the built-in one
    bool log = false;
    bool logToConsole = false;
    bool unmapAll = false;
};

/// Reads the command line into @p options. Bad and missing values are reported on stderr and
/// replaced by their defaults. Returns nothing when the daemon is to start, else the status to
/// exit with: 0 after -v, 1 after an unknown argument.
[[nodiscard]] std::optional<int> parseCommandLine(int argc,
                                                  const char* const* argv,
                                                  Options& options);

}  // namespace pelorus

#endif
