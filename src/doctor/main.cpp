#include <fcntl.h>
#include <sys/ioctl.h>
#include <syslog.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "common/handles.h"
#include "doctor/device_files.h"
#include "doctor/device_log.h"
#include "doctor/device_settings.h"
#include "doctor/diagnosis.h"
#include "doctor/doctor_options.h"
#include "doctor/history_picture.h"
#include "doctor/json_report.h"
#include "doctor/lines.h"
#include "doctor/probes.h"
#include "doctor/settings_report.h"
#include "doctor/sharing.h"
#include "doctor/static_file.h"
#include "doctor/text_report.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr int kUnusableSettings = 2;

Time now() {
    return std::chrono::time_point_cast<std::chrono::seconds>(std::chrono::system_clock::now());
}

std::string hostName() {
    std::array<char, 256> name{};
    return gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "";
}

Layout layout() {
    Layout result;
    result.today = now();
    const bool isTerminal = isatty(STDOUT_FILENO) == 1;
    winsize size{};
    if (isTerminal && ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0) {
        result.width = size.ws_col;
        // One is left for the prompt.
        if (size.ws_row > 0) result.height = size.ws_row - 1;
    }
    const char* noColour = std::getenv("NO_COLOR");
    const char* terminal = std::getenv("TERM");
    result.colours = isTerminal && (noColour == nullptr || *noColour == '\0') &&
                     terminal != nullptr && terminal != std::string_view{"dumb"};
    return result;
}

void probeWithProgress(const ProbeChoice& choice, Evidence& evidence) {
    constexpr std::string_view kProgress = "looking at the network...";
    const bool isShown = isatty(STDERR_FILENO) == 1;
    if (isShown) std::fprintf(stderr, "%s", kProgress.data());
    probe(choice, evidence);
    if (isShown) std::fprintf(stderr, "\r%*s\r", static_cast<int>(kProgress.size()), "");
}

Evidence look(const DoctorOptions& options) {
    Evidence evidence;
    evidence.now = now();
    const StaticFile file = findStaticFile();
    evidence.fromElsewhere = !options.logs.empty() && !options.probes && isAbsent(file.path);
    if (!evidence.fromElsewhere) {
        if (!file.remark.empty()) {
            evidence.checks.push_back({Check::Verdict::OK, Source::SETTINGS, file.remark});
        }
        DevicePaths paths;
        paths.staticFile = file.path;
        lookAtFiles(paths, evidence);
    }
    LogChoice choice;
    choice.files = options.logs;
    lookAtLog(choice, evidence);
    if (options.probes) {
        ProbeChoice probes;
        probes.askService = options.askService;
        probeWithProgress(probes, evidence);
    }
    return evidence;
}

int complain(const char* what) {
    const int cause = errno;
    std::fprintf(stderr, "pelorus-doctor: cannot write %s: %s\n", what, std::strerror(cause));
    return kNotWritten;
}

// Of the file that is open: 0, or the exit status.
int writeAll(std::FILE* file, const std::string& text, const char* name) {
    const bool isWritten = std::fwrite(text.data(), 1, text.size(), file) == text.size();
    return isWritten && std::fflush(file) == 0 ? 0 : complain(name);
}

int writePicture(const std::string& path, const std::string& picture) {
    constexpr mode_t kMode = 0644;
    const int descriptor = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kMode);
    if (descriptor < 0) return complain(path.c_str());
    const FileHandle file{fdopen(descriptor, "w")};
    return file ? writeAll(file.get(), picture, path.c_str()) : complain(path.c_str());
}

Masks masksFor(const DoctorOptions& options,
               const std::map<std::string, std::string>& settings,
               const std::multimap<std::string, std::string>& secrets,
               std::vector<std::string> hosts) {
    if (!options.share) return Masks{secrets};
    if (const auto server = settings.find("SERVER_BASE_URL"); server != settings.end()) {
        hosts.push_back(serviceName(server->second));
    }
    return Masks{secrets, PlaceMasks{hosts, options.logs}};
}

int reportSettings(const DoctorOptions& options) {
    const StaticFile found = findStaticFile();
    const std::string file = found.path;
    SettingsReport report = checkSettings(file);
    if (!found.remark.empty()) report.remarks.insert(report.remarks.begin(), found.remark);
    const DeviceSettings settings = readDeviceSettings(file);
    Masks masks = masksFor(options, settings.merged.values, settings.secrets(), {hostName()});
    const Layout how = layout();
    std::string text;
    const auto add = [&](const char* label, const std::string& line) {
        for (const std::string& part :
             hang(label, masks.hide(line), static_cast<std::size_t>(how.width))) {
            text += part + '\n';
        }
    };
    const std::string name = file.empty() ? "an empty TAVIK_STATIC_CONFIG" : file;
    if (report.needsRoot) {
        add("", "Whether the daemon starts with " + name + " could not be told.");
    } else {
        add("", "With " + name + " the daemon " + (report.usable ? "starts." : "does not start."));
    }
    for (const std::string& problem : report.problems) add("PROBLEM  ", problem);
    for (const std::string& remark : report.remarks) add("remark   ", remark);
    if (report.problems.empty() && report.remarks.empty()) text += "Nothing to remark.\n";
    const int failure = writeAll(stdout, text, "to standard output");
    if (failure != 0) return failure;
    return report.usable ? 0 : kUnusableSettings;
}

int reportDiagnosis(const DoctorOptions& options) {
    const Evidence evidence = look(options);
    Diagnosis diagnosis = diagnose(evidence);
    std::vector<std::string> hosts{evidence.logHosts.begin(), evidence.logHosts.end()};
    if (!evidence.fromElsewhere) hosts.push_back(hostName());
    // In every text of it: masked in the finished output, a number that is a secret would spoil the
    // format where it is a coordinate or a time.
    masksFor(options, evidence.settings, evidence.secrets, hosts).hideIn(diagnosis);
    int failure = 0;
    if (!options.picture.empty()) {
        failure = writePicture(options.picture, historyPicture(diagnosis));
    }
    const std::string report =
        options.json ? jsonReport(diagnosis) : textReport(diagnosis, layout());
    const int printing = writeAll(stdout, report, "to standard output");
    if (failure == 0) failure = printing;
    return failure != 0 ? failure : exitStatus(diagnosis);
}

int runDoctor(int argc, char** argv) {
    tzset();
    // What the shared code logs is the daemon's to say.
    static_cast<void>(setlogmask(LOG_MASK(LOG_EMERG)));
    const DoctorOptions options = parseDoctorOptions(argc, argv);
    if (options.exitStatus) return *options.exitStatus;
    return options.settingsOnly ? reportSettings(options) : reportDiagnosis(options);
}

}  // namespace

}  // namespace pelorus::doctor

int main(int argc, char** argv) {
    return pelorus::doctor::runDoctor(argc, argv);
}
