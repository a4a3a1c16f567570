// From the command line to the main loop.
#ifndef PELORUS_DAEMON_STARTUP_H
#define PELORUS_DAEMON_STARTUP_H

namespace pelorus {

/// The whole life of the process: start-up, main loop, end. Ends the process itself.
[[noreturn]] void runPelorus(int argc, char** argv);

}  // namespace pelorus

#endif
