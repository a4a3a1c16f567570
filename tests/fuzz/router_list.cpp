// The mapping list of the maker's own router.
#include "fuzz_world.h"
#include "router/router.h"
#include "support/fake_gateway.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    fuzz::begin("5");
    support::FakeGateway::get().reset();
    auto& commands = support::FakeCommands::get();
    commands.answer("tavik_helper.sh list", fuzz::asText(data, size));
    commands.answer("getip.sh", fuzz::asText(data, size));
    Router router;
    router.initLocalIp();
    for (const char* protocol : {"TCP", "UDP"}) {
        for (const auto& entry : router.getPortListBrenvik(protocol)) {
            fuzz::require(entry.firstExternal >= 1 && entry.firstExternal <= 65535, "a port");
            fuzz::require(entry.lastExternal >= entry.firstExternal, "a range");
            fuzz::require(entry.localIp == router.getLocalIp(), "an entry of this device");
        }
        router.unmapAllPortBrenvik(protocol);
    }
    // What the list says must not be read by the shell.
    for (const auto& line : commands.lines()) {
        fuzz::require(line.find_first_of(";|&$`\n<>(){}\\") == std::string::npos,
                      "a harmless command");
    }
    commands.checkClosed();
    return 0;
}
