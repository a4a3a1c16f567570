#include "common/pause.h"

#include <poll.h>

#include <csignal>
#include <ctime>

#include "common/signal_block.h"
#include "common/termination.h"

namespace pelorus {

void pauseUnlessTerminated(int seconds) {
    const TerminationBlock held;
    if (terminationRequested()) return;
    const timespec length{seconds, 0};
    static_cast<void>(ppoll(nullptr, 0, &length, &held.previousMask()));
}

}  // namespace pelorus
