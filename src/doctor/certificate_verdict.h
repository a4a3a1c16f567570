// What is wrong with the service's certificate, and whether the clock is to blame.
#ifndef PELORUS_DOCTOR_CERTIFICATE_VERDICT_H
#define PELORUS_DOCTOR_CERTIFICATE_VERDICT_H

#include <ctime>
#include <optional>
#include <string>

namespace pelorus::doctor {

/// The TLS library's error message in plain words, such as "has expired".
[[nodiscard]] std::string certificateFault(const std::string& message);

/// True when that fault may come from a wrong clock.
[[nodiscard]] bool mayBeTheClock(const std::string& fault);

/// What the service's own answers say about the time.
struct ServiceTimes {
    std::optional<std::time_t> date;        ///< the time it says it is
    std::optional<std::time_t> notBefore;   ///< the certificate's first moment
    std::optional<std::time_t> notAfter{};  ///< its last one
};

/// Why a clock that says @p now is wrong; nothing when there is no evidence. A certificate that has
/// run out is none.
[[nodiscard]] std::optional<std::string> clockFault(std::time_t now, const ServiceTimes& times);

}  // namespace pelorus::doctor

#endif
