// Asking the gateway. Nothing is mapped.
#ifndef PELORUS_DOCTOR_GATEWAY_PROBE_H
#define PELORUS_DOCTOR_GATEWAY_PROBE_H

#include "doctor/findings.h"
#include "doctor/gateway_verdict.h"

namespace pelorus::doctor {

/// Asks through UPnP for the external address and the table of mappings. Concludes from the table
/// only; the rest is for readAnswer.
void askThroughUpnp(const Evidence& evidence, Findings& findings);
/// Asks the gateway of the default route through NAT-PMP for the external address.
void askThroughNatpmp(Findings& findings);

/// What one of these has found.
[[nodiscard]] GatewayAnswer readAnswer(const Findings& findings);

/// Says so when UPnP found a gateway that was too slow for its table to be read.
void judgeUnfinishedTable(const Findings& found, Findings& findings);

}  // namespace pelorus::doctor

#endif
