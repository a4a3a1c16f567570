// What the fuzz targets share: their entry, and a configured device behind the fakes of the unit
// tests. Included by the one source of each target.
#ifndef PELORUS_FUZZ_WORLD_H
#define PELORUS_FUZZ_WORLD_H

#include <cassert>
#include <cstdint>

#include "config/global_config.h"
#include "support/fixture.h"

namespace pelorus::fuzz {

using support::kDeviceAuth;
using support::kDeviceId;

/// Each target defines it: reads @p text as others wrote it and asserts what must hold.
void tryText(const std::string& text);

/// Begins an input with empty records, on a device of the given type.
inline void begin(const char* deviceType) {
    GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end the run, too
    support::LogCapture::get().reset();
    support::VirtualClock::get().reset();
    support::FakeCommands::get().reset();
    support::FakeNet::get().reset();
    auto* config = GlobalConfig::getInstance();
    config->setProperty("DEVICETYPE", deviceType, false);
    support::LogCapture::get().addSecret(config->setProperty("DEVICEID", kDeviceId, false));
    support::LogCapture::get().addSecret(config->setProperty("DEVICEAUTH", kDeviceAuth, false));
}

}  // namespace pelorus::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    pelorus::fuzz::tryText({data, data + size});
    return 0;
}

#endif
