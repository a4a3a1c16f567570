// What a log tells of the gateway, also where it does not say so.
#ifndef PELORUS_DOCTOR_LOG_GATEWAY_H
#define PELORUS_DOCTOR_LOG_GATEWAY_H

#include <optional>
#include <string_view>

#include "doctor/evidence.h"
#include "doctor/log_rules.h"
#include "doctor/log_signs.h"

namespace pelorus::doctor {

/// Concludes whether there is a gateway. Without progress in the log, the success of NAT-PMP is not
/// logged, nor whether ports are forwarded by hand.
class LogGateway {
public:
    /// Whether the device's settings have ports that are forwarded by hand.
    enum class Ports { UNKNOWN, AUTOMATIC, MANUAL };

    explicit LogGateway(Ports kind) : ports{kind} {}

    /// A new run of the daemon.
    void start();

    /// A line of severity 6 was logged.
    void seeProgress() { progress = true; }

    /// Takes any event.
    void take(LogEvent event, Time when, LogSigns& signs);

    /// The URL of a port test. The daemon names no address for ports that it has not mapped itself.
    void takeTestUrl(std::string_view url);

    /// A port passed its test.
    void passTest();

    [[nodiscard]] bool isByHand() const { return ports == Ports::MANUAL; }

    /// Takes what may be over, or may have another cause, from the signs of a log from elsewhere, and
    /// says so.
    void tellDoubts(Evidence& evidence) const;

    /// The clock was wrong.
    void correct(const LogClock::Correction& correction);

private:
    // The test of a port that was published, and the search after its failure.
    enum class Retest { NONE, FAILED, DISCOVERING, SEARCHED };

    void takeSilence(Time when, LogSigns& signs);
    void takeRefusal(Time when, LogSigns& signs);
    void concludeFromTest(Time when, LogSigns& signs);
    void concludeFromRelay(Time when, LogSigns& signs);
    [[nodiscard]] bool isOriginUnknown() const;
    [[nodiscard]] bool isInDoubt(Time now) const;

    Ports ports;
    Retest retest = Retest::NONE;
    std::optional<Time> lastTest;     // of a port, or the last attempt to map one
    std::optional<Time> lastSilence;  // of UPnP
    bool progress = false;
    bool natpmp = false;         // the gateway speaks it, as far as the log tells
    bool guessed = false;        // only because a port was tested, maybe one forwarded by hand
    bool tested = false;         // a port passed, and the relay was not used since
    bool mayBePublished = true;  // before the log began, and not tested since
};

}  // namespace pelorus::doctor

#endif
