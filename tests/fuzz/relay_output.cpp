// The output and the pid file of the openvpn client.
#include <unistd.h>

#include <algorithm>

#include "common/handles.h"
#include "fuzz_world.h"
#include "relay/vpn_manager.h"

namespace {

std::string fileName(const char* name) {
    return "/tmp/pelorus-fuzz-" + std::to_string(getpid()) + name;
}

void write(const std::string& path, const std::uint8_t* data, std::size_t size) {
    const pelorus::FileHandle file = pelorus::openFile(path, "we");
    pelorus::fuzz::require(file != nullptr && std::fwrite(data, 1, size, file.get()) == size,
                           "a written file");
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    static const std::string output = fileName(".out");
    static const std::string pidFile = fileName(".pid");
    fuzz::begin({{"STARTCMD_OUTFILE", output}, {"OPENVPN_PID_FILE", pidFile}});
    write(output, data, size);
    write(pidFile, data, size);

    std::string address;
    if (VPNManager::getInstance()->fetchOpenVPN_IPAddr(address)) {
        // Numbers above 255 are passed on as they stand; other characters are not.
        fuzz::require(std::count(address.begin(), address.end(), '.') == 3, "four numbers");
        fuzz::require(address.find_first_not_of("0123456789.") == std::string::npos, "digits");
    } else {
        fuzz::require(address.empty(), "no address without success");
    }
    fuzz::require(!VPNManager::getInstance()->isVPNRunning(), "no process of ours is openvpn");
    VPNManager::getInstance()->closeVPNConnection();
    for (const auto& line : support::FakeCommands::get().lines()) {
        fuzz::require(line.find_first_of(";|&$`\n<>(){}\"\\") == std::string::npos,
                      "a harmless command");
    }
    static_cast<void>(unlink(output.c_str()));
    static_cast<void>(unlink(pidFile.c_str()));
    fuzz::finish();
    return 0;
}
