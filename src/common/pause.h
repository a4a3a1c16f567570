// Waiting without losing a termination signal.
#ifndef PELORUS_COMMON_PAUSE_H
#define PELORUS_COMMON_PAUSE_H

namespace pelorus {

/// Waits for @p seconds. Returns early when a signal arrives, and immediately when a termination
/// signal already has; a signal between that check and the wait is not missed.
void pauseUnlessTerminated(int seconds);

}  // namespace pelorus

#endif
