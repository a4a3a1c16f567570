// A line of a configuration file: only blanks, quotes and the line feed around key and value go.
#include "config/setting_line.h"
#include "fuzz_world.h"

void pelorus::fuzz::tryText(const std::string& text) {
    const auto [key, value] = parseSettingLine(text);
    const std::size_t split = text.find('=', 1);
    if (split == std::string::npos) return assert(key.empty() && value.empty());
    const auto isCut = [](const char* from, const char* to, const char* characters) {
        return std::string{from, to}.find_first_not_of(characters) == std::string::npos;
    };
    assert(isCut(text.data(), key.data(), " \t"));
    assert(key.data() + key.size() == &text[split] && key.find_first_of(" \t") != 0);
    assert(isCut(&text[split] + 1, value.data(), " \t\""));
    assert(isCut(value.data() + value.size(), text.data() + text.size(), " \t\"\n"));
    assert(value.find_first_of(" \t\"") != 0);
    assert(value.empty() || value.find_last_of(" \t\"\n") != value.size() - 1);
}
