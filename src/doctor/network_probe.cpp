#include "doctor/network_probe.h"

#include <sys/stat.h>

#include "doctor/interfaces.h"
#include "doctor/program.h"
#include "doctor/start_command.h"

namespace pelorus::doctor {

namespace {

constexpr const char* kTunnelDevice = "/dev/net/tun";

bool hasTunnelDevice() {
    struct stat status {};
    return stat(kTunnelDevice, &status) == 0 && S_ISCHR(status.st_mode);
}

}  // namespace

void lookAtNetwork(Findings& findings) {
    judgeNetwork(interfaces(), defaultRoute(), findings);
}

void lookAtRelayNeeds(const Evidence& evidence, Findings& findings) {
    const auto client =
        evidence.hasSettings()
            ? relayClientOf(evidence.setting("STARTCMD"), evidence.setting("OPENVPN_CONFIG_PATH"))
            : std::optional<std::string>{"openvpn"};
    const bool hasClient = client && !findProgram(*client).empty();
    const bool hasDevice = hasTunnelDevice();
    if (!client) {
        findings.notSeen("relay client: STARTCMD does not tell clearly which program it runs");
    } else if (!hasClient && !evidence.hasSettings()) {
        findings.notSeen("relay client: no openvpn here, and STARTCMD is not known: " +
                         evidence.unreadSettings);
    } else if (!hasClient) {
        const std::string text = "there is no program " + plainText(*client, 80);
        findings.add(Sign::RELAY_CLIENT_MISSING, text);
        findings.problem("relay client: " + text);
    }
    if (!hasDevice) {
        findings.add(Sign::TUNNEL_DEVICE_MISSING, "there is no device /dev/net/tun");
        findings.problem("relay client: there is no device /dev/net/tun");
    }
    if (hasClient && hasDevice) findings.ok("relay client and /dev/net/tun are there");
    const bool needsTunnel = evidence.has(Sign::TUNNEL_RUNS) && evidence.statusWord == "relayed";
    if (needsTunnel) judgeMissingTunnel(interfaces(), findings);
}

}  // namespace pelorus::doctor
