#include "doctor/device_files.h"

#include <unistd.h>

#include <cerrno>
#include <utility>

#include "common/connection_types.h"
#include "common/files.h"
#include "common/text.h"
#include "doctor/daemon_look.h"
#include "doctor/device_settings.h"
#include "doctor/process_table.h"
#include "doctor/shown_text.h"
#include "doctor/tunnel_look.h"

namespace pelorus::doctor {

namespace {

using Verdict = Check::Verdict;

constexpr int kHighestPort = 65535;
constexpr int kMostIdleMinutes = 1;

void check(Evidence& evidence, Verdict verdict, Source source, std::string text) {
    evidence.checks.push_back({verdict, source, std::move(text)});
}

void conclude(Evidence& evidence, Sign sign, const std::string& text) {
    evidence.add(sign, Source::SETTINGS, text);
    check(evidence, Verdict::PROBLEM, Source::SETTINGS, text);
}

void lookAtFilesThemselves(const DeviceSettings& settings, Evidence& evidence) {
    if (settings.obstacle == DeviceSettings::Obstacle::STATIC_FILE) {
        conclude(evidence, Sign::STATIC_FILE_UNREADABLE, "settings: " + settings.reason);
    } else if (settings.obstacle == DeviceSettings::Obstacle::DYNAMIC_FILE) {
        conclude(evidence, Sign::DYNAMIC_FILE_UNREADABLE, "dynamic settings: " + settings.reason);
    } else if (settings.needsRoot) {
        check(evidence, Verdict::NOT_SEEN, Source::SETTINGS, "settings files: need root");
        evidence.untold.emplace_back(
            "Settings, tunnel and their effect could not be told: run it as root.");
    } else {
        const FileKind source = settings.dynamicSource();
        std::string text = "settings: " + shownText(settings.staticFile.path) + " and " +
                           shownText(settings.file(source).path);
        if (source == FileKind::DYNAMIC && !settings.copy.path.empty()) {
            text += ", of which there is no copy yet";
        }
        check(evidence, Verdict::OK, Source::SETTINGS, text);
    }
}

bool isPort(const std::string& value) {
    const int port = scanInt(value.c_str()).value_or(0);
    return port >= 1 && port <= kHighestPort;
}

void lookAtManualPorts(Evidence& evidence) {
    if (evidence.setting("MANUAL_PORT_FORWARD") != "TRUE") return;
    evidence.add(Sign::MANUAL_MODE, Source::SETTINGS, "the ports are forwarded by hand");
    std::string ports;
    for (const char* key : {"MANUAL_EXTERNAL_HTTP_PORT", "MANUAL_EXTERNAL_HTTPS_PORT"}) {
        const std::string value = evidence.setting(key);
        ports += (ports.empty() ? "" : " and ") + shownText(value, 10);
        if (isPort(value)) continue;
        conclude(evidence, Sign::MANUAL_PORT_INVALID,
                 std::string{key} +
                     (value.empty() ? " is not set" : " is no port: " + shownText(value, 20)));
    }
    if (evidence.has(Sign::MANUAL_PORT_INVALID)) return;
    check(evidence, Verdict::OK, Source::SETTINGS, "ports forwarded by hand: " + ports);
}

void lookAtCredentials(Evidence& evidence) {
    std::string missing;
    for (const char* key : {"DEVICEID", "DEVICEAUTH"}) {
        if (evidence.setting(key).empty())
            missing += (missing.empty() ? "" : " and ") + std::string{key};
    }
    if (missing.empty()) {
        const std::string text = "the device has its credentials";
        evidence.add(Sign::HAS_CREDENTIALS, Source::SETTINGS, text);
        check(evidence, Verdict::OK, Source::SETTINGS, text);
    } else {
        conclude(evidence, Sign::CREDENTIALS_MISSING, "credentials missing: no " + missing);
    }
}

void lookAtSettings(Evidence& evidence) {
    lookAtCredentials(evidence);
    const std::string access = evidence.setting("ENABLEREMOTEACCESS");
    if (access != "1") {
        conclude(evidence, Sign::REMOTE_ACCESS_OFF,
                 access.empty() ? "remote access is off: ENABLEREMOTEACCESS is not set"
                                : "remote access is off: ENABLEREMOTEACCESS is " +
                                      shownText(access, 20) + ", not 1");
    }
    lookAtManualPorts(evidence);
    if (evidence.setting("DEFAULT_PORTS_ONLY") == "TRUE") {
        evidence.add(Sign::DEFAULT_PORTS_ONLY, Source::SETTINGS,
                     "only the external ports 9091 and 9444 are allowed");
    }
    if (leadingInt(evidence.setting("DEVICETYPE")) == kMakersRouter) {
        evidence.add(Sign::OWN_ROUTER, Source::SETTINGS, "the device is itself the router");
    }
}

// Once a port is published, the daemon tests it only while the disk is in use.
void lookAtMinutes(const std::string& path, Evidence& evidence) {
    if (evidence.has(Sign::OWN_ROUTER)) return;
    const ForeignText file = readForeignFile(path);
    if (!file.text && (file.error == EACCES || file.error == EPERM) && geteuid() != 0) {
        check(evidence, Verdict::NOT_SEEN, Source::NOW, "how long the disk is unused: needs root");
        return;
    }
    const std::string content = file.text.value_or("");
    const std::string firstLine = content.substr(0, content.find('\n'));
    const int minutes = leadingInt(firstLine);
    if (file.text && !scanInt(firstLine.c_str())) {
        check(evidence, Verdict::NOT_SEEN, Source::NOW,
              "how long the disk is unused: " + shownText(path) + " holds no number");
        return;
    }
    if (file.text && minutes <= kMostIdleMinutes) {
        evidence.add(Sign::DISK_IN_USE, Source::NOW, "disk in use");
        check(evidence, Verdict::OK, Source::NOW, "disk in use");
        return;
    }
    const std::string text =
        file.text
            ? "disk unused for " + std::to_string(minutes) + " min: no port test until it is used"
            : "no port test once published: " + shownText(path) + " cannot be read";
    check(evidence, file.text ? Verdict::OK : Verdict::PROBLEM, Source::NOW, text);
}

}  // namespace

void lookAtFiles(const DevicePaths& paths, Evidence& evidence) {
    const DeviceSettings settings = readDeviceSettings(paths.staticFile);
    evidence.settings = settings.merged.values;
    evidence.secrets = settings.secrets();
    evidence.unreadSettings = settings.needsRoot ? "the settings need root" : settings.reason;
    evidence.statusWord = shownText(evidence.setting("COMMUNICATION_STATUS"), 20);
    const ProcessTable processes{paths.processes};
    lookAtDaemon(processes, paths.pidFile, evidence);
    lookAtFilesThemselves(settings, evidence);
    if (evidence.hasSettings()) {
        lookAtSettings(evidence);
        lookAtTunnel(processes, evidence);
    }
    lookAtMinutes(paths.minutesFile, evidence);
}

}  // namespace pelorus::doctor
