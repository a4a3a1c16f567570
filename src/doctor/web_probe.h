// The device's own web server and back end.
#ifndef PELORUS_DOCTOR_WEB_PROBE_H
#define PELORUS_DOCTOR_WEB_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

/// Looks whether the device's web server listens on the internal ports.
void lookAtWebServer(const Evidence& evidence, Findings& findings);

/// Looks whether the local back end answers. It is sent one request for the head of a page, but
/// only while the disk is awake for certain: the request might wake it.
void lookAtBackEnd(const Evidence& evidence, Findings& findings);

}  // namespace pelorus::doctor

#endif
