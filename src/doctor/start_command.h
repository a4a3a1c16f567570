// The command that starts the relay client.
#ifndef PELORUS_DOCTOR_START_COMMAND_H
#define PELORUS_DOCTOR_START_COMMAND_H

#include <optional>
#include <string>

namespace pelorus::doctor {

/// The program that the shell command @p command needs for the relay client: the one openvpn among
/// the programs that it runs, or its only program when that is an absolute path. A path relative to
/// the working folder @p folder is made absolute. Nothing when that is not clear.
[[nodiscard]] std::optional<std::string> relayClientOf(const std::string& command,
                                                       const std::string& folder);

}  // namespace pelorus::doctor

#endif
