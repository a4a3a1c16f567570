// Scrubbed text: neither a configured secret nor a control character is left in the log.
#include "common/log.h"
#include "config/scrub.h"
#include "fuzz_world.h"

// The three secrets and the text.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    support::LogCapture::get().reset();  // here the device has other secrets
    support::LogCapture::get().onLine(checkLine);
    const auto part = fields(text, 4);
    const std::pair<const char*, const std::string&> secrets[]{
        {"DEVICEID", part[0]}, {"DEVICEAUTH", part[1]}, {"SUBDOMAIN", part[2]}};
    for (const auto& [key, secret] : secrets) {
        GlobalConfig::getInstance()->setProperty(key, secret, false);
    }
    std::string scrubbed = scrubSecrets(part[3]);
    logError("answer %s\n", scrubbed.c_str());
    for (char& letter : scrubbed) letter = static_cast<char>(std::tolower(letter));
    for (const auto& [key, secret] : secrets) {
        // One with a letter of the masks may turn up again.
        if (secret.find_first_not_of("cfgjklpqwxyz0123456789-") != std::string::npos) continue;
        assert(secret.empty() || !support::holds(scrubbed, secret));
    }
}
