#include "doctor/daemon_look.h"

#include <sys/stat.h>

#include <utility>

#include "common/files.h"
#include "doctor/age.h"

namespace pelorus::doctor {

namespace {

const std::string kDaemon = "pelorus";

bool isDaemon(const Process& process) {
    return process.name == kDaemon || process.program == kDaemon;
}

std::optional<pid_t> pidIn(const std::string& pidFile) {
    return readPid(readForeignFile(pidFile).text.value_or(""));
}

std::string upText(const Process& process, const Evidence& evidence) {
    std::string text{kDaemonUp};
    if (process.since) text += " " + ageInWords(evidence.now - *process.since);
    text += " (pid " + std::to_string(process.pid);
    if (!process.arguments.empty()) text += ", " + process.arguments;
    return text + ")";
}

// The file stays behind when the daemon ends; it was written at the start.
std::string goneText(const std::string& pidFile, std::optional<pid_t> pid, Time now) {
    struct stat status {};
    std::string text = "daemon does not run";
    if (!pid || stat(pidFile.c_str(), &status) != 0) return text;
    text += "; pid " + std::to_string(*pid) + " is gone";
    const auto age = now - Time{std::chrono::seconds{status.st_mtime}};
    return age.count() < 0 ? text : text + ", it was started " + ageInWords(age) + " ago";
}

}  // namespace

std::optional<Process> findDaemon(const ProcessTable& processes, const std::string& pidFile) {
    const auto pid = pidIn(pidFile);
    auto named = pid ? processes.find(*pid) : std::nullopt;
    if (named && isDaemon(*named)) return named;
    // In a full or read-only /tmp there is no pid file.
    auto others = processes.named(kDaemon);
    return others.empty() ? std::nullopt : std::optional{std::move(others.front())};
}

void lookAtDaemon(const ProcessTable& processes, const std::string& pidFile, Evidence& evidence) {
    const auto daemon = findDaemon(processes, pidFile);
    if (daemon) {
        evidence.daemon.pid = daemon->pid;
        evidence.daemon.since = daemon->since;
        evidence.daemon.options = daemon->arguments;
        const std::string text = upText(*daemon, evidence);
        evidence.add(Sign::DAEMON_RUNS, Source::NOW, text);
        evidence.checks.push_back({Check::Verdict::OK, Source::NOW, text});
    } else if (!processes.showsAll()) {
        evidence.checks.push_back(
            {Check::Verdict::NOT_SEEN, Source::NOW, "daemon's process: needs root"});
    } else {
        const std::string text = goneText(pidFile, pidIn(pidFile), evidence.now);
        evidence.add(Sign::DAEMON_GONE, Source::NOW, text);
        evidence.checks.push_back({Check::Verdict::PROBLEM, Source::NOW, text});
    }
}

}  // namespace pelorus::doctor
