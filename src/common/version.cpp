#include "common/version.h"

namespace pelorus {

const char* GetPelorusVersion() {
    return "1.7.0-54";
}

}  // namespace pelorus
