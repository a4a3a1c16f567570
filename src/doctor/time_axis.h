// The ticks of a time axis.
#ifndef PELORUS_DOCTOR_TIME_AXIS_H
#define PELORUS_DOCTOR_TIME_AXIS_H

#include <cstddef>
#include <string>
#include <vector>

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct Tick {
    Time when{};
    std::string label{};  ///< local time or day; "2 Nov", "06:00", "06:00:10"
};

/// At most @p most ticks from @p begin to @p end at round local times, seconds to years apart.
[[nodiscard]] std::vector<Tick> timeTicks(Time begin, Time end, std::size_t most);

}  // namespace pelorus::doctor

#endif
