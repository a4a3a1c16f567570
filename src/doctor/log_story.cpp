#include "doctor/log_story.h"

#include <algorithm>
#include <charconv>

#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr std::size_t kMostPeriods = 2000;
constexpr auto kAttemptTime = 6min;  // a relay that does not come up takes nearly as long
constexpr auto kShortRun = 1min;     // of a daemon that ends without a result
constexpr std::string_view kStarted = "the daemon started";
constexpr std::string_view kPassed = "the ports passed their test and were published";
constexpr std::string_view kNoGateway = "no gateway answers UPnP or NAT-PMP";
constexpr std::string_view kTunnelUp = "the tunnel came up";
constexpr std::string_view kMissing = "(not logged)";
// libcurl's words for an answer that was not taken: the line before says why.
constexpr std::string_view kDropped = "Failed writing received data";

const std::vector<Sign> kServiceSigns{Sign::LOGGED_SERVICE_UNRESOLVED,
                                      Sign::LOGGED_SERVICE_UNREACHABLE, Sign::LOGGED_SERVICE_SILENT,
                                      Sign::LOGGED_SERVICE_CERTIFICATE};
// What a published port disproves.
const std::vector<Sign> kDirectSigns{Sign::LOGGED_ATTEMPT,
                                     Sign::LOGGED_TEST_FAILED,
                                     Sign::LOGGED_TEST_UNANSWERED,
                                     Sign::LOGGED_SECOND_NAT,
                                     Sign::LOGGED_PUBLISHING_FAILED,
                                     Sign::LOGGED_GATEWAY_REFUSES,
                                     Sign::LOGGED_PORT_HELD_BY_OTHER,
                                     Sign::LOGGED_SERVICE_WAIT,
                                     Sign::LOGGED_CREDENTIALS_MISSING,
                                     Sign::LOGGED_MANUAL_RULED_OUT,
                                     Sign::LOGGED_MANUAL_PORT_INVALID};
const std::vector<Sign> kRelaySolves{Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS,
                                     Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER,
                                     Sign::LOGGED_SECOND_NAT};
const std::vector<Sign> kRelayedSigns{Sign::LOGGED_ATTEMPT, Sign::LOGGED_RELAY_DOES_NOT_COME_UP,
                                      Sign::LOGGED_TUNNEL_NO_OUTPUT, Sign::LOGGED_TUNNEL_DIED};

// Lines that may still come before the one that says that a change failed.
constexpr std::array<std::string_view, 18> kUndecided{
    "VPNManager::",
    "TavikClient::updateLocalCommStatus",
    "TavikClient::updateServerMapping",
    "TavikClient::sendAnalytics",
    "TavikClient::httpGet",
    "TavikClient::getRestUrl",
    "TavikClient curlRcvData",
    "cloudConnectivity",
    "Response:",
    "Reload ",
    "GlobalConfig::",
    "fillTemplate",
    "openForeignFile",
    "sigTrap",
    "DaemonControl::disable",
    "ConnectionManager::createDirectConnection() - failed",
    "ConnectionManager::manualPortForward - failed",
    "ConnectionManager::createRelayConnection() - failed"};

bool startsWith(std::string_view text, std::string_view beginning) {
    return text.compare(0, beginning.size(), beginning) == 0;
}

bool contains(std::string_view text, std::string_view part) {
    return text.find(part) != std::string_view::npos;
}

std::string_view tagged(std::string_view answer, std::string_view tag) {
    const std::string opening = "<" + std::string{tag} + ">";
    const std::string closing = "</" + std::string{tag} + ">";
    const std::size_t begin = answer.find(opening);
    if (begin == std::string_view::npos) return {};
    const std::string_view rest = answer.substr(begin + opening.size());
    const std::size_t end = rest.find(closing);
    return end == std::string_view::npos ? std::string_view{} : rest.substr(0, end);
}

// The number after "port=" in a URL; how the URL is built is a setting.
std::string_view portOf(std::string_view url) {
    const std::size_t begin = url.find("&port=");
    if (begin == std::string_view::npos) return {};
    url.remove_prefix(begin + std::string_view{"&port="}.size());
    return url.substr(0, std::min(url.find_first_not_of("0123456789"), url.size()));
}

}  // namespace

void LogStory::take(const LogLine& line) {
    settlePending(line.text, line.when);
    if (!firstLine) {
        firstLine = line.when;
        ended = false;
    }
    LogValues values;
    const LogRule* const rule = findLogRule(line.text, values);
    const bool wasAnnounced = std::exchange(announced, false);
    if (rule != nullptr) {
        if (rule->event == LogEvent::STARTED && wasAnnounced) {
            lastLine = line.when;
            return;
        }
        apply(*rule, line.when, values);
    } else if (wasAnnounced) {
        announced = startsWith(line.text, "===");
    }
    lastLine = line.when;
}

void LogStory::settlePending(std::string_view text, Time when) {
    if (!pending) return;
    const bool undecided =
        std::any_of(kUndecided.begin(), kUndecided.end(),
                    [text](std::string_view beginning) { return startsWith(text, beginning); });
    const bool starts = startsWith(text, "main -") || startsWith(text, "===");
    if (when - pending->since > kAttemptTime || !(undecided || starts)) becomePending();
}

void LogStory::becomePending() {
    const Pending change = *pending;
    pending.reset();
    clear(change.reach == Reach::DIRECT ? kDirectSigns : kRelayedSigns);
    become(change.reach, change.since, std::string{kPassed});
}

void LogStory::apply(const LogRule& rule, Time when, const LogValues& values) {
    if (rule.severity >= 6) progress = true;
    if (rule.kept != Kept::NOTHING) keep(rule, values[rule.keptValue - 1]);
    clear(rule.cleared);
    if (!rule.exception || signs.count(*rule.exception) == 0) setSigns(rule, when, values);
    happen(rule.event, when, values);
}

void LogStory::keep(const LogRule& rule, std::string_view value) {
    this->value(rule.kept) = shownText(rule.kept == Kept::PORT ? portOf(value) : value);
}

void LogStory::setSigns(const LogRule& rule, Time when, const LogValues& values) {
    for (const Sign sign : rule.set) set(sign, when, filled(rule.words, values));
}

void LogStory::set(Sign sign, Time when, const std::string& text) {
    if (reason == sign && signs.count(sign) != 0) return;  // the first of several tells most
    signs[sign] = {Source::LOG, text, when};
    const bool explains = sign != Sign::LOGGED_ATTEMPT && sign != Sign::LOGGED_TWO_TUNNELS;
    if (!reason && explains) reason = sign;
}

void LogStory::clear(const std::vector<Sign>& cleared) {
    for (const Sign sign : cleared) {
        signs.erase(sign);
        if (reason == sign) reason.reset();
    }
}

void LogStory::happen(LogEvent event, Time when, const LogValues& values) {
    switch (event) {
        case LogEvent::IDLE:
            lose(when);
            break;
        case LogEvent::CYCLE:
            nextCycle.reset();
            break;
        case LogEvent::CYCLE_ENDS:
            endCycle(when, values[0]);
            break;
        case LogEvent::STATUS:
            takeStatus(values[0], when);
            break;
        case LogEvent::STATUS_THERE:
        case LogEvent::TYPE:
            assumeFrom(values[0]);
            break;
        case LogEvent::TEST_ANSWER:
            concludeGateway();
            takeTestAnswer(values[1], when);
            break;
        case LogEvent::TEST_FAILED:
            concludeGateway();
            failTest(when);
            break;
        case LogEvent::TEST_UNANSWERED:
            concludeGateway();
            failService(when);
            // Unlike the sign of the service as a whole, this one outlives its other answers.
            if (signs.count(Sign::LOGGED_SERVICE_SILENT) != 0) {
                set(Sign::LOGGED_TEST_UNANSWERED, when, "no answer to the port test");
            }
            break;
        case LogEvent::SERVICE_FAILED:
            failService(when);
            break;
        case LogEvent::PUBLISHED:
            concludeGateway();
            published = true;
            pending = {Reach::DIRECT, when};
            break;
        case LogEvent::BACK_END_SAID:
            takeRefusal(values[0], when);
            break;
        default:
            happenAtGateway(event, when);
            happenInLife(event, when);
            happenInRelay(event, when);
    }
}

void LogStory::happenAtGateway(LogEvent event, Time when) {
    switch (event) {
        case LogEvent::UPNP_SILENT:
            // NAT-PMP, which is tried next, reports success as progress only.
            if (!natpmp && signs.count(Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS) == 0) {
                set(Sign::LOGGED_NO_GATEWAY, when, "no gateway answers UPnP");
            }
            break;
        case LogEvent::NATPMP_FOUND:
            natpmp = true;
            break;
        case LogEvent::NATPMP_SILENT:
            natpmp = false;
            if (const auto found = signs.find(Sign::LOGGED_NO_GATEWAY); found != signs.end()) {
                found->second.text = kNoGateway;
            }
            break;
        default:
            break;
    }
}

// Without progress NAT-PMP's success is not logged, but nothing is mapped without a gateway, and a
// port that is not mapped is not tested. One that was mapped earlier is tested without a gateway.
void LogStory::concludeGateway() {
    if (progress || published || ports == Ports::MANUAL) return;
    if (signs.count(Sign::LOGGED_NO_GATEWAY) == 0) return;
    clear({Sign::LOGGED_NO_GATEWAY});
    natpmp = true;
}

void LogStory::happenInLife(LogEvent event, Time when) {
    switch (event) {
        case LogEvent::ANNOUNCED:
            start(when);
            announced = true;
            break;
        case LogEvent::STARTED:
            start(when);
            break;
        case LogEvent::START_FAILED:
            become(Reach::NOT_RUNNING, when, reasonText());
            end(when);
            break;
        case LogEvent::SIGNALLED:
            signalled = true;
            // A failure to publish would have come before.
            if (pending && pending->reach == Reach::DIRECT) becomePending();
            break;
        case LogEvent::SWITCHED_OFF:
            switchOff(when);
            break;
        case LogEvent::ENDED:
            end(when);
            break;
        case LogEvent::COPY_MISSING:
            // Only a machine that was restarted loses the copy, and with it every tunnel.
            if (!history.empty() && history.back().cause == kStarted) orphan = false;
            break;
        default:
            break;
    }
}

void LogStory::happenInRelay(LogEvent event, Time when) {
    switch (event) {
        case LogEvent::PUBLISHING_FAILED:
            blameForPublishing();
            [[fallthrough]];
        case LogEvent::PORTS_LOST:
            pending.reset();
            if (reach() != Reach::RELAYED) lose(when);
            break;
        case LogEvent::ADDRESS_LOST:
            tornDown = true;
            lose(when);
            break;
        case LogEvent::TUNNEL_DIED:
            if (reach() != Reach::RELAYED) break;
            set(Sign::LOGGED_TUNNEL_DIED, when, "the tunnel's client was found dead");
            reason = Sign::LOGGED_TUNNEL_DIED;
            tornDown = true;
            lose(when);
            break;
        case LogEvent::RELAY_STARTS:
            if (reach() == Reach::DIRECT) lose(when);
            if (orphan) {
                set(Sign::LOGGED_TWO_TUNNELS, when,
                    "an earlier daemon ended suddenly and left its tunnel running");
            }
            pending = {Reach::RELAYED, when};
            break;
        case LogEvent::RELAY_UP:
            pending = {Reach::RELAYED, when};
            becomePending();
            break;
        case LogEvent::RELAY_FAILED:
            pending.reset();
            tornDown = true;
            failRelay(when);
            break;
        default:
            break;
    }
}

void LogStory::start(Time when) {
    // A failure to publish would have come before; a client may run without a tunnel yet.
    const bool hadClient = pending && pending->reach == Reach::RELAYED;
    if (pending && pending->reach == Reach::DIRECT) becomePending();
    pending.reset();
    if (!ended && lastLine) {
        orphan = orphan || hadClient || reach() == Reach::RELAYED;
        // Without progress it is silent for days.
        become(Reach::NOT_RUNNING, progress ? *lastLine : when, "the daemon ended suddenly");
    }
    signs.clear();
    reason.reset();
    nextCycle.reset();
    signalled = ended = progress = natpmp = published = tornDown = false;
    ++startCount;
    since = when;
    become(Reach::NOT_REACHED, when, std::string{kStarted});
    set(Sign::LOGGED_ATTEMPT, when, "the daemon started, with no result yet");
}

void LogStory::switchOff(Time when) {
    pending.reset();
    if (signalled) {
        become(Reach::NOT_RUNNING, when, "the daemon was told to end by a signal");
    } else {
        set(Sign::LOGGED_REMOTE_ACCESS_OFF, when,
            "the daemon said so as it ended; so does a run with -u");
        become(Reach::SWITCHED_OFF, when,
               "remote access is off in the settings, or this was a run with -u");
        orphan = false;
    }
    end(when);
}

void LogStory::end(Time when) {
    ended = true;
    since.reset();
    nextCycle.reset();
    clear({Sign::LOGGED_ATTEMPT});
    if (signs.count(Sign::LOGGED_START_FAILED) == 0) {
        signs[Sign::LOGGED_END] = {Source::LOG, "the daemon ended in an orderly way", when};
    }
}

void LogStory::endCycle(Time when, std::string_view seconds) {
    int pause = 0;
    std::from_chars(seconds.data(), seconds.data() + seconds.size(), pause);
    pauseBegin = when;
    nextCycle = when + std::chrono::seconds{pause};
    explainStart();
    passing = false;
    tornDown = false;
    reason.reset();
}

void LogStory::takeStatus(std::string_view word, Time when) {
    if (word == "portforwarded") {
        pending = {Reach::DIRECT, when};
        becomePending();
    } else if (word == "relayed") {
        pending = {Reach::RELAYED, when};
        becomePending();
    } else if (word == "failed") {
        pending.reset();
        lose(when);
    }
}

void LogStory::takeTestAnswer(std::string_view answer, Time when) {
    clear(kServiceSigns);
    clear({Sign::LOGGED_TEST_UNANSWERED, Sign::LOGGED_SERVICE_NONSENSE, Sign::LOGGED_SERVICE_WAIT,
           Sign::LOGGED_TEST_SKIPPED_DISK, Sign::LOGGED_CREDENTIALS_MISSING,
           Sign::LOGGED_MANUAL_PORT_INVALID});
    const std::string asked = shownText(tagged(answer, "external_ip"));
    const std::string seen = shownText(tagged(answer, "remote_external_ip"));
    if (!asked.empty()) value(Kept::TESTED) = asked;
    if (!seen.empty()) value(Kept::SERVICE) = seen;
    if (contains(answer, "Success")) {
        clear({Sign::LOGGED_TEST_FAILED, Sign::LOGGED_SECOND_NAT, Sign::LOGGED_OTHER_DEVICE});
        assume(Reach::DIRECT);
        return;
    }
    if (!contains(answer, "<status>") && asked.empty() && seen.empty()) {
        set(Sign::LOGGED_SERVICE_NONSENSE, when,
            "the service's answer to a port test is not understood: " + shownText(answer));
        return;
    }
    if (!asked.empty()) value(Kept::GATEWAY) = asked;
    if (!asked.empty() && asked == seen) clear({Sign::LOGGED_SECOND_NAT});
}

// An answer that stops in the middle was cut off by time.
void LogStory::takeRefusal(std::string_view answer, Time when) {
    if (signs.count(Sign::LOGGED_BACK_END_REFUSES) == 0) return;
    if (startsWith(answer, "[")) answer.remove_prefix(1);
    const bool isCut =
        startsWith(answer, "<") && !contains(answer, "</") && !contains(answer, "/>");
    if (!isCut) return;
    set(Sign::LOGGED_BACK_END_REFUSES, when,
        "an answer of the local back end stopped in the middle");
}

void LogStory::failTest(Time when) {
    if (!serviceFails() && signs.count(Sign::LOGGED_SERVICE_NONSENSE) == 0 &&
        signs.count(Sign::LOGGED_TEST_UNANSWERED) == 0) {
        const std::string& port = value(Kept::PORT);
        set(Sign::LOGGED_TEST_FAILED, when,
            "the service could not reach " + (port.empty() ? "the port" : "port " + port));
    }
    lose(when);
}

void LogStory::failService(Time when) {
    const std::string error = std::exchange(value(Kept::ERROR), {});
    if (contains(error, kDropped)) return;
    if (contains(error, "resolve")) {
        set(Sign::LOGGED_SERVICE_UNRESOLVED, when, "the service's name does not resolve");
    } else if (contains(error, "certificate") || contains(error, "CA cert")) {
        set(Sign::LOGGED_SERVICE_CERTIFICATE, when,
            "the service's certificate is not accepted: " + error);
    } else if (contains(error, "connect to")) {
        set(Sign::LOGGED_SERVICE_UNREACHABLE, when, "no connection to the service: " + error);
    } else {
        set(Sign::LOGGED_SERVICE_SILENT, when,
            "no answer from the service" + (error.empty() ? "" : ": " + error));
    }
}

// The service has taken the record: then it is the back end that could not be told.
void LogStory::blameForPublishing() {
    reason = Sign::LOGGED_PUBLISHING_FAILED;
    const auto silent = signs.find(Sign::LOGGED_BACK_END_SILENT);
    if (silent == signs.end() || !pending || pending->reach != Reach::DIRECT) return;
    std::string& text = signs[Sign::LOGGED_PUBLISHING_FAILED].text;
    if (silent->second.when >= pending->since && !contains(text, ": ")) {
        text += ": " + silent->second.text;
    }
}

// The direct path does not work. A tunnel that stands is not touched by that.
void LogStory::lose(Time when) {
    if (reach() == Reach::RELAYED && !tornDown) return;
    if (reach() == Reach::NOT_REACHED && passing && history.back().cause.empty()) {
        history.back().cause = reasonText();
    }
    become(Reach::NOT_REACHED, when, reasonText());
}

void LogStory::failRelay(Time when) {
    // For what a relay is there for it is the relay that counts.
    if (reason && std::count(kRelaySolves.begin(), kRelaySolves.end(), *reason) != 0) {
        for (const Sign sign :
             {Sign::LOGGED_RELAY_DOES_NOT_COME_UP, Sign::LOGGED_TUNNEL_NO_OUTPUT}) {
            if (signs.count(sign) != 0) reason = sign;
        }
    }
    lose(when);
    explainStart();
    passing = false;
}

// The first cycle of a run ends without a way in.
void LogStory::explainStart() {
    if (passing && reach() == Reach::NOT_REACHED && history.back().cause == kStarted && reason) {
        history.back().cause = reasonText();
    }
}

// A status word, or the number of a connection type.
void LogStory::assumeFrom(std::string_view status) {
    if (status == "portforwarded" || status == "1") assume(Reach::DIRECT);
    if (status == "relayed" || status == "2") assume(Reach::RELAYED);
    if (status == "failed" || status == "connecting") assume(Reach::NOT_REACHED);
}

// How it was when the log began.
void LogStory::assume(Reach status) {
    if (!history.empty()) return;
    become(status, *firstLine, "");
    passing = false;
}

void LogStory::become(Reach next, Time when, const std::string& cause) {
    // On its way out it finishes what it had begun.
    if (ended && next != Reach::NOT_RUNNING && next != Reach::SWITCHED_OFF) return;
    const std::string address =
        next != Reach::DIRECT ? ""
                              : value(value(Kept::TESTED).empty() ? Kept::GATEWAY : Kept::TESTED);
    Period period{next, when, address, cause};
    if (!history.empty()) {
        const Period& last = history.back();
        if (last.reach == next && (last.address == address || address.empty())) return;
        if (last.reach == next && !last.address.empty()) period.cause = "the address changed";
    }
    if (next == Reach::RELAYED) {
        period.cause = reasonText();
        if (period.cause.empty()) period.cause = kTunnelUp;
    }
    if (!history.empty() && isInBetween(next, when)) history.pop_back();
    const bool goesOn = !history.empty() && history.back().reach == next &&
                        history.back().address == period.address;
    if (!goesOn) history.push_back(std::move(period));
    if (history.size() > kMostPeriods) history.pop_front();
    passing = next == Reach::NOT_REACHED;
}

// What lasts only until the next result of the same cycle is part of the change, unless it is all
// that shows that there was one.
bool LogStory::isInBetween(Reach next, Time when) const {
    const Period& last = history.back();
    if (!passing || last.reach != Reach::NOT_REACHED || when - last.since > kAttemptTime) {
        return false;
    }
    if (next != Reach::DIRECT && next != Reach::RELAYED) {
        return last.cause == kStarted && when - last.since <= kShortRun;
    }
    return history.size() == 1 || history[history.size() - 2].reach != next;
}

Reach LogStory::reach() const {
    return history.empty() ? Reach::UNKNOWN : history.back().reach;
}

std::string LogStory::reasonText() const {
    if (!reason) return {};
    const auto found = signs.find(*reason);
    if (found == signs.end()) return {};
    // Two addresses alone would be a riddle.
    if (*reason == Sign::LOGGED_SECOND_NAT) return "a second router: " + found->second.text;
    return found->second.text;
}

bool LogStory::serviceFails() const {
    return std::any_of(kServiceSigns.begin(), kServiceSigns.end(),
                       [this](Sign sign) { return signs.count(sign) != 0; });
}

std::string LogStory::filled(std::string_view words, const LogValues& values) const {
    for (;;) {
        const std::size_t end = words.find('|');
        std::string text = filledWording(words.substr(0, end), values);
        if (end == std::string_view::npos || !contains(text, kMissing)) return text;
        words.remove_prefix(end + 1);
    }
}

std::string LogStory::filledWording(std::string_view words, const LogValues& values) const {
    std::string text;
    for (std::size_t open = words.find('{'); open != std::string_view::npos;
         open = words.find('{')) {
        const std::size_t close = words.find('}', open);
        const std::string_view name = words.substr(open + 1, close - open - 1);
        text.append(words.substr(0, open));
        words.remove_prefix(close + 1);
        const Kept known = keptNamed(name);
        const std::string value =
            known == Kept::NOTHING ? shownText(values[static_cast<std::size_t>(name.front() - '1')])
                                   : kept[static_cast<std::size_t>(known)];
        text.append(value.empty() ? kMissing : value);
    }
    return text.append(words);
}

void LogStory::finish(Evidence& evidence) {
    if (pending && evidence.now - pending->since > kAttemptTime) becomePending();
    if (passing && evidence.now - history.back().since > kAttemptTime) explainStart();
    evidence.hasLog = firstLine.has_value();
    evidence.hasProgressLines = progress;
    evidence.logBegin = firstLine;
    evidence.logEnd = lastLine;
    if (!evidence.daemon.since) evidence.daemon.since = since;
    // A clock that was set makes nonsense of it.
    const bool pauses = nextCycle && *pauseBegin <= evidence.now && evidence.now <= *nextCycle;
    if (pauses && !evidence.has(Sign::DAEMON_GONE)) evidence.daemon.nextCycle = nextCycle;
    for (const auto& [sign, fact] : signs) evidence.signs[sign] = fact;
    evidence.history.assign(history.begin(), history.end());
}

}  // namespace pelorus::doctor
