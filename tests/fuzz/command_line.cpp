// The command line: whatever it says, the options stay in range.
#include "daemon/command_line.h"

#include "fuzz_world.h"

void pelorus::fuzz::tryText(const std::string& text) {
    const auto words = fields(text, 1, ' ');
    std::vector<const char*> argv{"pelorus"};
    for (const auto& word : words) argv.push_back(word.c_str());
    static std::FILE* const nowhere = std::fopen("/dev/null", "we");
    const auto kept = std::pair{stdout, stderr};
    stdout = stderr = nowhere;
    Options options;
    const auto status = parseCommandLine(static_cast<int>(argv.size()), argv.data(), options);
    std::tie(stdout, stderr) = kept;
    assert(!status || status == 0 || status == 1);
    assert(options.frequency >= 30 && options.frequency <= 900 && options.dnsCheckInterval > 0);
    assert(options.severity >= 0 && options.severity <= 7 && options.portMapLifetime != 0U);
    assert(options.publicIpCheckInterval.value_or(1) > 0);
}
