// A line of a configuration file: what is read is what a second, naive reader reads.
#include "config/setting_line.h"
#include "fuzz_world.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string line{pelorus::fuzz::asText(data, size).c_str()};
    const auto isOneOf = [&](std::size_t at, const std::string& set) {
        return at < line.size() && set.find(line[at]) != std::string::npos;
    };
    std::string key;
    std::string value;
    std::size_t split = 1;
    while (split < line.size() && line[split] != '=') ++split;
    if (split < line.size()) {
        std::size_t start = 0;
        while (isOneOf(start, " \t")) ++start;
        std::size_t first = split + 1;
        while (isOneOf(first, " \t\"")) ++first;
        std::size_t end = line.size();
        while (end > first && isOneOf(end - 1, " \t\"\n")) --end;
        key = line.substr(start, split - start);
        value = line.substr(first, end - first);
    }
    const pelorus::Setting setting = pelorus::parseSettingLine(line);
    pelorus::fuzz::require(setting.key == key && setting.value == value, "both readers agree");
    return 0;
}
