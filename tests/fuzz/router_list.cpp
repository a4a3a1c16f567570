// The mapping list of the maker's own router.
#include "fuzz_world.h"
#include "router/router.h"

void pelorus::fuzz::tryText(const std::string& text) {
    begin("5");
    auto& commands = support::FakeCommands::get();
    commands.answer("tavik_helper.sh list", text);
    commands.answer("getip.sh", text);
    Router router;
    router.initLocalIp();
    const bool isConnected = router.initIpAddrBrenvik() != 0;
    assert(isConnected != router.getExternalIp().empty());
    router.mapPortBrenvik(80, 9091, "TCP", "Kavra");
    for (const char* protocol : {"TCP", "UDP"}) {
        for (const auto& entry : router.getPortListBrenvik(protocol)) {
            assert(entry.firstExternal >= 1 && entry.firstExternal <= 65535);
            assert(entry.lastExternal >= entry.firstExternal);
            assert(entry.localIp == router.getLocalIp());
        }
        router.unmapAllPortBrenvik(protocol);
    }
    // What the list says must not be read by the shell.
    for (const auto& line : commands.lines()) {
        assert(line.find_first_of(";|&$`\n<>(){}\\") == std::string::npos);
    }
    commands.checkClosed();
}
