#include "common/termination.h"

namespace pelorus {

std::atomic<int> sigConnKilled{kNoSignal};

bool terminationRequested() {
    return sigConnKilled != kNoSignal;
}

}  // namespace pelorus
