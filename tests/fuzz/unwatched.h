// Takes the place of the watcher around library calls: the fakes answer at once, and a thread for
// each call would take most of the time. For the one source of a target, linked with "muldefs".
#ifndef PELORUS_FUZZ_UNWATCHED_H
#define PELORUS_FUZZ_UNWATCHED_H

#include "common/bounded_call.h"

pelorus::BoundedCall::BoundedCall(Peer /*peer*/, int /*seconds*/) {
}
pelorus::BoundedCall::~BoundedCall() = default;

#endif
