// The two ends of a text.
#ifndef PELORUS_DOCTOR_TEXT_PARTS_H
#define PELORUS_DOCTOR_TEXT_PARTS_H

#include <string_view>

namespace pelorus::doctor {

[[nodiscard]] inline bool startsWith(std::string_view text, std::string_view beginning) {
    return text.substr(0, beginning.size()) == beginning;
}

[[nodiscard]] inline bool endsWith(std::string_view text, std::string_view end) {
    return text.size() >= end.size() && text.substr(text.size() - end.size()) == end;
}

}  // namespace pelorus::doctor

#endif
