// What the lines of the daemon's log mean: one table.
#ifndef PELORUS_DOCTOR_LOG_RULES_H
#define PELORUS_DOCTOR_LOG_RULES_H

#include <array>
#include <cstddef>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "doctor/sign.h"

namespace pelorus::doctor {

/// What a line does to the story beyond setting and clearing signs.
enum class LogEvent {
    NOTHING,
    ANNOUNCED,     ///< the first line of a start; value 1: the severity up to which it logs
    STARTED,       ///< the daemon's process is there
    START_FAILED,  ///< and ends
    SIGNALLED,     ///< told to end by a signal
    SWITCHED_OFF,  ///< remote access goes off, by a signal or by the settings
    ENDED,         ///< the orderly end
    IDLE,          ///< a cycle without credentials
    CYCLE,         ///< a cycle begins
    CYCLE_ENDS,    ///< value 1: seconds until the next one
    STATUS,        ///< value 1: the status word that is reported
    STATUS_THERE,  ///< value 1: the status word that was reported earlier
    TYPE,          ///< value 1: number of the connection type that a cycle ended with
    MANUAL,        ///< the ports are forwarded by hand
    AUTOMATIC,     ///< the ports are mapped by the daemon
    TEST_ANSWER,   ///< value 2: the service's answer to a port test
    TEST_FAILED,   ///< the port test as a whole
    TEST_RETRIED,  ///< value 3: the URL of a port test without success
    TEST_UNANSWERED,
    SERVICE_FAILED,  ///< a request to the service got no answer
    PUBLISHED,       ///< the service has the record; the back end is told next
    PUBLISHING_FAILED,
    WITHDRAWN,      ///< the service has dropped the record; the back end is told next
    BACK_END_SAID,  ///< value 1: the answer with which it refused something
    UPNP_SILENT,
    NATPMP_FOUND,
    NATPMP_SILENT,
    NATPMP_REFUSES,
    PORTS_LOST,    ///< the direct path is given up
    ADDRESS_LOST,  ///< no way in is left: the names, or the router's address
    COPY_MISSING,  ///< the machine was restarted, if this comes first in a start
    RELAY_STARTS,
    RELAY_UP,
    RELAY_FAILED,
    TUNNEL_DIED,
};

/// A value that later lines need.
enum class Kept { NOTHING, GATEWAY, SERVICE, TESTED, PORT, ERROR, WAIT, FILE, COUNT };

/// The one that is called @p name in a rule's words: "gateway" for GATEWAY. NOTHING if none is.
Kept keptNamed(std::string_view name);

/// A line of interest, and what it tells.
struct LogRule {
    int severity{};  ///< as syslog counts
    /// As in the source, conversions included; the end of the line may be missing.
    std::string_view text;
    std::size_t beginning{};  ///< bytes of it before the first conversion
    LogEvent event = LogEvent::NOTHING;
    std::vector<Sign> set{};
    std::vector<Sign> cleared{};
    /// The fact's text: "{2}" stands for the second value, "{gateway}" for a kept one. Wordings
    /// are separated by "|": the first counts of which no value is empty, else the last.
    std::string_view words{};
    Kept kept = Kept::NOTHING;
    std::size_t keptValue = 1;        ///< which one is kept, counted from 1
    std::optional<Sign> exception{};  ///< nothing is set while this sign is there
    /// The rule fits only if this value, counted from 1, is this text. 0: always.
    std::pair<std::size_t, std::string_view> condition{};

    LogRule& happens(LogEvent what);
    LogRule& sets(Sign sign, std::string_view fact);
    LogRule& clears(std::vector<Sign> signs);
    LogRule& keeps(Kept what, std::size_t value = 1);
    LogRule& unless(Sign sign);
    LogRule& onlyIf(std::size_t value, std::string_view is);
};

/// The values of a line, in the order of the conversions; the rest is empty.
using LogValues = std::array<std::string_view, 8>;

/// The table. The first row that fits a line counts.
const std::vector<LogRule>& logRules();

/// The rule for @p text, a line's text without stamp and name; null when it says nothing. Fills
/// @p values with parts of @p text.
const LogRule* findLogRule(std::string_view text, LogValues& values);

}  // namespace pelorus::doctor

#endif
