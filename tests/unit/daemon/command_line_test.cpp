#include "daemon/command_line.h"

#include <ostream>
#include <string>
#include <vector>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using Arguments = std::vector<const char*>;

struct Row {
    const char* name;
    Arguments arguments;
    Options options;
    std::string message;  // on stderr
};

void PrintTo(const Row& row, std::ostream* out) {
    *out << row.name;
}

struct Outcome {
    std::optional<int> status;
    Options options;
    std::string out;
    std::string err;
};

Outcome parse(Arguments arguments) {
    arguments.insert(arguments.begin(), "pelorus");
    Outcome outcome;
    ::testing::internal::CaptureStdout();
    ::testing::internal::CaptureStderr();
    outcome.status =
        parseCommandLine(static_cast<int>(arguments.size()), arguments.data(), outcome.options);
    outcome.err = ::testing::internal::GetCapturedStderr();
    outcome.out = ::testing::internal::GetCapturedStdout();
    return outcome;
}

// frequency, severity, DNS check interval, lifetime, public address interval, log, console, unmap
Options asDefault() {
    return {};
}
Options withFrequency(int seconds) {
    Options options;
    options.frequency = seconds;
    return options;
}
Options withLog(int severity) {
    Options options;
    options.log = true;
    options.severity = severity;
    return options;
}
Options withConsole(int severity) {
    Options options;
    options.logToConsole = true;
    options.severity = severity;
    return options;
}
Options withDns(long seconds) {
    Options options;
    options.dnsCheckInterval = seconds;
    return options;
}
Options withLifetime(unsigned seconds) {
    Options options;
    options.portMapLifetime = seconds;
    return options;
}
Options withPublicIp(int seconds) {
    Options options;
    options.publicIpCheckInterval = seconds;
    return options;
}
Options withUnmap() {
    Options options;
    options.unmapAll = true;
    return options;
}

std::string badFrequency(const std::string& value) {
    return "Run frequency is " + value +
           ". It must be between 30 and 900 seconds. A default of 30 secs will be used.\n";
}
std::string badSeverity(const std::string& value) {
    return "Invalid syslog severity " + value + ". Default 5 shall be used.\n";
}
std::string badDns(const std::string& value) {
    return "DNS check interval is " + value +
           " which is not valid.  A default of 86400 secs will be used.\n";
}
std::string badLifetime(const std::string& value) {
    return "NAT-PMP port mapping lifetime is " + value + " which is not valid.\n";
}
std::string badPublicIp(const std::string& value) {
    return "Manual port forward public IP check interval is " + value + " which is not valid.\n";
}

constexpr const char* kNoSeverity = "Severity level is missing. A default of 5 will be used.\n";

class CommandLine : public ::testing::TestWithParam<Row> {};

TEST_P(CommandLine, IsReadAndTheStartGoesOn) {
    const Outcome outcome = parse(GetParam().arguments);
    const Options& wanted = GetParam().options;
    EXPECT_FALSE(outcome.status.has_value());
    EXPECT_EQ(outcome.err, GetParam().message);
    EXPECT_EQ(outcome.out, "");
    EXPECT_EQ(outcome.options.frequency, wanted.frequency);
    EXPECT_EQ(outcome.options.severity, wanted.severity);
    EXPECT_EQ(outcome.options.dnsCheckInterval, wanted.dnsCheckInterval);
    EXPECT_EQ(outcome.options.portMapLifetime, wanted.portMapLifetime);
    EXPECT_EQ(outcome.options.publicIpCheckInterval, wanted.publicIpCheckInterval);
    EXPECT_EQ(outcome.options.log, wanted.log);
    EXPECT_EQ(outcome.options.logToConsole, wanted.logToConsole);
    EXPECT_EQ(outcome.options.unmapAll, wanted.unmapAll);
}

INSTANTIATE_TEST_SUITE_P(
    Frequency,
    CommandLine,
    ::testing::Values(
        Row{"NoArguments", {}, withFrequency(30), ""},
        Row{"Shortest", {"-f", "30"}, withFrequency(30), ""},
        Row{"Longest", {"-check_frequency", "900"}, withFrequency(900), ""},
        Row{"TooShort", {"-f", "29"}, withFrequency(30), badFrequency("29")},
        Row{"TooLong", {"-f", "901"}, withFrequency(30), badFrequency("901")},
        Row{"NoNumber", {"-f", "often"}, withFrequency(30), badFrequency("often")},
        Row{"ABadOneBringsTheDefaultBack",
            {"-f", "60", "-f", "1"},
            withFrequency(30),
            badFrequency("1")},
        Row{"AnOptionIsTakenForTheValue", {"-f", "-u"}, withFrequency(30), badFrequency("-u")},
        Row{"Missing",
            {"-f", "60", "-f"},
            withFrequency(30),
            "Run frequency is missing. A default of 30 secs will be used.\n"}),
    RowName{});

INSTANTIATE_TEST_SUITE_P(
    Log,
    CommandLine,
    ::testing::Values(
        Row{"Lowest", {"-l", "0"}, withLog(0), ""},
        Row{"Highest", {"-enable_log", "7"}, withLog(7), ""},
        Row{"TooHigh", {"-l", "8"}, withLog(5), badSeverity("8")},
        Row{"Negative", {"-l", "-1"}, withLog(5), badSeverity("-1")},
        Row{"Missing", {"-l"}, withLog(5), kNoSeverity},
        Row{"ToConsole", {"-lc", "6"}, withConsole(6), ""},
        Row{"ToConsoleLongForm", {"-enable_log_console", "x"}, withConsole(5), badSeverity("x")},
        Row{"ToConsoleMissing", {"-lc"}, withConsole(5), kNoSeverity}),
    RowName{});

INSTANTIATE_TEST_SUITE_P(
    Others,
    CommandLine,
    ::testing::Values(
        Row{"Dns", {"-d", "5000000000"}, withDns(5000000000), ""},
        Row{"DnsZero", {"-d", "0"}, withDns(86400), badDns("0")},
        Row{"DnsMissing",
            {"-dnscheckinterval"},
            withDns(86400),
            "DNS check interval is missing. A default of 86400 secs will be used.\n"},
        Row{"Lifetime", {"-t", "4294967295"}, withLifetime(4294967295U), ""},
        Row{"ANegativeLifetimeWraps", {"-portmaplifetime", "-1"}, withLifetime(4294967295U), ""},
        Row{"LifetimeZero", {"-t", "0"}, asDefault(), badLifetime("0")},
        Row{"ABadLifetimeKeepsTheEarlierOne",
            {"-t", "9", "-t", "x"},
            withLifetime(9),
            badLifetime("x")},
        Row{"LifetimeMissing", {"-t"}, asDefault(), "NAT-PMP port mapping lifetime is missing.\n"},
        Row{"PublicIp", {"-p", "60"}, withPublicIp(60), ""},
        Row{"PublicIpZero", {"-publicipcheckinterval", "0"}, asDefault(), badPublicIp("0")},
        Row{"PublicIpMissing",
            {"-p"},
            asDefault(),
            "Manual port forward public IP check interval is missing.\n"},
        Row{"Unmap", {"-u"}, withUnmap(), ""},
        Row{"UnmapLongForm", {"-unmapall"}, withUnmap(), ""}),
    RowName{});

TEST(CommandLineEnd, VersionIsShownWhereAnUnknownArgumentWouldBe) {
    const Outcome outcome = parse({"-f", "60", "-v", "-x"});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.out, "Version: 1.7.0-54\n");
    EXPECT_EQ(outcome.err, "");
}

TEST(CommandLineEnd, AnUnknownArgumentIsAnError) {
    for (const char* argument : {"-x", "--check_frequency", "f", ""}) {
        const Outcome outcome = parse({"-u", argument, "-v"});
        EXPECT_EQ(outcome.status, 1);
        EXPECT_EQ(outcome.out, "");
        EXPECT_EQ(
            outcome.err,
            std::string{"Invalid argument: "} + argument +
                ", usage: -f nnn (seconds) or -check_frequency nnn (seconds) | -l or -enable_log nnn (log severity level) | -lc or -enable_log_console nnn (log severity level).\n");
    }
}

}  // namespace
}  // namespace pelorus::support
