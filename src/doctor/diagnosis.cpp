#include "doctor/diagnosis.h"

#include <algorithm>
#include <array>
#include <utility>

#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

// What the log says is over when the other has been seen by now.
constexpr std::array<std::pair<Sign, Sign>, 20> kOver{{
    {Sign::LOGGED_CREDENTIALS_MISSING, Sign::HAS_CREDENTIALS},

    {Sign::LOGGED_NO_ADDRESS, Sign::HAS_ADDRESS},
    {Sign::LOGGED_SERVICE_UNRESOLVED, Sign::SERVICE_REACHED},
    {Sign::LOGGED_SERVICE_UNREACHABLE, Sign::SERVICE_REACHED},
    {Sign::LOGGED_SERVICE_CERTIFICATE, Sign::SERVICE_REACHED},
    {Sign::LOGGED_NO_GATEWAY, Sign::GATEWAY_FOUND},
    {Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, Sign::GATEWAY_ADDRESS_PUBLIC},
    {Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, Sign::GATEWAY_ADDRESS_SHARED},
    {Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, Sign::GATEWAY_ADDRESS_PRIVATE},
    {Sign::LOGGED_SECOND_NAT, Sign::SERVICE_SEES_SAME_ADDRESS},
    {Sign::LOGGED_SECOND_NAT, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_OTHER_DEVICE, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_FAILED, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_UNANSWERED, Sign::PORT_TEST_PASSES},
    {Sign::LOGGED_TEST_UNANSWERED, Sign::PORT_TEST_FAILS},
    {Sign::LOGGED_NAMES_LEAD_ELSEWHERE, Sign::NAMES_RIGHT},
    {Sign::LOGGED_NAMES_UNRESOLVED, Sign::NAMES_RIGHT},
    {Sign::LOGGED_BACK_END_SILENT, Sign::BACK_END_ANSWERS},
    {Sign::LOGGED_TUNNEL_DIED, Sign::TUNNEL_RUNS},
}};

void drop(Sign logged, Sign now, Evidence& evidence) {
    const std::string over = "over since the log: " + evidence.signs.at(logged).text +
                             "; now: " + evidence.signs.at(now).text;
    evidence.signs.erase(logged);
    evidence.checks.push_back({Check::Verdict::OK, Source::NOW, over});
    evidence.add(Sign::CHANGED_SINCE, Source::NOW, over);
}

// The gateway now has the address that the service saw when it was another one.
bool isSecondNatOver(const Evidence& evidence) {
    if (!evidence.has(Sign::LOGGED_SECOND_NAT) || !evidence.has(Sign::GATEWAY_ADDRESS_PUBLIC)) {
        return false;
    }
    const std::string& text = evidence.signs.at(Sign::LOGGED_SECOND_NAT).text;
    return endsWith(text, "the service sees " + evidence.gatewayAddress);
}

// A gateway that says 0.0.0.0 differs from what the service sees without a second router, too.
void dropWhatIsNoSecondNat(Evidence& evidence) {
    const auto found = evidence.signs.find(Sign::LOGGED_SECOND_NAT);
    if (found == evidence.signs.end() || evidence.has(Sign::MANUAL_MODE)) return;
    if (!startsWith(found->second.text, "the gateway says 0.0.0.0,")) return;
    evidence.signs[Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS] = found->second;
    evidence.signs.erase(found);
}

// Live evidence beats the log, and the reader is told so.
void dropWhatIsOver(Evidence& evidence) {
    for (const auto& [logged, now] : kOver) {
        if (evidence.has(logged) && evidence.has(now)) drop(logged, now, evidence);
    }
    // A disk that was used a minute ago may be in standby all the same.
    if (evidence.has(Sign::LOGGED_TEST_SKIPPED_DISK) && evidence.has(Sign::DISK_IN_USE) &&
        evidence.has(Sign::DISK_ACTIVE)) {
        drop(Sign::LOGGED_TEST_SKIPPED_DISK, Sign::DISK_ACTIVE, evidence);
    }
    if (isSecondNatOver(evidence)) {
        drop(Sign::LOGGED_SECOND_NAT, Sign::GATEWAY_ADDRESS_PUBLIC, evidence);
    }
    // The usual table of routes need not be the only one.
    if (evidence.has(Sign::SERVICE_REACHED)) evidence.signs.erase(Sign::NO_DEFAULT_ROUTE);
    // A run with -u logs the same as a daemon that is switched off.
    if (evidence.setting("ENABLEREMOTEACCESS") == "1") {
        evidence.signs.erase(Sign::LOGGED_REMOTE_ACCESS_OFF);
    }
}

// The daemon notices a new address when it asks the gateway again. What another device tells that
// answers as a gateway need not matter.
void compareAddresses(Evidence& evidence) {
    const std::string published = evidence.setting("EXTERNAL_IP");
    const bool isAutomatic = !evidence.has(Sign::MANUAL_MODE) && !evidence.has(Sign::OWN_ROUTER);
    if (evidence.statusWord != "portforwarded" || !isAutomatic || published.empty()) return;
    if (!evidence.has(Sign::GATEWAY_ADDRESS_PUBLIC) || evidence.has(Sign::GATEWAY_ELSEWHERE))
        return;
    if (published == evidence.gatewayAddress) return;
    const std::string text =
        "published at " + published + ", but the gateway's address is " + evidence.gatewayAddress;
    evidence.add(Sign::GATEWAY_ADDRESS_CHANGED, Source::NOW, text);
    evidence.checks.push_back({Check::Verdict::PROBLEM, Source::NOW, text});
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
    const Reach word = reachOfWord(evidence.statusWord);
    const bool isTrue = word == Reach::RELAYED && evidence.has(Sign::TUNNEL_RUNS) &&
                        evidence.has(Sign::TUNNEL_SAYS_UP);
    // Without the back end the word in the settings is not kept up to date.
    const bool isOutdated = !isTrue && (evidence.has(Sign::LOGGED_BACK_END_SILENT) ||
                                        evidence.has(Sign::LOGGED_BACK_END_REFUSES));
    return word == Reach::UNKNOWN || (isOutdated && logged != Reach::UNKNOWN) ? logged : word;
}

bool isOffline(const Evidence& evidence) {
    return evidence.has(Sign::SERVICE_UNRESOLVED) || evidence.has(Sign::SERVICE_UNREACHABLE);
}

// A gateway that only fails to answer still forwards, and the service may be down for everybody.
bool isLineDown(const Evidence& evidence) {
    if (isOffline(evidence) && evidence.has(Sign::GATEWAY_WITHOUT_ADDRESS)) return true;
    return evidence.has(Sign::NO_GATEWAY_ANSWERS) && evidence.has(Sign::SERVICE_UNRESOLVED);
}

bool isGatewayOff(const Evidence& evidence) {
    return isOffline(evidence) && evidence.has(Sign::GATEWAY_SILENT);
}

// What is seen now of a device that says that it is reached directly. Ports forwarded by hand may
// lead through a second router, and to other ports; only the settings tell whether there are any.
bool isDisproved(const Evidence& evidence) {
    if (evidence.has(Sign::PORT_TEST_PASSES)) return false;
    if (evidence.has(Sign::PORT_TEST_FAILS) || evidence.has(Sign::OTHER_DEVICE_ANSWERS) ||
        isGatewayOff(evidence)) {
        return true;
    }
    if (evidence.has(Sign::MANUAL_MODE) || !evidence.hasSettings()) return false;
    if (evidence.has(Sign::NO_WEB_SERVER)) return true;
    if (evidence.has(Sign::OWN_ROUTER)) return false;
    const bool isBehindAnother =
        evidence.has(Sign::GATEWAY_ADDRESS_SHARED) || evidence.has(Sign::GATEWAY_ADDRESS_PRIVATE);
    if (isBehindAnother && !evidence.has(Sign::GATEWAY_ELSEWHERE)) return true;
    return isLineDown(evidence) || evidence.has(Sign::SERVICE_SEES_OTHER_ADDRESS) ||
           evidence.has(Sign::GATEWAY_ADDRESS_CHANGED) || evidence.has(Sign::NO_PORT_MAPPED);
}

// Trouble that the client gets over leaves the interface up. Only both together are proof.
bool isTunnelLost(const Evidence& evidence) {
    if (evidence.has(Sign::TUNNEL_GONE)) return true;
    if (!evidence.has(Sign::NO_TUNNEL_INTERFACE) || evidence.has(Sign::TUNNEL_SAYS_UP))
        return false;
    constexpr std::array kTroubles{Sign::TUNNEL_REFUSED, Sign::TUNNEL_UNANSWERED,
                                   Sign::RELAY_UNRESOLVED, Sign::RELAY_CERTIFICATE_BAD};
    return std::any_of(kTroubles.begin(), kTroubles.end(),
                       [&](Sign sign) { return evidence.has(sign); });
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
    if (said == Reach::RELAYED && isTunnelLost(evidence)) return Reach::NOT_REACHED;
    if (said == Reach::DIRECT && isDisproved(evidence)) return Reach::NOT_REACHED;
    if (said == Reach::UNKNOWN) {
        if (evidence.has(Sign::TUNNEL_RUNS)) return Reach::RELAYED;
        // Without the settings, that the daemon runs says nothing.
        const bool isKnown = evidence.has(Sign::DAEMON_RUNS) && evidence.hasSettings();
        if (evidence.has(Sign::LOGGED_ATTEMPT) || isKnown) return Reach::NOT_REACHED;
    }
    return said;
}

// The daemon of a device that was reached directly until now has not asked for the relay yet.
void dropWhatIsNotNeeded(Evidence& evidence) {
    if (lastSaid(evidence) != Reach::DIRECT) return;
    for (const Sign sign :
         {Sign::RELAY_CLIENT_MISSING, Sign::TUNNEL_DEVICE_MISSING, Sign::TUNNEL_FILES_UNWRITABLE,
          Sign::TUNNEL_REFUSED, Sign::TUNNEL_UNANSWERED, Sign::RELAY_UNRESOLVED,
          Sign::RELAY_CERTIFICATE_BAD}) {
        evidence.signs.erase(sign);
    }
}

// A gateway that leads to the internet has an address there.
void dropWhatIsHidden(Reach reach, Evidence& evidence) {
    const bool isOnline =
        evidence.has(Sign::SERVICE_REACHED) || (reach == Reach::RELAYED && !isOffline(evidence));
    if (!isOnline || evidence.has(Sign::OWN_ROUTER)) return;
    for (const Sign sign : {Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS, Sign::GATEWAY_WITHOUT_ADDRESS}) {
        if (!evidence.has(sign)) continue;
        evidence.signs[Sign::GATEWAY_HIDES_ADDRESS] = evidence.signs.at(sign);
        evidence.signs.erase(sign);
    }
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
    const Period last = history.back();
    if (last.reach == Reach::NOT_RUNNING || last.reach == Reach::SWITCHED_OFF) return;
    // When it ended is not known: the headline has no time.
    diagnosis.before = last;
    history.push_back({diagnosis.reach, std::max(*evidence.logEnd, last.since), "",
                       "the log has nothing of the daemon since, and it is gone"});
}

}  // namespace

Diagnosis diagnose(const Evidence& seen) {
    Evidence evidence = seen;
    dropWhatIsNoSecondNat(evidence);
    dropWhatIsOver(evidence);
    compareAddresses(evidence);
    Diagnosis diagnosis;
    diagnosis.now = evidence.now;
    diagnosis.fromElsewhere = evidence.fromElsewhere && evidence.hasLog;
    diagnosis.reach = reachOf(evidence);
    tellSince(evidence, diagnosis);
    tellSinceAtLeast(evidence, diagnosis);
    tellAddress(evidence, diagnosis);
    dropWhatIsNotNeeded(evidence);
    dropWhatIsHidden(diagnosis.reach, evidence);
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
