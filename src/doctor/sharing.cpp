#include "doctor/sharing.h"

#include <string_view>
#include <utility>

namespace pelorus::doctor {

std::string Masks::hide(std::string text) {
    if (!places) return secrets.hide(std::move(text));
    // Masked first, what is also part of an address or a name would leave the rest of that.
    bool isAnyKept = false;
    const auto isKept = [&](std::string_view whole, std::size_t at, std::size_t length) {
        const bool isPart = places->hidesAround(whole, at, length);
        isAnyKept |= isPart;
        return isPart;
    };
    text = places->hide(secrets.hide(std::move(text), isKept));
    return isAnyKept ? secrets.hide(std::move(text)) : text;
}

void Masks::hideIn(Diagnosis& diagnosis) {
    const auto mask = [this](std::string& text) { text = hide(std::move(text)); };
    mask(diagnosis.address);
    mask(diagnosis.ports);
    mask(diagnosis.daemon.options);
    if (diagnosis.before) {
        mask(diagnosis.before->address);
        mask(diagnosis.before->cause);
    }
    for (NamedCause& cause : diagnosis.causes) {
        for (Fact& fact : cause.proofs) mask(fact.text);
    }
    for (Check& check : diagnosis.checks) mask(check.text);
    for (std::string& text : diagnosis.untold) mask(text);
    for (Period& period : diagnosis.history) {
        mask(period.address);
        mask(period.cause);
    }
}

}  // namespace pelorus::doctor
