// What the doctor has found out about a device, before anything is concluded from it.
#ifndef PELORUS_DOCTOR_EVIDENCE_H
#define PELORUS_DOCTOR_EVIDENCE_H

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "doctor/sign.h"

namespace pelorus::doctor {

/// A moment of the device's own clock; whole seconds are enough everywhere.
using Time = std::chrono::time_point<std::chrono::system_clock, std::chrono::seconds>;

/// Where a fact was seen.
enum class Source { NOW, LOG, SETTINGS };

/// How the device is reached from the internet.
enum class Reach {
    DIRECT,
    RELAYED,
    NOT_REACHED,
    SWITCHED_OFF,
    NOT_RUNNING,
    UNKNOWN,
};

/// One sign that was seen.
struct Fact {
    Source source{};
    std::string text;          ///< in a few words, with its values, for people; no secret in it
    std::optional<Time> when;  ///< when it was logged; unset for everything else
};

/// A line of what was checked.
struct Check {
    enum class Verdict { OK, PROBLEM, NOT_SEEN };
    Verdict verdict{};
    Source source{};
    std::string text;  ///< of NOT_SEEN: with the reason
};

/// A stretch of time in which the device was reached in one way.
struct Period {
    Reach reach{};
    Time since{};
    std::string address{};  ///< the published one; empty if unknown or not direct
    std::string cause{};    ///< a sentence without full stop: why it began; empty if not known
};

/// The daemon's process, or what is known about it from the log.
struct DaemonState {
    pid_t pid{};                      ///< 0 if it does not run, or is not known
    std::optional<Time> since{};      ///< its start
    std::string options{};            ///< "-l 6 -f 120"; empty if not known
    std::optional<Time> nextCycle{};  ///< end of the pause it is in
};

/// How the check of a running daemon begins; the note for people adds the next cycle to it.
inline constexpr std::string_view kDaemonUp = "daemon up";

/// Everything found. Each looker adds to it; none reads what another one added, except settings.
struct Evidence {
    Time now{};                                   ///< of a log from elsewhere: its last line
    bool fromElsewhere = false;                   ///< only a log of another device was looked at
    bool hasLog = false;                          ///< at least one line of the daemon was read
    bool hasProgressLines = false;                ///< the log includes severity 6
    std::optional<Time> logBegin{}, logEnd{};     ///< first and last line of the daemon
    std::set<std::string> logHosts{};             ///< that logged the daemon's lines; 1000 at most
    std::map<std::string, std::string> settings;  ///< as the daemon merges them; has secrets
    std::multimap<std::string, std::string> secrets{};  ///< all that the files hold, old ones too
    std::string unreadSettings{};  ///< why a file was not read: "the settings need root"
    std::string statusWord{};      ///< COMMUNICATION_STATUS of the settings
    DaemonState daemon{};
    std::optional<Time> tunnelSince{};  ///< start of the tunnel client that runs
    std::string gatewayAddress{};       ///< external, as the gateway says now; empty if not known
    std::map<Sign, Fact> signs;
    std::vector<Check> checks;
    std::vector<Period> history;      ///< oldest first
    std::vector<std::string> untold;  ///< what could not be told, and how to get it

    [[nodiscard]] bool has(Sign sign) const { return signs.count(sign) != 0; }

    void add(Sign sign, Source source, std::string text, std::optional<Time> when = {}) {
        signs[sign] = {source, std::move(text), when};
    }

    /// True when both files were read. Otherwise any value may be missing or overridden.
    [[nodiscard]] bool hasSettings() const { return unreadSettings.empty(); }

    /// The value of @p key, empty when it is absent or not known for certain.
    [[nodiscard]] std::string setting(const std::string& key) const {
        if (!hasSettings()) return {};
        const auto found = settings.find(key);
        return found == settings.end() ? std::string{} : found->second;
    }
};

}  // namespace pelorus::doctor

#endif
