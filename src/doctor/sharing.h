// Keeping what others must not read out of the doctor's words.
#ifndef PELORUS_DOCTOR_SHARING_H
#define PELORUS_DOCTOR_SHARING_H

#include <map>
#include <optional>
#include <string>

#include "doctor/diagnosis.h"
#include "doctor/place_masks.h"
#include "doctor/secret_masks.h"

namespace pelorus::doctor {

/// Removes the device's secrets, and for sharing addresses and names too.
class Masks {
public:
    /// With @p settings as SecretMasks takes them; with @p sharedPlaces for sharing.
    explicit Masks(const std::multimap<std::string, std::string>& settings,
                   std::optional<PlaceMasks> sharedPlaces = {})
        : secrets{settings}, places{std::move(sharedPlaces)} {}

    /// @p text without any of it. It must be whole: what is wrapped is not found.
    [[nodiscard]] std::string hide(std::string text);

    /// The same for every text of @p diagnosis that does not come from the doctor's own tables.
    void hideIn(Diagnosis& diagnosis);

private:
    SecretMasks secrets;
    std::optional<PlaceMasks> places;
};

}  // namespace pelorus::doctor

#endif
