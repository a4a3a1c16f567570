// What a text may say where parts of it are encoded.
#ifndef PELORUS_DOCTOR_READINGS_H
#define PELORUS_DOCTOR_READINGS_H

#include <cstddef>
#include <string>
#include <vector>

namespace pelorus::doctor {

/// A text with parts of it decoded, and where they were.
struct Reading {
    std::string text;
    std::vector<std::size_t> places;  ///< of each character, and the end, in the original text
};

/// @p text itself, and what it says with the codes of URLs, XML and JSON read, one kind after
/// another in any order and several times: 32 readings at most. A character beyond ASCII becomes
/// its bytes in UTF-8.
[[nodiscard]] std::vector<Reading> readingsOf(const std::string& text);

}  // namespace pelorus::doctor

#endif
