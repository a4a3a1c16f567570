#include "daemon/command_line.h"

#include <array>
#include <cstdio>
#include <cstring>

#include "common/text.h"
#include "common/version.h"

namespace pelorus {

namespace {

constexpr int kMinFrequency = 30;   // seconds
constexpr int kMaxFrequency = 900;  // seconds
constexpr int kMaxSeverity = 7;     // LOG_DEBUG

// One reader per option. A null value means that the option was the last argument.

void readFrequency(const char* value, Options& options) {
    const auto seconds = scanInt(value);
    options.frequency = Options::kDefaultFrequency;
    if (value == nullptr) {
        std::fprintf(stderr, "Run frequency is missing. A default of %d secs will be used.\n",
                     Options::kDefaultFrequency);
    } else if (!seconds || *seconds < kMinFrequency || *seconds > kMaxFrequency) {
        std::fprintf(
            stderr,
            "Run frequency is %s. It must be between %d and %d seconds. A default of %d secs will be used.\n",
            value, kMinFrequency, kMaxFrequency, Options::kDefaultFrequency);
    } else {
        options.frequency = *seconds;
    }
}

void readSeverity(const char* value, Options& options) {
    const auto severity = scanInt(value);
    options.severity = Options::kDefaultSeverity;
    if (value == nullptr) {
        std::fprintf(stderr, "Severity level is missing. A default of %d will be used.\n",
                     Options::kDefaultSeverity);
    } else if (!severity || *severity < 0 || *severity > kMaxSeverity) {
        std::fprintf(stderr, "Invalid syslog severity %s. Default %d shall be used.\n", value,
                     Options::kDefaultSeverity);
    } else {
        options.severity = *severity;
    }
}

void readLog(const char* value, Options& options) {
    options.log = true;
    readSeverity(value, options);
}

void readLogToConsole(const char* value, Options& options) {
    options.logToConsole = true;
    readSeverity(value, options);
}

void readUnmapAll(const char* /*value*/, Options& options) {
    options.unmapAll = true;
}

void readDnsCheckInterval(const char* value, Options& options) {
    const auto seconds = scanInt64(value);
    options.dnsCheckInterval = Options::kDefaultDnsCheckInterval;
    if (value == nullptr) {
        std::fprintf(stderr, "DNS check interval is missing. A default of %jd secs will be used.\n",
                     Options::kDefaultDnsCheckInterval);
    } else if (seconds.value_or(0) <= 0) {
        std::fprintf(
            stderr,
            "DNS check interval is %s which is not valid.  A default of %jd secs will be used.\n",
            value, Options::kDefaultDnsCheckInterval);
    } else {
        options.dnsCheckInterval = *seconds;
    }
}

void readPortMapLifetime(const char* value, Options& options) {
    const auto seconds = scanUnsigned(value);
    if (value == nullptr) {
        std::fputs("NAT-PMP port mapping lifetime is missing.\n", stderr);
    } else if (seconds.value_or(0) == 0) {
        std::fprintf(stderr, "NAT-PMP port mapping lifetime is %s which is not valid.\n", value);
    } else {
        options.portMapLifetime = *seconds;
    }
}

void readPublicIpCheckInterval(const char* value, Options& options) {
    const auto seconds = scanInt(value);
    if (value == nullptr) {
        std::fputs("Manual port forward public IP check interval is missing.\n", stderr);
    } else if (seconds.value_or(0) <= 0) {
        std::fprintf(stderr,
                     "Manual port forward public IP check interval is %s which is not valid.\n",
                     value);
    } else {
        options.publicIpCheckInterval = *seconds;
    }
}

struct Option {
    const char* shortName;
    const char* longName;
    bool takesValue;
    void (*read)(const char* value, Options& options);
};

constexpr std::array<Option, 7> kOptions{{
    {"-f", "-check_frequency", true, readFrequency},
    {"-l", "-enable_log", true, readLog},
    {"-lc", "-enable_log_console", true, readLogToConsole},
    {"-u", "-unmapall", false, readUnmapAll},
    {"-d", "-dnscheckinterval", true, readDnsCheckInterval},
    {"-t", "-portmaplifetime", true, readPortMapLifetime},
    {"-p", "-publicipcheckinterval", true, readPublicIpCheckInterval},
}};

const Option* findOption(const char* name) {
    for (const Option& option : kOptions) {
        if (std::strcmp(name, option.shortName) == 0) return &option;
        if (std::strcmp(name, option.longName) == 0) return &option;
    }
    return nullptr;
}

// Handles -v and unknown arguments; returns the exit status.
int handleOther(const char* argument) {
    if (std::strcmp(argument, "-v") == 0) {
        std::printf("Version: %s\n", GetPelorusVersion());
        return 0;
    }
    std::fprintf(
        stderr,
        "Invalid argument: %s, usage: -f nnn (seconds) or -check_frequency nnn (seconds) | -l or -enable_log nnn (log severity level) | -lc or -enable_log_console nnn (log severity level).\n",
        argument);
    return 1;
}

}  // namespace

std::optional<int> parseCommandLine(int argc, const char* const* argv, Options& options) {
    for (int index = 1; index < argc; ++index) {
        const Option* option = findOption(argv[index]);
        if (option == nullptr) return handleOther(argv[index]);
        const char* value = nullptr;
        if (option->takesValue && index + 1 < argc) value = argv[++index];
        option->read(value, options);
    }
    return std::nullopt;
}

}  // namespace pelorus
