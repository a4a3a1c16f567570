#include "doctor/tunnel_look.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <optional>
#include <set>
#include <sstream>
#include <utility>

#include "common/files.h"
#include "common/text.h"
#include "doctor/age.h"
#include "doctor/quotations.h"
#include "doctor/shown_text.h"
#include "doctor/write_obstacle.h"

namespace pelorus::doctor {

namespace {

using Verdict = Check::Verdict;

constexpr std::size_t kOutputTail = 64UL * 1024;     // bytes
constexpr std::chrono::minutes kLongestAttempt{10};  // of the daemon to bring up the tunnel
constexpr std::size_t kMostOfLine = 100;             // characters
constexpr std::size_t kTimeStamp = std::string_view{"2026-01-31 23:59:59 "}.size();

constexpr const char* kAsks = "link remote: ";
constexpr const char* kAnswer = "Initial packet from";
constexpr const char* kEnds[] = {"process restarting", "process exiting", "due to fatal error"};

struct Trouble {
    const char* text;
    Sign sign;
};

constexpr Trouble kTroubles[] = {
    {"control message: AUTH_FAILED", Sign::TUNNEL_REFUSED},
    {"Cannot resolve host address:", Sign::RELAY_UNRESOLVED},
    {"VERIFY ERROR", Sign::RELAY_CERTIFICATE_BAD},
    {"VERIFY KU ERROR", Sign::RELAY_CERTIFICATE_BAD},
    {"VERIFY EKU ERROR", Sign::RELAY_CERTIFICATE_BAD},
    {"VERIFY X509NAME ERROR", Sign::RELAY_CERTIFICATE_BAD},
    {"Connection refused", Sign::TUNNEL_UNANSWERED},
    {"Connection timed out", Sign::TUNNEL_UNANSWERED},
    {"TLS key negotiation failed", Sign::TUNNEL_UNANSWERED},
    {"TLS handshake failed", Sign::TUNNEL_UNANSWERED},
    {"Inactivity timeout", Sign::TUNNEL_UNANSWERED},
    {"No route to host", Sign::TUNNEL_UNANSWERED},
    {"Network is unreachable", Sign::TUNNEL_UNANSWERED},
};

std::optional<Sign> troubleIn(const std::string& line) {
    for (const Trouble& trouble : kTroubles) {
        if (contains(line, trouble.text)) return trouble.sign;
    }
    return std::nullopt;
}

bool endsAttempt(const std::string& line) {
    return std::any_of(std::begin(kEnds), std::end(kEnds),
                       [&line](const char* text) { return contains(line, text); });
}

std::string withoutTimeStamp(const std::string& line) {
    const bool isStamped = line.size() > kTimeStamp && line[4] == '-' && line[13] == ':' &&
                           line[kTimeStamp - 1] == ' ';
    return isStamped ? line.substr(kTimeStamp) : line;
}

bool mayNotRead(const ForeignText& file) {
    return !file.text && (file.error == EACCES || file.error == EPERM) && geteuid() != 0;
}

std::string pathIn(const std::string& folder, const std::string& value) {
    if (value.empty() || value.front() == '/') return value;
    return (folder.empty() || folder.back() != '/' ? folder + "/" : folder) + value;
}

// The daemon runs in / and looks for the client there.
std::string pidFileOf(const Evidence& evidence) {
    return pathIn("/", evidence.setting("OPENVPN_PID_FILE"));
}

class TunnelLook {
public:
    TunnelLook(const ProcessTable& table, Evidence& found) : processes{table}, evidence{found} {}

    void run() {
        if (evidence.setting("STARTCMD").empty() && evidence.setting("OPENVPN_PID_FILE").empty()) {
            check(Verdict::NOT_SEEN, "tunnel: no relay is configured", Source::SETTINGS);
            return;
        }
        lookAtClient();
        lookAtOutput();
        lookAtFolders();
    }

private:
    void check(Verdict verdict, std::string text, Source source = Source::NOW) {
        evidence.checks.push_back({verdict, source, std::move(text)});
    }
    void conclude(Sign sign, Verdict verdict, const std::string& text) {
        evidence.add(sign, Source::NOW, text);
        check(verdict, text);
    }

    void lookAtClient() {
        const std::string pidFile = pidFileOf(evidence);
        if (pidFile.empty()) {
            check(Verdict::NOT_SEEN, "tunnel client: OPENVPN_PID_FILE is not set");
            return;
        }
        const ForeignText file = readForeignFile(pidFile);
        if (mayNotRead(file)) {
            check(Verdict::NOT_SEEN, "tunnel client: needs root");
            return;
        }
        const auto pid = readPid(file.text.value_or(""));
        const auto client = pid ? processes.find(*pid) : std::nullopt;
        if (client && isTunnelClient(*client)) {
            conclude(Sign::TUNNEL_RUNS, Verdict::OK, "tunnel client up" + described(*client));
            evidence.tunnelSince = client->since;
            lookForSecond(*client);
        } else if (client && client->path.empty() && geteuid() != 0) {
            check(Verdict::NOT_SEEN, "tunnel client: needs root");
        } else {
            reportNoClient(pidFile, file, pid);
        }
    }

    // A daemon that was killed leaves its client running, and the next one does not know of it.
    void lookForSecond(const Process& client) {
        if (client.workingFolder.empty()) return;
        for (const Process& other : processes.named(client.name)) {
            const bool isPart = other.parent == client.pid || client.parent == other.pid;
            if (other.pid == client.pid || isPart) continue;
            if (other.workingFolder != client.workingFolder) continue;
            if (other.arguments != client.arguments) continue;
            conclude(Sign::SECOND_TUNNEL_CLIENT, Verdict::PROBLEM,
                     "a second tunnel client is up" + described(other));
            return;
        }
        evidence.add(Sign::TUNNEL_CLIENT_ALONE, Source::NOW, "there is one tunnel client");
    }

    // As the daemon tells it: by any part of the path.
    static bool isTunnelClient(const Process& process) {
        const std::string& name = process.path.empty() ? process.name : process.path;
        return strcasestr(name.c_str(), "openvpn") != nullptr;
    }

    [[nodiscard]] std::string described(const Process& client) const {
        const std::string pid = " (pid " + std::to_string(client.pid) + ")";
        return client.since ? " " + ageInWords(evidence.now - *client.since) + pid : pid;
    }

    [[nodiscard]] bool isMissed() const {
        return evidence.statusWord == "relayed" || evidence.statusWord == "failed";
    }

    void reportNoClient(const std::string& pidFile,
                        const ForeignText& file,
                        std::optional<pid_t> pid) {
        if (!isMissed()) {
            check(Verdict::OK, "no tunnel client, none is needed");
        } else if (file.text) {
            const std::string whose =
                pid ? "names " + std::to_string(*pid) + ", which is not one" : "holds no pid";
            conclude(Sign::TUNNEL_GONE, Verdict::PROBLEM,
                     "no tunnel client: " + shownText(pidFile) + " " + whose);
        } else if (evidence.statusWord == "relayed") {
            conclude(Sign::TUNNEL_GONE, Verdict::PROBLEM,
                     "no tunnel client, although the status is relayed");
        } else {
            check(Verdict::PROBLEM, "no tunnel client");
        }
    }

    void lookAtOutput() {
        const std::string output = tunnelFile(evidence, "STARTCMD_OUTFILE");
        if (output.empty()) return;
        const ForeignText file = readForeignFile(output, Part::TAIL);
        if (mayNotRead(file)) check(Verdict::NOT_SEEN, "tunnel client's output: needs root");
        if (!file.text || file.text->empty()) return;
        const std::size_t skipped = file.text->size() - std::min(file.text->size(), kOutputTail);
        const TunnelOutput said =
            readTunnelOutput(file.text->substr(skipped), evidence.setting("LOG_SUCCESS_TEXT"));
        const auto age = ageOf(output);
        const std::string written = age ? " (" + ageInWords(*age) + " ago)" : "";
        if (said.isUp) {
            evidence.add(Sign::TUNNEL_SAYS_UP, Source::NOW, "the tunnel client says that it is up");
            if (evidence.has(Sign::TUNNEL_RUNS)) check(Verdict::OK, "tunnel client says: up");
        } else if (age && isOutdated(*age)) {
            return;
        } else if (said.trouble == Sign::TUNNEL_REFUSED) {
            blame(Sign::TUNNEL_REFUSED, "the relay refuses the device's credentials" + written);
        } else if (said.trouble) {
            blame(*said.trouble, std::string{kNoTunnel} + said.line + written);
        }
    }

    // The output of a tunnel that is not needed any more stays behind.
    void blame(Sign sign, const std::string& text) {
        evidence.add(sign, Source::NOW, text);
        if (evidence.statusWord != "portforwarded") check(Verdict::PROBLEM, text);
    }

    // What an earlier client wrote: the daemon starts another whenever it needs the relay.
    [[nodiscard]] bool isOutdated(std::chrono::seconds age) const {
        if (evidence.daemon.since && evidence.now - age < *evidence.daemon.since) return true;
        return !isMissed() && age > kLongestAttempt;
    }

    // Nothing without the file, or when it is newer than now.
    [[nodiscard]] std::optional<std::chrono::seconds> ageOf(const std::string& file) const {
        struct stat status {};
        if (stat(file.c_str(), &status) != 0) return std::nullopt;
        const auto age = evidence.now - Time{std::chrono::seconds{status.st_mtime}};
        if (age.count() < 0) return std::nullopt;
        return age;
    }

    void lookAtFolders() {
        std::set<std::string> reasons;  // the files are usually in one folder
        for (const std::string& file :
             {tunnelFile(evidence, "OPENVPN_AUTH_FILE"), tunnelFile(evidence, "STARTCMD_OUTFILE"),
              pidFileOf(evidence)}) {
            const std::string reason = file.empty() ? "" : writeObstacle(file);
            if (!reason.empty()) reasons.insert(reason);
        }
        const std::string credentials = credentialsTrouble();
        if (!credentials.empty()) reasons.insert(credentials);
        for (const std::string& reason : reasons) {
            conclude(Sign::TUNNEL_FILES_UNWRITABLE, Verdict::PROBLEM, "tunnel's files: " + reason);
        }
    }

    // A full disk leaves an empty file.
    [[nodiscard]] std::string credentialsTrouble() const {
        const std::string file = tunnelFile(evidence, "OPENVPN_AUTH_FILE");
        struct stat status {};
        if (file.empty() || !isMissed()) return {};
        const int error = stat(file.c_str(), &status) == 0 ? 0 : errno;
        if (error == ENOENT && evidence.statusWord == "relayed") {
            return shownText(file) + " is missing, although the status is relayed";
        }
        if (error != 0 || !S_ISREG(status.st_mode) || status.st_size > 0) return {};
        return shownText(file) + " is empty";
    }

    const ProcessTable& processes;
    Evidence& evidence;
};

}  // namespace

std::string tunnelFile(const Evidence& evidence, const std::string& key) {
    return pathIn(pathIn("/", evidence.setting("OPENVPN_CONFIG_PATH")), evidence.setting(key));
}

TunnelOutput readTunnelOutput(const std::string& output, const std::string& successText) {
    TunnelOutput said;
    bool isWaiting = false;    // for the relay's first packet
    bool isExplained = false;  // what follows in the same attempt is a consequence
    std::istringstream lines{output};
    for (std::string line; std::getline(lines, line);) {
        if (line.find(successText) != std::string::npos) {
            said = {};
            said.isUp = true;
            isExplained = false;
        }
        const auto trouble = troubleIn(line);
        if (trouble && (!isExplained || trouble != Sign::TUNNEL_UNANSWERED)) {
            said.trouble = trouble;
            said.line = shownText(withoutTimeStamp(line), kMostOfLine);
            isExplained = trouble != Sign::TUNNEL_UNANSWERED;
        }
        if (trouble == Sign::TUNNEL_REFUSED) said.isUp = false;
        if (contains(line, kAsks)) isWaiting = true;
        if (contains(line, kAnswer)) isWaiting = false;
        if (!endsAttempt(line)) continue;
        said.isUp = false;
        isExplained = false;
        if (isWaiting && !said.trouble) {
            said.trouble = Sign::TUNNEL_UNANSWERED;
            said.line = "no answer at all";
        }
    }
    return said;
}

void lookAtTunnel(const ProcessTable& processes, Evidence& evidence) {
    TunnelLook{processes, evidence}.run();
}

}  // namespace pelorus::doctor
