// The device's public names.
#ifndef PELORUS_DOCTOR_NAMES_PROBE_H
#define PELORUS_DOCTOR_NAMES_PROBE_H

#include <string>
#include <string_view>
#include <vector>

#include "doctor/findings.h"

namespace pelorus::doctor {

/// Looks where the names lead, of a device that is reached directly or through the relay.
void lookAtNames(const Evidence& evidence, Findings& findings);

/// The address of the relay that the client's output named last; empty if it names none.
[[nodiscard]] std::string relayInOutput(std::string_view output);

/// Concludes from the address of each name, empty for a name without one. @p expected is empty when
/// it is not known; that the names agree is then no sign that they are right.
void judgeNames(const std::vector<std::string>& addresses,
                const std::string& expected,
                bool relayed,
                Findings& findings);

}  // namespace pelorus::doctor

#endif
