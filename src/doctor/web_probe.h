// The device's own web server and back end.
#ifndef PELORUS_DOCTOR_WEB_PROBE_H
#define PELORUS_DOCTOR_WEB_PROBE_H

#include <string>

#include "doctor/findings.h"

namespace pelorus::doctor {

/// An internal port of the web server.
struct WebPort {
    int number{};
    std::string obstacle;  ///< why nothing listens there; empty when something does
};

/// Concludes from both ports at the device's @p address.
void judgeWebServer(const std::string& address,
                    const WebPort& http,
                    const WebPort& https,
                    Findings& findings);

/// Looks whether the device's web server listens on the internal ports.
void lookAtWebServer(const Evidence& evidence, Findings& findings);

/// Looks whether the local back end answers. It is sent one request for the head of a page, but
/// only while the disk is awake for certain: the request might wake it. One that takes the
/// connection but is slow to answer counts as silent only where the log says so, too.
void lookAtBackEnd(const Evidence& evidence, Findings& findings);

}  // namespace pelorus::doctor

#endif
