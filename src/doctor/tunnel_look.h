// The relay's tunnel: its client process, what that has written, and where it writes.
#ifndef PELORUS_DOCTOR_TUNNEL_LOOK_H
#define PELORUS_DOCTOR_TUNNEL_LOOK_H

#include <optional>
#include <string>

#include "doctor/evidence.h"
#include "doctor/process_table.h"

namespace pelorus::doctor {

/// What the end of the client's output says.
struct TunnelOutput {
    bool isUp = false;              ///< the text of success, and no restart or end since
    std::optional<Sign> trouble{};  ///< why it does not get through since
    std::string line{};             ///< that says so; without its time
};

/// Reads @p output; an empty @p successText is in any line, as for the daemon.
[[nodiscard]] TunnelOutput readTunnelOutput(const std::string& output,
                                            const std::string& successText);

/// The file that the setting @p key names. A relative one is in the folder in which the daemon
/// starts the client, as the client writes it there. Empty when the setting is.
[[nodiscard]] std::string tunnelFile(const Evidence& evidence, const std::string& key);

/// Adds signs and checks. The settings and the status word must be there already.
void lookAtTunnel(const ProcessTable& processes, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
