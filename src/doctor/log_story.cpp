#include "doctor/log_story.h"

#include <algorithm>
#include <charconv>
#include <utility>

#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

constexpr std::string_view kPassed = "the ports passed their test and were published";
constexpr std::string_view kTunnelUp = "the tunnel came up";
constexpr std::string_view kToldToEnd = "the daemon was told to end by a signal";
constexpr std::string_view kFellSilent = "the daemon logged nothing more";
constexpr std::string_view kSilent = "nothing was logged until the daemon started again";

using namespace std::chrono_literals;

// From the first port that passes its test to the record of both.
constexpr auto kPublishTime = 2min;
// A device that is reached directly logs its tests, unless its disk sleeps.
constexpr auto kSilence = 1h;
// Between two cycles, both of which log something.
constexpr auto kLongestPause = 10min;
// Comes before the first line of a start.
constexpr std::string_view kStartRule = "===";

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
const std::vector<Sign> kRelayedSigns{Sign::LOGGED_ATTEMPT, Sign::LOGGED_RELAY_DOES_NOT_COME_UP,
                                      Sign::LOGGED_TUNNEL_NO_OUTPUT, Sign::LOGGED_TUNNEL_DIED};

// What counts even if no result is logged.
constexpr std::array<Sign, 3> kSignsOfTheEnd{Sign::LOGGED_START_FAILED, Sign::LOGGED_END,
                                             Sign::LOGGED_REMOTE_ACCESS_OFF};

// Lines that may still come before the one that says that a change failed.
constexpr std::string_view kTunnel = "VPNManager::";  // of a relay only: direct, it is closed
constexpr std::array<std::string_view, 17> kUndecided{
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

}  // namespace

void LogStory::take(const LogLine& line) {
    const Time when = timeOf(line);
    settleTest(when);
    settlePending(line.text, when);
    if (!firstLine) {
        firstLine = when;
        ended = false;
    }
    takeText(line.text, when);
    lastLine = when;
}

void LogStory::takeText(std::string_view text, Time when) {
    LogValues values;
    const LogRule* const rule = findLogRule(text, values);
    const bool isOfNextRun =
        rule != nullptr ? rule->event == LogEvent::COPY_MISSING : startsWith(text, kStartRule);
    const bool wasAnnounced = std::exchange(announced, false);
    if (rule == nullptr) {
        announced = wasAnnounced && isOfNextRun;
    } else if (rule->event != LogEvent::STARTED || !wasAnnounced) {
        apply(*rule, when, values);
    }
    if (isOfNextRun) return;
    if (!lastOfRun || when - *lastOfRun > kLongestPause) steadySince = when;
    lastOfRun = when;
}

Time LogStory::timeOf(const LogLine& line) {
    const Time when = clock.take(line, since);
    if (clock.correction) correct(*clock.correction);
    return when;
}

void LogStory::correct(const LogClock::Correction& correction) {
    gateway.correct(correction);
    for (std::optional<Time>* const time :
         {&firstLine, &lastLine, &lastOfRun, &steadySince, &since, &passed}) {
        if (*time) *time = correction.of(**time);
    }
    if (pending) pending->since = correction.of(pending->since);
    nextCycle.reset();
    history.correct(correction);
    signs.correct(correction);
}

// What passes a test without being published then was published before.
void LogStory::settleTest(Time when) {
    if (!passed || when - *passed <= kPublishTime) return;
    passed.reset();
    assume(Reach::DIRECT);
}

void LogStory::settlePending(std::string_view text, Time when) {
    if (!pending) return;
    const bool undecided =
        (pending->reach == Reach::RELAYED && startsWith(text, kTunnel)) ||
        std::any_of(kUndecided.begin(), kUndecided.end(),
                    [text](std::string_view beginning) { return startsWith(text, beginning); });
    const bool starts = startsWith(text, "main -") || startsWith(text, kStartRule);
    if (when - pending->since > kAttemptTime || !(undecided || starts)) becomePending();
}

void LogStory::becomePending() {
    const Pending change = *pending;
    pending.reset();
    signs.clear(change.reach == Reach::DIRECT ? kDirectSigns : kRelayedSigns);
    become(change.reach, change.since, std::string{kPassed});
    if (change.reach == Reach::DIRECT) signs.forgetReason();
    if (tornFrom == Reach::UNKNOWN || tornFrom == change.reach) return;
    signs.expectLook(change.since);
    tornFrom = Reach::UNKNOWN;
}

void LogStory::apply(const LogRule& rule, Time when, const LogValues& values) {
    if (rule.severity >= 6) {
        progress = true;
        gateway.seeProgress();
    }
    signs.take(rule, when, values);
    // Without a log option nothing announces the start, and the default holds.
    if (rule.event == LogEvent::STARTED) level = kLeastLevel;
    if (rule.event == LogEvent::ANNOUNCED) {
        std::from_chars(values[0].data(), values[0].data() + values[0].size(), level);
    }
    happen(rule.event, when, values);
}

void LogStory::happen(LogEvent event, Time when, const LogValues& values) {
    gateway.take(event, when, signs);
    switch (event) {
        case LogEvent::IDLE:
            assume(Reach::NOT_REACHED);
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
            takeTestAnswer(values[1], when);
            break;
        case LogEvent::TEST_FAILED:
            signs.failTest(when, gateway.isByHand());
            lose(when);
            break;
        case LogEvent::TEST_RETRIED:
            gateway.takeTestUrl(values[2]);
            break;
        case LogEvent::TEST_UNANSWERED:
            signs.failTestRequest(when);
            break;
        case LogEvent::SERVICE_FAILED:
            signs.failService(when);
            break;
        case LogEvent::PUBLISHED:
            passed.reset();
            pending = {Reach::DIRECT, when};
            break;
        case LogEvent::BACK_END_SAID:
            signs.takeRefusal(values[0], when);
            break;
        default:
            happenInLife(event, when);
            happenInRelay(event, when);
    }
}

void LogStory::happenInLife(LogEvent event, Time when) {
    switch (event) {
        case LogEvent::ANNOUNCED:
            announced = true;
            [[fallthrough]];
        case LogEvent::STARTED:
            start(when);
            break;
        case LogEvent::START_FAILED:
            become(Reach::NOT_RUNNING, when, signs.reasonText());
            end(when);
            break;
        case LogEvent::SIGNALLED:
            signalled = true;
            // A failure to publish would have come before.
            if (isPending(Reach::DIRECT)) becomePending();
            if (!isQuiet()) break;
            become(Reach::NOT_RUNNING, when, std::string{kToldToEnd});
            end(when);
            break;
        case LogEvent::SWITCHED_OFF:
            switchOff(when);
            break;
        case LogEvent::ENDED:
            end(when);
            break;
        case LogEvent::COPY_MISSING:
            // Only a machine that was restarted loses the copy, and with it every tunnel.
            if (history.isAtStart()) orphan = false;
            break;
        default:
            break;
    }
}

void LogStory::happenInRelay(LogEvent event, Time when) {
    switch (event) {
        case LogEvent::PUBLISHING_FAILED:
            signs.failPublishing(isPending(Reach::DIRECT) ? std::optional{pending->since}
                                                          : std::nullopt);
            [[fallthrough]];
        case LogEvent::PORTS_LOST:
            pending.reset();
            if (history.reach() != Reach::RELAYED) lose(when);
            break;
        case LogEvent::NATPMP_REFUSES:
            passed.reset();  // the port of the other service
            break;
        case LogEvent::ADDRESS_LOST:
            tearDown(when);
            break;
        case LogEvent::TUNNEL_DIED:
            if (history.reach() != Reach::RELAYED) break;
            signs.set(Sign::LOGGED_TUNNEL_DIED, when, "the tunnel's client was found dead");
            signs.blame(Sign::LOGGED_TUNNEL_DIED);
            tornDown = true;
            lose(when);
            break;
        case LogEvent::RELAY_STARTS:
            // No tunnel stands, or none is started.
            if (history.reach() != Reach::RELAYED) giveUp(when);
            tornDown = false;
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

void LogStory::tearDown(Time when) {
    const Reach reach = history.reach();
    if (reach == Reach::DIRECT || reach == Reach::RELAYED) tornFrom = reach;
    tornDown = true;
    lose(when);
}

void LogStory::start(Time when) {
    // A failure to publish would have come before; a client may run without a tunnel yet.
    const bool hadClient = isPending(Reach::RELAYED);
    if (isPending(Reach::DIRECT)) becomePending();
    pending.reset();
    if (!ended && lastOfRun) {
        orphan = orphan || hadClient || history.reach() == Reach::RELAYED;
        endSuddenly(when);
    }
    passed.reset();
    signs.forget();
    nextCycle.reset();
    signalled = ended = progress = tornDown = false;
    gateway.start();
    ++startCount;
    since = when;
    become(Reach::NOT_REACHED, when, std::string{kDaemonStarted});
    if (isQuiet()) return;
    signs.set(Sign::LOGGED_ATTEMPT, when, "the daemon started, with no result yet");
}

// Without progress a relayed run is silent for days, unless its searches fail in a way that is logged.
void LogStory::endSuddenly(Time when) {
    const bool isTalkative =
        history.reach() == Reach::DIRECT || *lastOfRun - *steadySince > kSilence;
    const bool isDark = clock.isLost() || when - *lastOfRun > kSilence;
    if (isTalkative && isDark && !progress) {
        history.add({Reach::UNKNOWN, *lastOfRun, "", std::string{kSilent}});
    } else {
        become(Reach::NOT_RUNNING, progress ? *lastOfRun : when, "the daemon ended suddenly");
    }
}

void LogStory::switchOff(Time when) {
    pending.reset();
    if (signalled) {
        become(Reach::NOT_RUNNING, when, std::string{kToldToEnd});
    } else {
        signs.set(Sign::LOGGED_REMOTE_ACCESS_OFF, when,
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
    signs.clear({Sign::LOGGED_ATTEMPT});
    if (signs.has(Sign::LOGGED_START_FAILED)) return;
    signs.set(Sign::LOGGED_END, when, "the daemon ended in an orderly way");
}

void LogStory::endCycle(Time when, std::string_view seconds) {
    int pause = 0;
    std::from_chars(seconds.data(), seconds.data() + seconds.size(), pause);
    pauseBegin = when;
    nextCycle = when + std::chrono::seconds{pause};
    history.explainStart(signs.reasonText());
    history.settle();
    tornDown = false;
    signs.forgetReason();
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
    if (!signs.takeTestAnswer(answer, when)) return;
    gateway.passTest();
    if (!passed) passed = when;
}

// The direct path does not work. A tunnel that stands, or may stand, is not touched by that.
void LogStory::lose(Time when) {
    passed.reset();
    const bool hasTunnel = history.reach() == Reach::RELAYED || history.reach() == Reach::UNKNOWN;
    if (!hasTunnel || tornDown) giveUp(when);
}

void LogStory::giveUp(Time when) {
    history.explainLoss(signs.reasonText());
    become(Reach::NOT_REACHED, when, signs.reasonText());
}

void LogStory::failRelay(Time when) {
    signs.blameRelay();
    lose(when);
    history.explainStart(signs.reasonText());
    history.settle();
}

// A status word, or the number of a connection type.
void LogStory::assumeFrom(std::string_view status) {
    if (status == "portforwarded" || status == "1") assume(Reach::DIRECT);
    if (status == "relayed" || status == "2") assume(Reach::RELAYED);
    if (status == "failed" || status == "connecting") assume(Reach::NOT_REACHED);
}

void LogStory::assume(Reach status) {
    if (!ended) history.assume({status, *firstLine, addressOf(status), ""});
}

void LogStory::become(Reach next, Time when, const std::string& cause) {
    // On its way out it finishes what it had begun.
    const bool isEnd = next == Reach::NOT_RUNNING || next == Reach::SWITCHED_OFF;
    if (ended && !isEnd) return;
    if (isQuiet() && !isEnd) next = Reach::UNKNOWN;
    Period period{next, when, addressOf(next), cause};
    if (next == Reach::RELAYED) {
        const std::string reason = signs.reasonText();
        period.cause = reason.empty() ? kTunnelUp : reason;
    }
    history.add(std::move(period));
}

std::string LogStory::addressOf(Reach reach) const {
    return reach == Reach::DIRECT ? signs.address() : "";
}

// With progress each cycle is logged, and when the next one comes.
void LogStory::endInSilence(const Evidence& evidence) {
    if (!evidence.fromElsewhere || ended || !lastLine) return;
    const Time due = std::max(*lastLine, nextCycle.value_or(*lastLine));
    silent = evidence.now - due > kSilence;
    if (!silent || !progress) return;
    history.add({Reach::UNKNOWN, *lastLine, "", std::string{kFellSilent}});
    signs.forget();
}

void LogStory::finish(Evidence& evidence) {
    if (passed) assume(Reach::DIRECT);
    // A log from elsewhere ends with the record if all went well.
    const bool isDone = evidence.fromElsewhere && isPending(Reach::DIRECT);
    if (pending && (isDone || evidence.now - pending->since > kAttemptTime)) becomePending();
    if (history.isOverdue(evidence.now)) history.explainStart(signs.reasonText());
    endInSilence(evidence);
    const bool isCounted =
        evidence.has(Sign::SECOND_TUNNEL_CLIENT) || evidence.has(Sign::TUNNEL_CLIENT_ALONE);
    if (orphan && history.reach() == Reach::RELAYED && !isCounted) {
        evidence.untold.emplace_back(
            "whether the tunnel of a daemon that ended suddenly still runs beside the new one, "
            "unless the device was restarted: run pelorus-doctor on it, as root");
    }
    evidence.hasLog = firstLine.has_value();
    evidence.hasProgressLines = progress;
    evidence.logBegin = firstLine;
    evidence.logEnd = lastLine;
    if (!evidence.daemon.since) evidence.daemon.since = since;
    // A clock that was set makes nonsense of it.
    const bool pauses = nextCycle && *pauseBegin <= evidence.now && evidence.now <= *nextCycle;
    if (pauses && !evidence.has(Sign::DAEMON_GONE)) evidence.daemon.nextCycle = nextCycle;
    const bool byHand = gateway.isByHand();
    for (const auto& [sign, fact] : signs.lasting(evidence.now, byHand)) {
        const bool isOfEnd = std::count(kSignsOfTheEnd.begin(), kSignsOfTheEnd.end(), sign) != 0;
        if (isOfEnd || !isQuiet()) evidence.signs[sign] = fact;
    }
    const bool isUnset = evidence.fromElsewhere || !evidence.hasSettings();
    if (byHand && isUnset) {
        evidence.add(Sign::MANUAL_MODE, Source::LOG, "the ports are forwarded by hand");
    }
    evidence.history.assign(history.periods().begin(), history.periods().end());
    if (evidence.fromElsewhere) gateway.tellDoubts(evidence);
    if (history.dropped() > 0) {
        evidence.untold.push_back(
            "the history before its last " + std::to_string(evidence.history.size()) +
            " periods: " + std::to_string(history.dropped()) + " more are not kept");
    }
}

}  // namespace pelorus::doctor
