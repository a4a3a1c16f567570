// The network interfaces, and what the relay needs.
#ifndef PELORUS_DOCTOR_NETWORK_PROBE_H
#define PELORUS_DOCTOR_NETWORK_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

/// Looks at the device's interfaces and default route.
void lookAtNetwork(Findings& findings);

/// Looks for what the relay needs on the device: the client program and the tunnel device.
void lookAtRelayNeeds(const Evidence& evidence, Findings& findings);

}  // namespace pelorus::doctor

#endif
