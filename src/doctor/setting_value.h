// What is wrong with a value.
#ifndef PELORUS_DOCTOR_SETTING_VALUE_H
#define PELORUS_DOCTOR_SETTING_VALUE_H

#include <string>
#include <string_view>

#include "doctor/known_settings.h"

namespace pelorus::doctor {

/// Why the daemon does not read @p value as it was meant: "is no port". It does not hold the value.
/// Empty when nothing is wrong with it, and for an empty value.
[[nodiscard]] std::string valueFault(const KnownSetting& setting, const std::string& value);

/// The same for a template that is given the values @p takes (see KnownSetting).
[[nodiscard]] std::string templateFault(std::string_view text, std::string_view takes);

/// True when a line may show the value: short ones of a known kind without secrets.
[[nodiscard]] bool isShowable(const KnownSetting& setting);

}  // namespace pelorus::doctor

#endif
