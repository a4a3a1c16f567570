// What the fuzz targets share: their entry, and a configured device behind the fakes of the unit
// tests. Included by the one source of each target.
#ifndef PELORUS_FUZZ_WORLD_H
#define PELORUS_FUZZ_WORLD_H

#include <cassert>
#include <cctype>
#include <cstdint>
#include <filesystem>
#include <fstream>

#include "config/global_config.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus::fuzz {

using support::kDeviceAuth;
using support::kDeviceId;

/// Each target defines it: reads @p text as others wrote it and asserts what must hold.
void tryText(const std::string& text);

/// The pieces of @p text between the separators, at least @p least of them.
inline support::Texts fields(const std::string& text, std::size_t least, char separator = '\0') {
    support::Texts found{""};
    for (const char letter : text) {
        if (letter != separator) {
            found.back() += letter;
        } else {
            found.emplace_back();
        }
    }
    found.resize(std::max(found.size(), least));
    return found;
}

/// No control character reaches the log, and no foreign text begins a line of its own there.
inline void checkLine(const support::LogLine& line) {
    const std::string text = line.text.substr(0, line.text.find_last_not_of('\n') + 1);
    const bool isDevice = support::holds(text, " desc: ");  // the one with two lines
    assert(std::count(text.begin(), text.end(), '\n') <= (isDevice ? 1 : 0));
    for (std::size_t at = 0; at < text.size(); ++at) {
        const int code = static_cast<unsigned char>(text[at]);
        assert(code == '\n' || std::iscntrl(code) == 0);
        assert(code < 0x80 || code > 0x9F || at == 0 || text[at - 1] != '\xC2');
    }
}

/// A file of its own, with this content, until the end of the scope.
struct TemporaryFile {
    TemporaryFile(const std::string& name, const std::string& content)
        : path{std::filesystem::temp_directory_path() /
               ("pelorus-fuzz-" + std::to_string(getpid()) + name)} {
        std::ofstream{path, std::ios::binary} << content;
    }
    ~TemporaryFile() { std::filesystem::remove(path); }

    const std::string path;
};

/// Begins an input with empty records, on a device of the given type.
inline void begin(const char* deviceType) {
    GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end the run, too
    support::resetFakes();
    auto& log = support::LogCapture::get();
    log.onLine(checkLine);
    // The fakes answer at once: nobody has to watch the calls.
    support::FakeProcess::get().startsThreads = false;
    auto* config = GlobalConfig::getInstance();
    config->setProperty("DEVICETYPE", deviceType, false);
    log.addSecret(config->setProperty("DEVICEID", kDeviceId, false));
    log.addSecret(config->setProperty("DEVICEAUTH", kDeviceAuth, false));
    log.addSecret(config->setProperty("SUBDOMAIN", support::kSubdomain, false));
}

}  // namespace pelorus::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    pelorus::fuzz::tryText({data, data + size});
    return 0;
}

#endif
