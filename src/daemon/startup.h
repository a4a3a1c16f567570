// The life of the daemon process.
#ifndef PELORUS_DAEMON_STARTUP_H
#define PELORUS_DAEMON_STARTUP_H

namespace pelorus {

/// Runs the daemon: start-up, main loop, exit.
[[noreturn]] void runPelorus(int argc, char** argv);

}  // namespace pelorus

#endif
