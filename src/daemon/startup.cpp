#include "daemon/startup.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>

#include "common/files.h"
#include "common/log.h"
#include "common/signal_block.h"
#include "common/termination.h"
#include "common/version.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"
#include "connection/network_addrs.h"
#include "daemon/command_line.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"

namespace pelorus {

namespace {

constexpr const char* kPidFile = "/tmp/tavik_cm_pid";
constexpr const char* kStaticConfigVariable = "TAVIK_STATIC_CONFIG";
constexpr const char* kDefaultStaticConfig = "/var/www/rest-api/config/globalconfig.ini";
constexpr mode_t kUmask = 077;
constexpr mode_t kPidFileMode = 0600;

// Without them, a connection would get one of their numbers, and what a library prints to stderr
// would be sent there. Also for child processes, hence not close-on-exec.
void openMissingStreams() {
    int stream = STDIN_FILENO;
    while (stream >= 0 && stream < STDERR_FILENO) stream = open("/dev/null", O_RDWR);
    if (stream > STDERR_FILENO) static_cast<void>(close(stream));
}

void trapTerminationSignals() {
    if (installSignalHandlers()) return;
    // Names SIGINT whichever signal it was; scripts look for this text.
    std::perror("main - failed to install SIGINT handler function.\n");
    std::exit(EXIT_FAILURE);
}

Options readCommandLine(int argc, char** argv) {
    Options options;
    const std::optional<int> status = parseCommandLine(argc, argv, options);
    if (status) std::exit(*status);
    return options;
}

// Without a log option the defaults of the C library stay in force.
void openLog(const Options& options) {
    if (!options.log && !options.logToConsole) return;
    // Both take the lock that the signal handler needs for its own lines.
    const TerminationBlock held;
    setlogmask((1 << (options.severity + 1)) - 1);
    openlog("Pelorus", options.logToConsole ? LOG_CONS : 0, LOG_LOCAL0);
    logLine(LOG_ALERT, "main - syslog severity level set to %d.\n", options.severity);
}

// Returns in the child only, with its session id.
pid_t becomeDaemon() {
    const pid_t child = fork();
    if (child < 0) std::exit(EXIT_FAILURE);
    if (child > 0) std::exit(EXIT_SUCCESS);
    umask(kUmask);
    const pid_t session = setsid();
    if (session < 0 || chdir("/") != 0) std::exit(EXIT_FAILURE);
    return session;
}

// A core dump would hold the device's credentials. Programs that the daemon starts are not affected.
void forbidCoreDumps() {
    static_cast<void>(prctl(PR_SET_DUMPABLE, 0));
}

void logBanner(pid_t session) {
    logNotice("=======================================================================\n");
    logNotice("main - %s daemon starting up, Version: [%s], PID: [%d], SID: [%d] \n", "pelorus",
              GetPelorusVersion(), getpid(), session);
}

void writePidFile() {
    const FileHandle file = createFile(kPidFile, kPidFileMode);
    if (file) static_cast<void>(std::fprintf(file.get(), "%d", getpid()));
}

bool loadConfiguration() {
    const char* path = std::getenv(kStaticConfigVariable);
    if (GlobalConfig::getInstance()->loadConfig(path != nullptr ? path : kDefaultStaticConfig)) {
        return true;
    }
    logError("main - config file failed to load.\n");
    return false;
}

// With remote access off no cycle runs: the main loop only tears down.
void switchRemoteAccess(const Options& options) {
    if (!options.unmapAll && setting("ENABLEREMOTEACCESS") == "1") {
        DaemonControl::getInstance()->enableRemoteAccess();
        // Must not undo a termination signal that came first; a later one disables again by itself.
        if (terminationRequested()) DaemonControl::getInstance()->disableRemoteAccess();
    } else {
        DaemonControl::getInstance()->disableRemoteAccess();
    }
}

void applyTunables(const Options& options) {
    DaemonControl::getInstance()->setSleepTime(options.frequency);
    ConnectionManager::getInstance()->setDNSCheckInterval(options.dnsCheckInterval);
    if (options.portMapLifetime) {
        ConnectionManager::getInstance()->setReqPortMappingLifetime(*options.portMapLifetime,
                                                                    *options.portMapLifetime);
    }
    if (options.publicIpCheckInterval) {
        NetworkAddrs::getInstance()->SetIntervalDuration(*options.publicIpCheckInterval);
    }
}

[[noreturn]] void endProcess(int status) {
    for (const int stream : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        static_cast<void>(close(stream));
    }
    std::exit(status);
}

}  // namespace

void runPelorus(int argc, char** argv) {
    openMissingStreams();
    trapTerminationSignals();
    const Options options = readCommandLine(argc, argv);
    openLog(options);
    const pid_t session = becomeDaemon();
    forbidCoreDumps();
    logBanner(session);
    writePidFile();
    if (!loadConfiguration()) endProcess(EXIT_FAILURE);
    switchRemoteAccess(options);
    applyTunables(options);
    DaemonControl::getInstance()->run();
    endProcess(EXIT_SUCCESS);
}

}  // namespace pelorus
