#include "doctor/diagnosis.h"

#include <algorithm>
#include <array>
#include <utility>

namespace pelorus::doctor {

namespace {

// What the log says is over when the other has been seen by now.
constexpr std::array<std::pair<Sign, Sign>, 16> kOver{{
    {Sign::LOGGED_NO_ADDRESS, Sign::HAS_ADDRESS},
    {Sign::LOGGED_SERVICE_UNRESOLVED, Sign::SERVICE_REACHED},
    {Sign::LOGGED_SERVICE_UNREACHABLE, Sign::SERVICE_REACHED},
    {Sign::LOGGED_SERVICE_CERTIFICATE, Sign::SERVICE_REACHED},
    {Sign::LOGGED_NO_GATEWAY, Sign::GATEWAY_FOUND},
    {Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, Sign::GATEWAY_ADDRESS_PUBLIC},
    {Sign::LOGGED_SECOND_NAT, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_OTHER_DEVICE, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_FAILED, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_UNANSWERED, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_UNANSWERED, Sign::PORT_TEST_FAILS},
    {Sign::LOGGED_NAMES_LEAD_ELSEWHERE, Sign::NAMES_RIGHT},
    {Sign::LOGGED_NAMES_UNRESOLVED, Sign::NAMES_RIGHT},
    {Sign::LOGGED_BACK_END_SILENT, Sign::BACK_END_ANSWERS},
    {Sign::LOGGED_TUNNEL_DIED, Sign::TUNNEL_RUNS},
    {Sign::LOGGED_TWO_TUNNELS, Sign::TUNNEL_CLIENT_ALONE},
}};

// Live evidence beats the log, and the reader is told so.
void dropWhatIsOver(Evidence& evidence) {
    for (const auto& [logged, now] : kOver) {
        if (!evidence.has(logged) || !evidence.has(now)) continue;
        const std::string over = "over since the log: " + evidence.signs.at(logged).text +
                                 "; now: " + evidence.signs.at(now).text;
        evidence.signs.erase(logged);
        evidence.checks.push_back({Check::Verdict::OK, Source::NOW, over});
        evidence.add(Sign::CHANGED_SINCE, Source::NOW, over);
    }
    // A run with -u logs the same as a daemon that is switched off.
    if (evidence.setting("ENABLEREMOTEACCESS") == "1") {
        evidence.signs.erase(Sign::LOGGED_REMOTE_ACCESS_OFF);
    }
}

Reach reachOfWord(const std::string& word) {
    if (word == "portforwarded") return Reach::DIRECT;
    if (word == "relayed") return Reach::RELAYED;
    if (word == "failed" || word == "connecting") return Reach::NOT_REACHED;
    return Reach::UNKNOWN;
}

// What the daemon last said, by the settings or by the log.
Reach lastSaid(const Evidence& evidence) {
    const Reach logged = evidence.history.empty() ? Reach::UNKNOWN : evidence.history.back().reach;
    // Without the back end the word in the settings is not kept up to date.
    const bool isOutdated =
        evidence.has(Sign::LOGGED_BACK_END_SILENT) || evidence.has(Sign::LOGGED_BACK_END_REFUSES);
    const Reach word = reachOfWord(evidence.statusWord);
    return word == Reach::UNKNOWN || (isOutdated && logged != Reach::UNKNOWN) ? logged : word;
}

// The service's view of a device that says that it is reached directly. Ports forwarded by hand may
// lead through a second router, too.
bool isDisproved(const Evidence& evidence) {
    if (evidence.has(Sign::PORT_TEST_PASSES)) return false;
    return evidence.has(Sign::PORT_TEST_FAILS) || evidence.has(Sign::OTHER_DEVICE_ANSWERS) ||
           (evidence.has(Sign::SERVICE_SEES_OTHER_ADDRESS) && !evidence.has(Sign::MANUAL_MODE));
}

Reach reachOf(const Evidence& evidence) {
    const bool isOff =
        evidence.has(Sign::REMOTE_ACCESS_OFF) || evidence.has(Sign::LOGGED_REMOTE_ACCESS_OFF);
    const bool ended = evidence.fromElsewhere ? evidence.has(Sign::LOGGED_END) ||
                                                    evidence.has(Sign::LOGGED_START_FAILED)
                                              : evidence.has(Sign::DAEMON_GONE);
    if (ended) return isOff ? Reach::SWITCHED_OFF : Reach::NOT_RUNNING;
    if (evidence.has(Sign::NO_INTERFACE_UP) || evidence.has(Sign::NO_ADDRESS) ||
        evidence.has(Sign::NO_DEFAULT_ROUTE)) {
        return Reach::NOT_REACHED;
    }
    if (evidence.has(Sign::CREDENTIALS_MISSING)) return Reach::NOT_REACHED;
    const Reach said = lastSaid(evidence);
    if (said == Reach::RELAYED && evidence.has(Sign::TUNNEL_GONE)) return Reach::NOT_REACHED;
    if (said == Reach::DIRECT && isDisproved(evidence)) return Reach::NOT_REACHED;
    if (said == Reach::UNKNOWN) {
        if (evidence.has(Sign::TUNNEL_RUNS)) return Reach::RELAYED;
        // Without the settings, that the daemon runs says nothing.
        const bool isKnown = evidence.has(Sign::DAEMON_RUNS) && evidence.hasSettings();
        if (evidence.has(Sign::LOGGED_ATTEMPT) || isKnown) return Reach::NOT_REACHED;
    }
    return said;
}

// What is seen now explains nothing while nothing tells that the device is not reached.
void dropWhatExplainsNothing(std::vector<NamedCause>& causes) {
    const auto isSeenNow = [](const Fact& fact) { return fact.source == Source::NOW; };
    const auto isOnlySeenNow = [&](const NamedCause& named) {
        return std::all_of(named.proofs.begin(), named.proofs.end(), isSeenNow);
    };
    causes.erase(std::remove_if(causes.begin(), causes.end(), isOnlySeenNow), causes.end());
}

void tellSince(const Evidence& evidence, Diagnosis& diagnosis) {
    const auto& history = evidence.history;
    auto last = history.rbegin();
    if (last == history.rend() || last->reach != diagnosis.reach) return;
    while (last + 1 != history.rend() && (last + 1)->reach == diagnosis.reach) ++last;
    diagnosis.since = last->since;
    auto before = last + 1;
    if (before == history.rend()) return;
    // A sudden end of which only the next start tells has no length.
    if (before->since == last->since && before + 1 != history.rend()) ++before;
    diagnosis.before = *before;
}

// What the log does not tell. The client's age is the least that a tunnel can be old.
void tellSinceAtLeast(const Evidence& evidence, Diagnosis& diagnosis) {
    if (diagnosis.before) return;
    diagnosis.isSinceAtLeast = diagnosis.since && diagnosis.since == evidence.logBegin &&
                               evidence.history.front().cause.empty();
    const bool isTunnel = diagnosis.reach == Reach::RELAYED && evidence.has(Sign::TUNNEL_RUNS);
    if (!isTunnel || !evidence.tunnelSince || *evidence.tunnelSince > evidence.now) return;
    if (diagnosis.since && *diagnosis.since <= *evidence.tunnelSince) return;
    diagnosis.since = evidence.tunnelSince;
    diagnosis.isSinceAtLeast = true;
}

void tellAddress(const Evidence& evidence, Diagnosis& diagnosis) {
    if (diagnosis.reach != Reach::DIRECT) return;
    diagnosis.address = evidence.setting("EXTERNAL_IP");
    if (diagnosis.address.empty() && !evidence.history.empty()) {
        diagnosis.address = evidence.history.back().address;
    }
    const std::string http = evidence.setting("EXTERNAL_HTTP_PORT");
    const std::string https = evidence.setting("EXTERNAL_HTTPS_PORT");
    if (!http.empty() && !https.empty()) diagnosis.ports = http + " and " + https;
}

// What the log says last is over, too, where the daemon is gone and did not log its end.
void endHistory(const Evidence& evidence, Diagnosis& diagnosis) {
    const bool isGone = evidence.has(Sign::DAEMON_GONE) && !evidence.fromElsewhere;
    if (isGone || diagnosis.reach == Reach::NOT_RUNNING) diagnosis.daemon.since.reset();
    auto& history = diagnosis.history;
    if (!isGone || history.empty() || !evidence.logEnd) return;
    const Period& last = history.back();
    if (last.reach == Reach::NOT_RUNNING || last.reach == Reach::SWITCHED_OFF) return;
    history.push_back({diagnosis.reach, std::max(*evidence.logEnd, last.since), "",
                       "the log has nothing of the daemon since, and it is gone"});
}

}  // namespace

Diagnosis diagnose(const Evidence& seen) {
    Evidence evidence = seen;
    dropWhatIsOver(evidence);
    Diagnosis diagnosis;
    diagnosis.now = evidence.now;
    diagnosis.fromElsewhere = evidence.fromElsewhere && evidence.hasLog;
    diagnosis.reach = reachOf(evidence);
    tellSince(evidence, diagnosis);
    tellSinceAtLeast(evidence, diagnosis);
    tellAddress(evidence, diagnosis);
    diagnosis.causes = findCauses(evidence, diagnosis.reach);
    if (diagnosis.reach == Reach::UNKNOWN) dropWhatExplainsNothing(diagnosis.causes);
    diagnosis.checks = std::move(evidence.checks);
    diagnosis.history = std::move(evidence.history);
    diagnosis.daemon = std::move(evidence.daemon);
    diagnosis.untold = std::move(evidence.untold);
    endHistory(evidence, diagnosis);
    return diagnosis;
}

int exitStatus(const Diagnosis& diagnosis) {
    switch (diagnosis.reach) {
        case Reach::DIRECT:
            return 0;
        case Reach::RELAYED:
            return 1;
        case Reach::NOT_REACHED:
        case Reach::SWITCHED_OFF:
        case Reach::NOT_RUNNING:
            return 2;
        case Reach::UNKNOWN:
            break;
    }
    return 3;
}

}  // namespace pelorus::doctor
