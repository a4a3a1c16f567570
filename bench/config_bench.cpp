// The settings store against a minimal implementation, on the same files.
#include <benchmark/benchmark.h>
#include <sys/stat.h>
#include <syslog.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "common/handles.h"
#include "config/global_config.h"

namespace {

using pelorus::FileHandle;
using pelorus::GlobalConfig;
using Settings = std::map<std::string, std::string>;

constexpr std::size_t kKeyCount = 200;
constexpr std::size_t kDynamicCount = 40;  // of these from the dynamic file
constexpr std::size_t kLineSize = 300;

// Settings with names and values as long as those in a device's files; the two that configure the
// store come last.
std::vector<std::pair<std::string, std::string>> deviceSettings(const std::string& folder) {
    static constexpr std::array<const char*, 8> kNames{
        "INTERNAL_PORT_",  "EXTERNAL_PORT_", "REMOTE_SETFORWARDURL_", "DEVICE_",
        "OPENVPN_CONFIG_", "LOCAL_SETURL_",  "NOTIFICATION_",         "UPDATE_CONF_WITH_CMD_"};
    static constexpr std::array<const char*, 4> kValues{
        "TRUE", "9443", "\"/var/www/rest-api/data/state\"",
        "/api/1.0/rest/port_test/%s?external_ip=%s&port=%d&protocol=%s&auth=%s"};
    std::vector<std::pair<std::string, std::string>> all;
    for (std::size_t i = 0; i + 2 < kKeyCount; ++i) {
        all.emplace_back(kNames.at(i % kNames.size()) + std::to_string(i),
                         kValues.at(i / kNames.size() % kValues.size()));
    }
    all.emplace_back("DYNAMIC_CONFIG", folder);
    all.emplace_back("DYNAMIC_CONFIG_TMP", folder + "/copy.ini");
    return all;
}

// A device's configuration in a temporary folder, loaded into the store.
class Device {
public:
    Device() {
        std::string pattern = std::filesystem::temp_directory_path() / "pelorus-bench-XXXXXX";
        if (mkdtemp(pattern.data()) == nullptr) std::abort();
        folder = pattern;
        const auto all = deviceSettings(folder);
        write(allKeys(), all.begin(), all.end());
        write(folder + "/globalconfig.ini", all.begin() + kDynamicCount, all.end());
        write(folder + "/dynamicconfig.ini", all.begin(), all.begin() + kDynamicCount);
        if (!GlobalConfig::getInstance()->loadConfig(folder + "/globalconfig.ini")) std::abort();
        for (const auto& [key, value] : all) keys.push_back(key);
        settings.insert(all.begin(), all.end());
    }
    ~Device() {
        std::error_code ignored;
        std::filesystem::remove_all(folder, ignored);
    }
    Device(const Device&) = delete;
    Device& operator=(const Device&) = delete;

    // One file with all the settings.
    [[nodiscard]] std::string allKeys() const { return folder + "/all.ini"; }

    std::vector<std::string> keys;
    Settings settings;

private:
    template <typename Iterator>
    static void write(const std::string& path, Iterator first, Iterator last) {
        const FileHandle file = pelorus::openFile(path, "we");
        if (!file) std::abort();
        for (; first != last; ++first) {
            std::fprintf(file.get(), "%s=%s\n", first->first.c_str(), first->second.c_str());
        }
    }

    std::string folder;
};

Device& device() {
    static Device instance;
    return instance;
}

void lookUpInStore(benchmark::State& state) {
    auto* config = GlobalConfig::getInstance();
    const std::vector<std::string>& keys = device().keys;
    std::size_t next = 0;
    for (auto _ : state) {
        const std::string& value = config->getProperty(keys[next]);
        if (value.empty()) state.SkipWithError("a setting is missing");
        next = (next + 1) % kKeyCount;
    }
}

void lookUpByHand(benchmark::State& state) {
    const Settings& settings = device().settings;
    const std::vector<std::string>& keys = device().keys;
    const std::string copy = settings.at("DYNAMIC_CONFIG_TMP");
    std::size_t next = 0;
    for (auto _ : state) {
        struct stat status {};
        if (stat(copy.c_str(), &status) != 0) state.SkipWithError("no copy");
        const auto found = settings.find(keys[next]);
        if (found == settings.end()) state.SkipWithError("a setting is missing");
        next = (next + 1) % kKeyCount;
    }
}

// With fresh set, every key is new to the map, as at start-up; otherwise every value is replaced, as
// after a change of the dynamic file.
void parseByStore(benchmark::State& state, bool fresh) {
    auto* config = GlobalConfig::getInstance();
    const FileHandle file = pelorus::openFile(device().allKeys(), "re");
    for (auto _ : state) {
        state.PauseTiming();
        if (fresh) {
            for (const auto& key : device().keys) config->deleteProperty(key);
        }
        state.ResumeTiming();
        std::rewind(file.get());
        if (!config->loadConfigSettings(file.get())) state.SkipWithError("not loaded");
    }
}

void fillByHand(std::FILE* file, Settings& settings) {
    std::array<char, kLineSize> line{};
    while (std::fgets(line.data(), line.size(), file) != nullptr) {
        char* const split = std::strchr(line.data(), '=');
        if (split == nullptr) continue;
        const char* const value = split + 1;
        settings[std::string(line.data(), split)] = std::string(value, std::strcspn(value, "\n"));
    }
}

void parseByHand(benchmark::State& state, bool fresh) {
    Settings settings;
    const FileHandle file = pelorus::openFile(device().allKeys(), "re");
    for (auto _ : state) {
        state.PauseTiming();
        if (fresh) {
            for (const auto& key : device().keys) settings.erase(key);
        }
        state.ResumeTiming();
        std::rewind(file.get());
        fillByHand(file.get(), settings);
        if (settings.size() != kKeyCount) state.SkipWithError("not loaded");
    }
}

BENCHMARK(lookUpInStore);
BENCHMARK(lookUpByHand);
BENCHMARK_CAPTURE(parseByStore, first, true);
BENCHMARK_CAPTURE(parseByHand, first, true);
BENCHMARK_CAPTURE(parseByStore, again, false);
BENCHMARK_CAPTURE(parseByHand, again, false);

}  // namespace

int main(int argc, char** argv) {
    // Keeps the host's log clean; nothing that is measured logs.
    setlogmask(LOG_MASK(LOG_EMERG));
    benchmark::Initialize(&argc, argv);
    device();
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
