// Keeping what others must not read out of the doctor's words.
#ifndef PELORUS_DOCTOR_SHARING_H
#define PELORUS_DOCTOR_SHARING_H

#include <map>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

/// Replaces the values of DEVICEID, DEVICEAUTH and SUBDOMAIN, also URL-encoded and within names, by
/// their masks. A value of less than three characters stays: it is part of too many words.
///
/// For sharing also every IP and MAC address, the name of the device, and the host names of the
/// service: an address or name has the same replacement wherever this object finds it, such as
/// "address-1", "private-address-1", "shared-address-1", "mac-1" or "host-1". Addresses that tell
/// nothing stay: those of the device to itself, and netmasks.
class Masks {
public:
    /// With @p settings as the daemon merges them, and the host name of this device.
    Masks(const std::map<std::string, std::string>& settings,
          bool sharing,
          const std::string& deviceName = {});

    /// @p text without any of it.
    [[nodiscard]] std::string hide(std::string text);

    /// The same for every text of @p diagnosis that does not come from the doctor's own tables.
    void hideIn(Diagnosis& diagnosis);

private:
    struct Secret {
        std::string value, mask;
    };

    std::string hidePlaces(std::string_view text);
    std::string hideWord(std::string_view word);
    std::string hideAddresses(std::string_view word);
    [[nodiscard]] bool isHost(std::string_view name) const;
    std::string replacement(const std::string& kind, const std::string& place);

    std::vector<Secret> secrets;  // the longest first
    bool isSharing;
    std::string ownName, service;
    std::string domain;  // of the public names, with its leading dot
    std::map<std::string, std::string> replacements;
    std::map<std::string, int> counts;
};

}  // namespace pelorus::doctor

#endif
