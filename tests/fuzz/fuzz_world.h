// What the fuzz targets share: a configured device behind the fakes of the unit tests.
#ifndef PELORUS_FUZZ_WORLD_H
#define PELORUS_FUZZ_WORLD_H

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>

#include "config/global_config.h"
#include "support/fixture.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace pelorus::fuzz {

using support::kDeviceAuth;
using support::kDeviceId;
using support::kSubdomain;

inline std::string asText(const std::uint8_t* data, std::size_t size) {
    return {data, data + size};
}

/// Ends the run with the input at hand when @p holds is false.
inline void require(bool holds, const char* what) {
    if (holds) return;
    static_cast<void>(std::fprintf(stderr, "broken promise: %s\n", what));
    std::abort();
}

/// Sets the device up at the first call, and begins every input with empty records.
inline void begin(const std::map<std::string, std::string>& settings) {
    static bool ready = false;
    if (!ready) {
        ready = true;
        GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end the run, too
        auto* config = GlobalConfig::getInstance();
        config->setProperty("DEVICEID", kDeviceId, false);
        config->setProperty("DEVICEAUTH", kDeviceAuth, false);
        config->setProperty("SUBDOMAIN", kSubdomain, false);
        for (const auto& [key, value] : settings) config->setProperty(key, value, false);
    }
    support::LogCapture::get().reset();
    for (const char* secret : {kDeviceId, kDeviceAuth, kSubdomain}) {
        support::LogCapture::get().addSecret(secret);
    }
    support::VirtualClock::get().reset();
    support::FakeCommands::get().reset();
    support::FakeNet::get().reset();
}

/// The standing checks of every input.
inline void finish() {
    support::FakeCommands::get().checkClosed();
    support::FakeNet::get().checkReleased();
}

}  // namespace pelorus::fuzz

#endif
