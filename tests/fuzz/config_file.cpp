// A line of a configuration file: what is read is what a second, naive reader reads.
#include <cstring>

#include "config/setting_line.h"
#include "fuzz_world.h"

namespace {

bool isOneOf(char c, const char* set) {
    return c != '\0' && std::strchr(set, c) != nullptr;
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string text{pelorus::fuzz::asText(data, size).c_str()};
    const char* line = text.c_str();
    const std::size_t length = text.size();
    std::string key;
    std::string value;
    for (std::size_t split = 1; split < length; ++split) {
        if (line[split] != '=') continue;
        std::size_t start = 0;
        while (isOneOf(line[start], " \t")) ++start;
        std::size_t first = split + 1;
        while (isOneOf(line[first], " \t\"")) ++first;
        std::size_t end = length;
        while (end > first && isOneOf(line[end - 1], " \t\"\n")) --end;
        key.assign(line + start, line + split);
        value.assign(line + first, line + end);
        break;
    }
    const pelorus::Setting setting = pelorus::parseSettingLine(text);
    pelorus::fuzz::require(setting.key == key && setting.value == value, "both readers agree");
    return 0;
}
