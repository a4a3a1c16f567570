#include "doctor/log_gateway.h"

#include <string>
#include <string_view>

#include "doctor/reach_history.h"

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr std::string_view kAddress = "external_ip=";
constexpr std::string_view kNoUpnp = "no gateway answers UPnP";
// A relayed device searches in every cycle, unless its disk sleeps.
constexpr auto kLongestSearch = 2h;

// What is only found through a gateway.

}  // namespace

void LogGateway::start() {
    *this = LogGateway{ports};
    mayBePublished = false;
}

void LogGateway::take(LogEvent event, Time when, LogSigns& signs) {
    switch (event) {
        case LogEvent::UPNP_SILENT:
            takeSilence(when, signs);
            break;
        case LogEvent::MANUAL:
            ports = Ports::MANUAL;
            break;
        case LogEvent::AUTOMATIC:
            ports = Ports::AUTOMATIC;
            break;
        case LogEvent::NATPMP_REFUSES:
            takeRefusal(when, signs);
            break;
        case LogEvent::NATPMP_FOUND:
            natpmp = true;
            guessed = false;
            break;
        case LogEvent::NATPMP_SILENT:
            natpmp = false;
            signs.failGateway();
            break;
        case LogEvent::TEST_FAILED:
            concludeFromTest(when, signs);
            mayBePublished = false;
            break;
        case LogEvent::TEST_ANSWER:
        case LogEvent::TEST_UNANSWERED:
            concludeFromTest(when, signs);
            break;
        case LogEvent::RELAY_STARTS:
            concludeFromRelay(when, signs);
            break;
        default:
            break;
    }
}

// NAT-PMP, which is tried next, reports success as progress only.
void LogGateway::takeSilence(Time when, LogSigns& signs) {
    lastSilence = when;
    if (retest == Retest::FAILED) retest = Retest::DISCOVERING;
    if (!natpmp && !signs.has(Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS)) {
        signs.set(Sign::LOGGED_NO_GATEWAY, when, std::string{kNoUpnp});
    }
}

void LogGateway::takeRefusal(Time when, LogSigns& signs) {
    signs.clear({Sign::LOGGED_NO_GATEWAY});
    ports = Ports::AUTOMATIC;
    natpmp = true;
    guessed = false;
    if (retest == Retest::DISCOVERING) retest = Retest::SEARCHED;
    lastTest = when;
}

// The search tests no port that a gateway has not mapped. Only one that passed before is tested
// without a gateway, until the relay is used.
void LogGateway::concludeFromTest(Time when, LogSigns& signs) {
    lastTest = when;
    if (retest == Retest::DISCOVERING) retest = Retest::SEARCHED;
    if (retest == Retest::NONE && tested) retest = Retest::FAILED;
    if (progress || tested || isByHand() || !signs.has(Sign::LOGGED_NO_GATEWAY)) return;
    signs.clear({Sign::LOGGED_NO_GATEWAY});
    natpmp = guessed = true;
}

// After a published port fails its test, or is given up, a search follows at once, if there is a
// gateway.
void LogGateway::concludeFromRelay(Time when, LogSigns& signs) {
    const bool isGivenUp = tested && lastSilence && lastTest && *lastSilence > *lastTest;
    const bool isSearchMissing =
        retest == Retest::FAILED || retest == Retest::DISCOVERING || isGivenUp;
    if (isSearchMissing && !isByHand() && natpmp && !progress &&
        !signs.has(Sign::LOGGED_SECOND_NAT)) {
        natpmp = false;
        signs.set(Sign::LOGGED_NO_GATEWAY, when, std::string{kNoUpnp});
        const bool mayBeByHand = guessed && ports != Ports::AUTOMATIC;
        if (!mayBeByHand) signs.blame(Sign::LOGGED_NO_GATEWAY);
    }
    tested = mayBePublished = false;
    retest = Retest::NONE;
}

void LogGateway::passTest() {
    tested = true;
    retest = Retest::NONE;
}

// A published port is tested without an address, too, while no gateway answers.
void LogGateway::takeTestUrl(std::string_view url) {
    const std::size_t begin = url.find(kAddress);
    if (progress || begin == std::string_view::npos) return;
    url.remove_prefix(begin + kAddress.size());
    const bool hasAddress = !url.empty() && url.front() != '&';
    if (hasAddress) ports = Ports::AUTOMATIC;
    if (hasAddress || tested || mayBePublished) return;
    ports = Ports::MANUAL;
    natpmp = natpmp && !guessed;
}

void LogGateway::tellDoubts(Evidence& evidence) const {
    if (isInDoubt(evidence.now)) {
        if (evidence.signs.erase(Sign::LOGGED_TEST_FAILED) == 0) return;
        evidence.untold.emplace_back(
            "whether the gateway still speaks NAT-PMP: UPnP is silent, and no port has been tested "
            "for hours, so there is no gateway any more, or nothing searches for one, as while the "
            "disk sleeps; run the daemon with -l 6");
    } else if (isOriginUnknown() && evidence.signs.erase(Sign::LOGGED_TEST_FAILED) != 0) {
        evidence.untold.emplace_back(
            "why the port test fails: the log does not tell whether the ports are opened through "
            "NAT-PMP, and filtered, or were forwarded by hand; run the daemon with -l 6");
    }
}

// Whether the port that was tested last was opened through NAT-PMP or by hand.
bool LogGateway::isOriginUnknown() const {
    if (progress || !guessed || ports != Ports::UNKNOWN) return false;
    return lastSilence && lastTest && *lastTest - *lastSilence <= kAttemptTime;
}

// Whether the gateway still speaks NAT-PMP.
bool LogGateway::isInDoubt(Time now) const {
    if (progress || !natpmp || isByHand() || !lastSilence || !lastTest) return false;
    return *lastSilence > *lastTest && now - *lastTest > kLongestSearch;
}

void LogGateway::correct(const LogClock::Correction& correction) {
    for (std::optional<Time>* const time : {&lastTest, &lastSilence}) {
        if (*time) *time = correction.of(**time);
    }
}

}  // namespace pelorus::doctor
