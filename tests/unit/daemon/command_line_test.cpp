#include "daemon/command_line.h"

#include <gtest/gtest.h>

#include <iterator>
#include <sstream>

namespace pelorus {
namespace {

// What is not the default.
std::string describe(const Options& options) {
    std::string text;
    const auto add = [&](const char* name, auto value, auto usual) {
        if (value != usual) text += name + std::to_string(value) + " ";
    };
    add("f", options.frequency, 30);
    add("l", options.severity, 5);
    add("d", options.dnsCheckInterval, 86400);
    add("t", options.portMapLifetime.value_or(0), 0U);
    add("p", options.publicIpCheckInterval.value_or(0), 0);
    return text + (options.log ? "log " : "") + (options.logToConsole ? "console " : "") +
           (options.unmapAll ? "unmap " : "");
}

// The arguments, the options that differ, and what is printed.
// clang-format off
const std::pair<const char*, std::string> kRows[]{
    {"", ""},
    {"-f 31 -l 0 -u -d 1 -t 1 -p 1", "f31 l0 d1 t1 p1 log unmap "},
    {"-check_frequency 900 -enable_log 7 -unmapall -dnscheckinterval 5000000000 "
     "-portmaplifetime 4294967295 -publicipcheckinterval 60", "f900 l7 d5000000000 t4294967295 p60 log unmap "},
    {"-f 60 -f 30", ""},
    {"-f 60 -f 29", "Run frequency is 29. It must be between 30 and 900 seconds. A default of 30 secs will be used.\n"},
    {"-f 901", "Run frequency is 901. It must be between 30 and 900 seconds. A default of 30 secs will be used.\n"},
    {"-f -4294967236", "Run frequency is -4294967236. It must be between 30 and 900 seconds. A default of 30 secs will be used.\n"},
    {"-f -u", "Run frequency is -u. It must be between 30 and 900 seconds. A default of 30 secs will be used.\n"},
    {"-f 60 -f", "Run frequency is missing. A default of 30 secs will be used.\n"},
    {"-l 8", "log Invalid syslog severity 8. Default 5 shall be used.\n"},
    {"-l -1", "log Invalid syslog severity -1. Default 5 shall be used.\n"},
    {"-l", "log Severity level is missing. A default of 5 will be used.\n"},
    {"-enable_log_console 6", "l6 console "},
    {"-lc", "console Severity level is missing. A default of 5 will be used.\n"},
    {"-d 9 -d 0", "DNS check interval is 0 which is not valid.  A default of 86400 secs will be used.\n"},
    {"-d", "DNS check interval is missing. A default of 86400 secs will be used.\n"},
    {"-t -1", "t4294967295 "},
    {"-t 9 -t 0", "t9 NAT-PMP port mapping lifetime is 0 which is not valid.\n"},
    {"-t", "NAT-PMP port mapping lifetime is missing.\n"},
    {"-p 9 -p 0", "p9 Manual port forward public IP check interval is 0 which is not valid.\n"},
    {"-p", "Manual port forward public IP check interval is missing.\n"},
    {"-f 60 -v -x", "exit 0 f60 out: Version: 1.7.0-54\n"},
    {"-u --check_frequency -v", "exit 1 unmap Invalid argument: --check_frequency, usage: -f nnn (seconds) or -check_frequency nnn (seconds) | -l or -enable_log nnn (log severity level) | -lc or -enable_log_console nnn (log severity level).\n"}};
// clang-format on

TEST(CommandLine, SetsOptionsAndReportsWhatIsInvalid) {
    for (const auto& [arguments, wanted] : kRows) {
        std::istringstream stream{std::string{"pelorus "} + arguments};
        const std::vector<std::string> words{std::istream_iterator<std::string>{stream}, {}};
        std::vector<const char*> argv;
        for (const auto& word : words) argv.push_back(word.c_str());
        Options options;
        ::testing::internal::CaptureStdout();
        ::testing::internal::CaptureStderr();
        const auto status = parseCommandLine(static_cast<int>(argv.size()), argv.data(), options);
        const std::string exit = status ? "exit " + std::to_string(*status) + " " : "";
        const std::string err = ::testing::internal::GetCapturedStderr();
        const std::string out = ::testing::internal::GetCapturedStdout();
        EXPECT_EQ(exit + describe(options) + err + (out.empty() ? "" : "out: " + out), wanted)
            << arguments;
    }
}

}  // namespace
}  // namespace pelorus
