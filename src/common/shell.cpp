#include "common/shell.h"

#include <csignal>
#include <cstdlib>

#include "common/signal_block.h"

namespace pelorus {

int runShell(const std::string& command) {
    // The C library ignores both while the command runs, which discards them unless they are
    // blocked. SIGTERM stays deliverable: the command would inherit its being blocked.
    const SignalBlock kept{SIGINT, SIGQUIT};
    return std::system(command.c_str());
}

}  // namespace pelorus
