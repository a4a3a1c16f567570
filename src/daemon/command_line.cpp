#include "daemon/command_line.h"

#include <cstdio>
#include <cstring>

#include "common/text.h"
#include "daemon/version.h"

namespace pelorus {

namespace {

constexpr int kShortestFrequency = 30;  // seconds
constexpr int kLongestFrequency = 900;  // seconds
constexpr int kLeastSeverity = 0;
constexpr int kMostSeverity = 7;

// The arguments from left to right.
class Arguments {
public:
    Arguments(int argc, const char* const* argv) : count(argc), texts(argv) {}

    [[nodiscard]] bool atEnd() const { return index >= count; }
    [[nodiscard]] const char* current() const { return texts[index]; }
    void advance() { ++index; }

    [[nodiscard]] bool isOption(const char* shortForm, const char* longForm) const {
        return std::strcmp(current(), shortForm) == 0 || std::strcmp(current(), longForm) == 0;
    }
    // Moves on to the option's value. Null when the option is the last argument.
    const char* value() {
        if (index + 1 >= count) return nullptr;
        advance();
        return current();
    }

private:
    int count;
    const char* const* texts;
    int index = 1;
};

void readFrequency(const char* value, Options& options) {
    options.frequency = Options::kDefaultFrequency;
    int frequency = 0;
    if (value == nullptr) {
        std::fprintf(stderr, "Run frequency is missing. A default of %d secs will be used.\n",
                     Options::kDefaultFrequency);
    } else if (!scanInt(value, frequency) || frequency < kShortestFrequency ||
               frequency > kLongestFrequency) {
        std::fprintf(
            stderr,
            "Run frequency is %s. It must be between %d and %d seconds. A default of %d secs will be used.\n",
            value, kShortestFrequency, kLongestFrequency, Options::kDefaultFrequency);
    } else {
        options.frequency = frequency;
    }
}

void readSeverity(const char* value, Options& options) {
    options.severity = Options::kDefaultSeverity;
    int severity = 0;
    if (value == nullptr) {
        std::fprintf(stderr, "Severity level is missing. A default of %d will be used.\n",
                     Options::kDefaultSeverity);
    } else if (!scanInt(value, severity) || severity < kLeastSeverity || severity > kMostSeverity) {
        std::fprintf(stderr, "Invalid syslog severity %s. Default %d shall be used.\n", value,
                     Options::kDefaultSeverity);
    } else {
        options.severity = severity;
    }
}

void readDnsCheckInterval(const char* value, Options& options) {
    options.dnsCheckInterval = Options::kDefaultDnsCheckInterval;
    long interval = 0;
    if (value == nullptr) {
        std::fprintf(stderr, "DNS check interval is missing. A default of %ld secs will be used.\n",
                     Options::kDefaultDnsCheckInterval);
    } else if (!scanLong(value, interval) || interval <= 0) {
        std::fprintf(
            stderr,
            "DNS check interval is %s which is not valid.  A default of %ld secs will be used.\n",
            value, Options::kDefaultDnsCheckInterval);
    } else {
        options.dnsCheckInterval = interval;
    }
}

void readPortMapLifetime(const char* value, Options& options) {
    unsigned lifetime = 0;
    if (value == nullptr) {
        std::fprintf(stderr, "NAT-PMP port mapping lifetime is missing.\n");
    } else if (!scanUnsigned(value, lifetime) || lifetime == 0) {
        std::fprintf(stderr, "NAT-PMP port mapping lifetime is %s which is not valid.\n", value);
    } else {
        options.portMapLifetime = lifetime;
    }
}

void readPublicIpCheckInterval(const char* value, Options& options) {
    int interval = 0;
    if (value == nullptr) {
        std::fprintf(stderr, "Manual port forward public IP check interval is missing.\n");
    } else if (!scanInt(value, interval) || interval <= 0) {
        std::fprintf(stderr,
                     "Manual port forward public IP check interval is %s which is not valid.\n",
                     value);
    } else {
        options.publicIpCheckInterval = interval;
    }
}

// False when the argument is no option.
bool readOption(Arguments& arguments, Options& options) {
    if (arguments.isOption("-f", "-check_frequency")) {
        readFrequency(arguments.value(), options);
    } else if (arguments.isOption("-l", "-enable_log")) {
        options.log = true;
        readSeverity(arguments.value(), options);
    } else if (arguments.isOption("-lc", "-enable_log_console")) {
        options.logToConsole = true;
        readSeverity(arguments.value(), options);
    } else if (arguments.isOption("-u", "-unmapall")) {
        options.unmapAll = true;
    } else if (arguments.isOption("-d", "-dnscheckinterval")) {
        readDnsCheckInterval(arguments.value(), options);
    } else if (arguments.isOption("-t", "-portmaplifetime")) {
        readPortMapLifetime(arguments.value(), options);
    } else if (arguments.isOption("-p", "-publicipcheckinterval")) {
        readPublicIpCheckInterval(arguments.value(), options);
    } else {
        return false;
    }
    return true;
}

// -v is known only here, where an unknown argument would be. Returns the exit status.
int endWith(const char* argument) {
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
    for (Arguments arguments(argc, argv); !arguments.atEnd(); arguments.advance()) {
        if (!readOption(arguments, options)) return endWith(arguments.current());
    }
    return std::nullopt;
}

}  // namespace pelorus
