// The openvpn client's files: its pid and its output. The name of this program holds "openvpn", so
// that its own pid passes for the client's.
#include <unistd.h>

#include "common/text.h"
#include "fuzz_world.h"
#include "relay/vpn_manager.h"

// The two files with a byte 1 between them; "PID" stands for the pid.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    auto part = fields(text, 2, '\1');
    const std::string pid = std::to_string(getpid()), &output = part[1];
    replaceAll(part[0], "PID", pid);
    const TemporaryFile pids{"pids", part[0]}, log{"output", output};
    const TemporaryFile credentials{"credentials", ""};
    auto& config = *GlobalConfig::getInstance();
    config.setProperty("OPENVPN_PID_FILE", pids.path, false);
    config.setProperty("STARTCMD_OUTFILE", log.path, false);
    config.setProperty("OPENVPN_AUTH_FILE", credentials.path, false);
    config.setProperty("LOG_SUCCESS_TEXT", "Completed", false);

    auto& client = *VPNManager::getInstance();
    std::string ip;
    assert(client.fetchOpenVPN_IPAddr(ip) != ip.empty());
    // Numbers above 255 are passed on as they stand; other characters are not.
    assert(ip.empty() || std::count(ip.begin(), ip.end(), '.') == 3);
    assert(ip.find_first_not_of("0123456789.") == std::string::npos);
    auto& commands = support::FakeCommands::get();
    commands.answer("kill", "", static_cast<int>(text.size() % 2));
    client.closeVPNConnection();
    for (const auto& line : commands.lines()) {
        assert(line == "kill -15 " + pid || line == "kill -9 " + pid);
    }
    std::filesystem::remove(pids.path);
    support::VirtualClock::get().duringPause(2, [&] { std::filesystem::remove(log.path); });
    const bool isUp = client.openVPNConnection();
    const bool isPlain = output.size() < 1000 && output.find('\0') == std::string::npos;
    assert(isUp == support::holds(output, "Completed") || (!isUp && !isPlain));
}
