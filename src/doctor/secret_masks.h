// Keeping the device's secrets out of the doctor's words.
#ifndef PELORUS_DOCTOR_SECRET_MASKS_H
#define PELORUS_DOCTOR_SECRET_MASKS_H

#include <cstddef>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace pelorus::doctor {

/// Replaces device ids, authorisations and subdomains by their masks: the values of DEVICEID,
/// DEVICEAUTH and SUBDOMAIN, also as URLs, XML and JSON encode them and cut off by three dots, and
/// those of other devices where URLs, answers and public names show them. A value of less than three
/// characters stays: it is part of too many words. So does one that reads as a word of the doctor's
/// own sentences, where it stands in one and not in what that repeats of others.
class SecretMasks {
public:
    /// With the values that @p settings give these keys, the first 1000 of each; other keys are
    /// ignored.
    explicit SecretMasks(const std::multimap<std::string, std::string>& settings);

    /// True for a value at a place of a text that is left for others to hide.
    using Exception =
        std::function<bool(std::string_view text, std::size_t at, std::size_t length)>;

    /// @p text without any of them.
    [[nodiscard]] std::string hide(std::string text, const Exception& isKept = {}) const;

private:
    struct Secret {
        std::string value;
        const char* mask;
    };

    std::vector<Secret> secrets;
};

}  // namespace pelorus::doctor

#endif
