// The causes that the doctor can name: one table.
#ifndef PELORUS_DOCTOR_CAUSES_H
#define PELORUS_DOCTOR_CAUSES_H

#include <string_view>
#include <vector>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// One cause. Its rank is its place in the table: earlier rows weigh more.
struct Cause {
    std::string_view name;                ///< stable: other programs and the documentation use it
    std::vector<Reach> when;              ///< it explains only these
    std::vector<std::vector<Sign>> seen;  ///< all signs of at least one of these lists
    std::vector<Sign> notSeen;            ///< none of these
    std::string_view sentence;            ///< ends with a full stop
    std::string_view remedy;              ///< one or two sentences
};

/// A cause that the evidence carries.
struct NamedCause {
    const Cause* cause{};
    std::vector<Fact> proofs;  ///< of the signs that were asked for, in that order
};

/// The table, the weightiest first.
const std::vector<Cause>& allCauses();

/// The causes that @p evidence carries for @p reach, the weightiest first.
std::vector<NamedCause> findCauses(const Evidence& evidence, Reach reach);

}  // namespace pelorus::doctor

#endif
