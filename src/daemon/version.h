// The version of the daemon.
#ifndef PELORUS_DAEMON_VERSION_H
#define PELORUS_DAEMON_VERSION_H

namespace pelorus {

/// The version as shown by -v and in the start-up banner.
const char* GetPelorusVersion();

}  // namespace pelorus

#endif
