#include "doctor/sharing.h"

namespace pelorus::doctor {

std::string Masks::hide(std::string text) {
    text = secrets.hide(std::move(text));
    return places ? places->hide(std::move(text)) : text;
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
