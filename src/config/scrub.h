// Keeping the device's secrets out of the log.
#ifndef PELORUS_CONFIG_SCRUB_H
#define PELORUS_CONFIG_SCRUB_H

#include <string>

namespace pelorus {

/// Returns @p text with the configured device identifier, device authorisation and subdomain
/// replaced by their masks, and each line feed by a blank, so that nobody outside can forge a log
/// line. Everything that comes from outside (answers, names, file contents) passes through here on
/// its way to the log, which blanks the other control characters.
[[nodiscard]] std::string scrubSecrets(std::string text);

}  // namespace pelorus

#endif
