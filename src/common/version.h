// The version of the daemon and of what is built with it.
#ifndef PELORUS_COMMON_VERSION_H
#define PELORUS_COMMON_VERSION_H

namespace pelorus {

/// The version as shown by -v and --version, and in the start-up banner.
const char* GetPelorusVersion();

}  // namespace pelorus

#endif
