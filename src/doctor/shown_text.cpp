#include "doctor/shown_text.h"

#include <algorithm>

namespace pelorus::doctor {

namespace {

constexpr std::string_view kDots = "...";

bool isPrintable(char letter) {
    return letter >= ' ' && letter <= '~';
}

}  // namespace

std::string shownText(std::string_view text, std::size_t most) {
    std::string shown{text.substr(0, most)};
    std::replace_if(
        shown.begin(), shown.end(), [](char letter) { return !isPrintable(letter); }, '?');
    if (text.size() > most && most > kDots.size()) {
        shown.replace(most - kDots.size(), kDots.size(), kDots);
    }
    return shown;
}

}  // namespace pelorus::doctor
