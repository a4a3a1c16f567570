// The central service: its name, connection and certificate.
#ifndef PELORUS_DOCTOR_SERVICE_PROBE_H
#define PELORUS_DOCTOR_SERVICE_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

/// Resolves the service's name and connects as the daemon does. No request is sent, unless the
/// dates of the certificate are wrong: then one for the head of a page, which tells the time.
void lookAtService(const Evidence& evidence, Findings& findings);

/// What lookAtService was doing when it was cut short.
void judgeUnfinishedService(const Findings& sofar, Findings& findings);

}  // namespace pelorus::doctor

#endif
