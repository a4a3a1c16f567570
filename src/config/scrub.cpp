#include "config/scrub.h"

#include <algorithm>
#include <array>
#include <utility>

#include "common/masks.h"
#include "common/text.h"
#include "config/global_config.h"

namespace pelorus {

std::string scrubSecrets(std::string text) {
    auto* config = GlobalConfig::getInstance();
    std::array<std::pair<std::string, const char*>, 3> secrets{{
        {config->getProperty("DEVICEID"), STRIPPED_DEVID_VAL},
        {config->getProperty("DEVICEAUTH"), STRIPPED_DEVAUTH_VAL},
        {config->getProperty("SUBDOMAIN"), STRIPPED_SUBDOMAIN_VAL},
    }};
    // The longest first: a secret that holds another one would otherwise leave its rest behind.
    std::stable_sort(secrets.begin(), secrets.end(), [](const auto& left, const auto& right) {
        return left.first.size() > right.first.size();
    });
    for (const auto& [secret, mask] : secrets) replaceAll(text, secret, mask);
    return text;
}

}  // namespace pelorus
