#include "daemon/startup.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "common/handles.h"
#include "common/log.h"
#include "common/termination.h"
#include "config/global_config.h"
#include "connection/connection_manager.h"
#include "connection/network_addrs.h"
#include "daemon/command_line.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"
#include "daemon/version.h"

namespace pelorus {

namespace {

constexpr const char* kPidFile = "/tmp/tavik_cm_pid";
constexpr const char* kStaticConfigVariable = "TAVIK_STATIC_CONFIG";
constexpr const char* kDefaultStaticConfig = "/var/www/rest-api/config/globalconfig.ini";
constexpr mode_t kFileMask = 077;

// Without a log option syslog is left as the C library has it.
void openLog(const Options& options) {
    if (!options.log && !options.logToConsole) return;
    setlogmask(LOG_UPTO(options.severity));
    openlog("Pelorus", options.logToConsole ? LOG_CONS : 0, LOG_LOCAL0);
    logLine(LOG_ALERT, "main - syslog severity level set to %d.\n", options.severity);
}

// Goes on in a child that leads a session of its own, and returns the session's id.
pid_t daemonize() {
    const pid_t child = fork();
    if (child < 0) std::exit(EXIT_FAILURE);
    if (child > 0) std::exit(EXIT_SUCCESS);
    umask(kFileMask);
    const pid_t session = setsid();
    if (session < 0 || chdir("/") != 0) std::exit(EXIT_FAILURE);
    return session;
}

void logBanner(pid_t session) {
    logLine(LOG_NOTICE,
            "=======================================================================\n");
    logLine(LOG_NOTICE, "main - %s daemon starting up, Version: [%s], PID: [%d], SID: [%d] \n",
            "pelorus", GetPelorusVersion(), getpid(), session);
}

// /tmp is everybody's: a link planted there must not lead the write elsewhere.
void writePidFile() {
    const int file =
        open(kPidFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, S_IRUSR | S_IWUSR);
    if (file < 0) return;
    const FileHandle stream{fdopen(file, "w")};
    if (stream) static_cast<void>(std::fprintf(stream.get(), "%d", getpid()));
}

bool loadConfiguration() {
    const char* path = std::getenv(kStaticConfigVariable);
    return GlobalConfig::getInstance()->loadConfig(path == nullptr ? kDefaultStaticConfig : path);
}

void chooseInitialState(const Options& options) {
    if (!options.unmapAll && setting("ENABLEREMOTEACCESS") == "1") {
        DaemonControl::getInstance()->enableRemoteAccess();
        // A signal that came before must not be undone; one that comes later disables by itself.
        if (terminationRequested()) DaemonControl::getInstance()->disableRemoteAccess();
    } else {
        DaemonControl::getInstance()->disableRemoteAccess();
    }
}

void handOverTunables(const Options& options) {
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
    close(STDIN_FILENO);
    close(STDOUT_FILENO);
    close(STDERR_FILENO);
    std::exit(status);
}

}  // namespace

void runPelorus(int argc, char** argv) {
    DaemonControl::getInstance();  // made before the signal handler can ask for it
    if (!installSignalHandlers()) {
        // One text for all three signals.
        std::perror("main - failed to install SIGINT handler function.\n");
        std::exit(EXIT_FAILURE);
    }
    Options options;
    if (const auto status = parseCommandLine(argc, argv, options)) std::exit(*status);
    openLog(options);
    const pid_t session = daemonize();
    logBanner(session);
    writePidFile();
    if (!loadConfiguration()) {
        logLine(LOG_ERR, "main - config file failed to load.\n");
        endProcess(EXIT_FAILURE);
    }
    chooseInitialState(options);
    handOverTunables(options);
    DaemonControl::getInstance()->run();
    endProcess(EXIT_SUCCESS);
}

}  // namespace pelorus
