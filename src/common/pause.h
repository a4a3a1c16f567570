// Waiting without losing a termination signal.
#ifndef PELORUS_COMMON_PAUSE_H
#define PELORUS_COMMON_PAUSE_H

namespace pelorus {

/// Waits for @p seconds. Returns early when a signal comes, and at once when a termination signal
/// has come already: it cannot slip in between the look and the wait.
void pauseUnlessTerminated(int seconds);

}  // namespace pelorus

#endif
