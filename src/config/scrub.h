// Keeping the device's secrets out of the log.
#ifndef PELORUS_CONFIG_SCRUB_H
#define PELORUS_CONFIG_SCRUB_H

#include <string>

namespace pelorus {

/// Returns @p text with the configured device identifier, device authorisation and subdomain
/// replaced by their masks, and each control character, line feeds included, by a blank: nobody
/// outside can forge a log line or reach the terminal of its reader. Everything that comes from
/// outside (answers, names, file contents) passes through here on its way to the log.
[[nodiscard]] std::string scrubSecrets(std::string text);

}  // namespace pelorus

#endif
