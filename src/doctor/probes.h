// Everything that is looked at live.
#ifndef PELORUS_DOCTOR_PROBES_H
#define PELORUS_DOCTOR_PROBES_H

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct ProbeChoice {
    /// Ask the central service which address it sees and, where a port is published, for one test
    /// of it. Nothing else is sent with the device's credentials.
    bool askService = false;
};

/// Looks at the device and its surroundings, all at once, for at most 10 seconds, and adds what was
/// seen to @p evidence, of which it reads only the settings, the status and whether the disk
/// is in use. It changes nothing
/// anywhere, and does not wake the disk. Call it while this process has one thread.
void probe(const ProbeChoice& choice, Evidence& evidence);

}  // namespace pelorus::doctor

#endif
