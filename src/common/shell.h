// Running shell commands.
#ifndef PELORUS_COMMON_SHELL_H
#define PELORUS_COMMON_SHELL_H

#include <string>

namespace pelorus {

/// Runs @p command with the shell and waits for its end. Returns what system() returns: a wait
/// status, or -1 when no shell could be started. A SIGINT or SIGQUIT that arrives meanwhile is
/// delivered at the end; system() alone would lose it. The command starts with both blocked.
int runShell(const std::string& command);

}  // namespace pelorus

#endif
