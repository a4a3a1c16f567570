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

/// Replaces @p secret by @p mask everywhere in @p text, whatever the case of its letters. Carriage
/// returns at the end of the secret are ignored; an empty one is nowhere.
void hideSecret(std::string& text, std::string secret, const std::string& mask);

}  // namespace pelorus

#endif
