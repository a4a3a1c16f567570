// Termination by signal.
#ifndef PELORUS_DAEMON_SIGNALS_H
#define PELORUS_DAEMON_SIGNALS_H

namespace pelorus {

/// Numbers that switch remote access on and off. sigTrap handles them but is not installed for
/// them: sent to the process, they have their default action.
// NOLINTBEGIN(bugprone-reserved-identifier): names other programs of the device use
inline constexpr int _SIGENABLEREMOTEACCESS = 30;
inline constexpr int _SIGDISABLEREMOTEACCESS = 31;
// NOLINTEND(bugprone-reserved-identifier)

/// Handler for SIGINT, SIGTERM and SIGQUIT: disables remote access and stores the number in
/// sigConnKilled, so that the main loop tears everything down and then ends the process by that
/// signal. A second signal of the same kind ends the process at once.
void sigTrap(int sig);

/// Installs sigTrap. False when the system refused.
[[nodiscard]] bool installSignalHandlers();

}  // namespace pelorus

#endif
