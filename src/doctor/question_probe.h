// Questions to the central service, asked only when the caller wants it.
#ifndef PELORUS_DOCTOR_QUESTION_PROBE_H
#define PELORUS_DOCTOR_QUESTION_PROBE_H

#include "doctor/findings.h"

namespace pelorus::doctor {

/// Asks which address the service sees; judgeSeenAddress concludes from it.
void askForAddress(const Evidence& evidence, Findings& findings);

/// Asks for one test of the published port, with the device's credentials. Only while the disk is
/// awake for certain: the test might wake it.
void askForPortTest(const Evidence& evidence, Findings& findings);

/// Concludes from the answer @p text to a test of @p port.
void judgePortTest(const std::string& text, const std::string& port, Findings& findings);

/// Compares the address the service sees with @p gatewayAddress, empty if that is not known.
void judgeSeenAddress(const Findings& answer,
                      const std::string& gatewayAddress,
                      Findings& findings);

}  // namespace pelorus::doctor

#endif
