// Where the doctor's sentences repeat what others said.
#ifndef PELORUS_DOCTOR_QUOTATIONS_H
#define PELORUS_DOCTOR_QUOTATIONS_H

#include <array>
#include <string_view>

namespace pelorus::doctor {

// The beginnings of sentences of which the rest may be others' words.
inline constexpr std::string_view kNotUnderstood =
    "the service's answer to a port test is not understood: ";
inline constexpr std::string_view kNotAccepted = "the service's certificate is not accepted: ";
inline constexpr std::string_view kNoConnection = "no connection to the service: ";
inline constexpr std::string_view kNoAnswer = "no answer from the service: ";
inline constexpr std::string_view kNoTunnel =
    "the tunnel client does not get through to the relay: ";
inline constexpr std::string_view kPortWanted = "the port wanted for internal port ";
inline constexpr std::string_view kTable = "gateway maps port ";
inline constexpr std::array<std::string_view, 7> kQuotations{
    kNotUnderstood, kNotAccepted, kNoConnection, kNoAnswer, kNoTunnel, kPortWanted, kTable};

/// The doctor's own words behind kTable and what it opens.
inline constexpr std::string_view kNotOurs = ", not this device's address";

}  // namespace pelorus::doctor

#endif
