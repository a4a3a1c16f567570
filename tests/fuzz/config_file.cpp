// The configuration files: what is read is what a second, naive reader reads.
#include <array>
#include <cstring>

#include "common/handles.h"
#include "fuzz_world.h"

namespace {

using Settings = std::map<std::string, std::string>;

bool isOneOf(char c, const char* set) {
    return c != '\0' && std::strchr(set, c) != nullptr;
}

void readNaively(const char* line, Settings& settings) {
    const std::size_t length = std::strlen(line);
    for (std::size_t split = 1; split < length; ++split) {
        if (line[split] != '=') continue;
        std::size_t start = 0;
        while (isOneOf(line[start], " \t")) ++start;
        std::size_t first = split + 1;
        while (isOneOf(line[first], " \t\"")) ++first;
        std::size_t end = length;
        while (end > first && isOneOf(line[end - 1], " \t\"\n")) --end;
        const std::string key{line + start, line + split};
        if (!key.empty()) settings[key] = std::string{line + first, line + end};
        return;
    }
}

pelorus::FileHandle fileOf(const std::uint8_t* data, std::size_t size) {
    pelorus::FileHandle file{std::tmpfile()};
    pelorus::fuzz::require(file != nullptr, "a temporary file");
    pelorus::fuzz::require(std::fwrite(data, 1, size, file.get()) == size, "a written file");
    std::rewind(file.get());
    return file;
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    pelorus::fuzz::begin({});
    const pelorus::FileHandle file = fileOf(data, size);
    Settings wanted;
    std::array<char, 300> line{};
    while (std::fgets(line.data(), line.size(), file.get()) != nullptr) {
        readNaively(line.data(), wanted);
    }
    // These would lead the store to other files.
    if (wanted.count("DYNAMIC_CONFIG_TMP") != 0) return 0;

    std::rewind(file.get());
    auto* config = pelorus::GlobalConfig::getInstance();
    pelorus::fuzz::require(config->loadConfigSettings(file.get()), "loading succeeds");
    for (const auto& [key, value] : wanted) {
        pelorus::fuzz::require(config->getProperty(key) == value, "the value of a key");
    }
    for (const auto& setting : wanted) config->deleteProperty(setting.first);
    return 0;
}
