// The history as a picture.
#ifndef PELORUS_DOCTOR_HISTORY_PICTURE_H
#define PELORUS_DOCTOR_HISTORY_PICTURE_H

#include <string>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

/// A band of statuses over time with a legend, their shares, numbered marks where a cause set in,
/// the causes by number, and what could not be told: an SVG file.
[[nodiscard]] std::string historyPicture(const Diagnosis& diagnosis);

}  // namespace pelorus::doctor

#endif
