// What the fuzz targets share: a configured device behind the fakes of the unit tests.
#ifndef PELORUS_FUZZ_WORLD_H
#define PELORUS_FUZZ_WORLD_H

#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "config/global_config.h"
#include "support/fixture.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace pelorus::fuzz {

using support::kDeviceAuth;
using support::kDeviceId;

inline std::string asText(const std::uint8_t* data, std::size_t size) {
    return {data, data + size};
}

/// Ends the run with the input at hand when @p holds is false.
inline void require(bool holds, const char* what) {
    if (holds) return;
    static_cast<void>(std::fprintf(stderr, "broken promise: %s\n", what));
    std::abort();
}

/// Begins every input with empty records, on a device of the given type.
inline void begin(const char* deviceType) {
    GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end the run, too
    auto* config = GlobalConfig::getInstance();
    config->setProperty("DEVICETYPE", deviceType, false);
    config->setProperty("DEVICEID", kDeviceId, false);
    config->setProperty("DEVICEAUTH", kDeviceAuth, false);
    support::LogCapture::get().reset();
    support::VirtualClock::get().reset();
    support::FakeCommands::get().reset();
    support::FakeNet::get().reset();
    for (const char* secret : {kDeviceId, kDeviceAuth}) {
        support::LogCapture::get().addSecret(secret);
    }
}

}  // namespace pelorus::fuzz

#endif
