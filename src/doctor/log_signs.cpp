#include "doctor/log_signs.h"

#include <algorithm>
#include <utility>

#include "doctor/quotations.h"
#include "doctor/reach_history.h"
#include "doctor/shown_text.h"
#include "doctor/text_parts.h"

namespace pelorus::doctor {

namespace {

using namespace std::chrono_literals;

constexpr std::string_view kNoGateway = "no gateway answers UPnP or NAT-PMP";
constexpr std::string_view kMissing = "(not logged)";
// libcurl's words for an answer that was not taken: the line before says why.
constexpr std::string_view kDropped = "Failed writing received data";

// What is no reason why the device is not reached.
constexpr std::array<Sign, 3> kNoReasons{Sign::LOGGED_ATTEMPT, Sign::LOGGED_END,
                                         Sign::LOGGED_PORT_OPENED};
const std::vector<Sign> kServiceSigns{Sign::LOGGED_SERVICE_UNRESOLVED,
                                      Sign::LOGGED_SERVICE_UNREACHABLE, Sign::LOGGED_SERVICE_SILENT,
                                      Sign::LOGGED_SERVICE_CERTIFICATE};
const std::vector<Sign> kRelaySolves{Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS,
                                     Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER,
                                     Sign::LOGGED_SECOND_NAT};

const std::vector<Sign> kRefusals{Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER};
const std::vector<Sign> kBackEndSigns{Sign::LOGGED_BACK_END_SILENT, Sign::LOGGED_BACK_END_REFUSES};

// How the attempts at the direct way end: what a later one ends with holds instead.
const std::vector<Sign> kGatewayOutcomes{
    Sign::LOGGED_NO_ADDRESS, Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS,
    Sign::LOGGED_GATEWAY_REFUSES, Sign::LOGGED_PORT_HELD_BY_OTHER};
const std::vector<Sign> kTestOutcomes{
    Sign::LOGGED_SECOND_NAT,          Sign::LOGGED_TEST_FAILED,       Sign::LOGGED_TEST_UNANSWERED,
    Sign::LOGGED_OTHER_DEVICE,        Sign::LOGGED_PUBLISHING_FAILED, Sign::LOGGED_SERVICE_NONSENSE,
    Sign::LOGGED_MANUAL_PORT_INVALID, Sign::LOGGED_MANUAL_RULED_OUT};

// What is logged anew in every cycle, or in every daily look at the names.
constexpr auto kLongestSearch = 15min;  // at a start, or at the start of a tunnel
constexpr auto kLongestCycle = 2h;
constexpr auto kLongestUntilNames = 25h;
const std::vector<Sign> kEachCycle{Sign::LOGGED_NO_ADDRESS, Sign::LOGGED_NO_GATEWAY,
                                   Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS};
const std::vector<Sign> kEachDay{Sign::LOGGED_NAMES_LEAD_ELSEWHERE, Sign::LOGGED_NAMES_UNRESOLVED};

bool isAmong(const std::vector<Sign>& signs, Sign sign) {
    return std::find(signs.begin(), signs.end(), sign) != signs.end();
}

bool explains(Sign sign) {
    return std::count(kNoReasons.begin(), kNoReasons.end(), sign) == 0;
}

bool isStale(Sign sign, Time when, Time now) {
    return (sign == Sign::LOGGED_ATTEMPT && now - when > kLongestSearch) ||
           (isAmong(kEachCycle, sign) && now - when > kLongestCycle) ||
           (isAmong(kEachDay, sign) && now - when > kLongestUntilNames);
}

// Names that are wrong keep no way closed, and one port is free where another is refused.
bool outweighs(Sign sign, Sign earlier) {
    if (earlier == Sign::LOGGED_PORT_HELD_BY_OTHER) return sign == Sign::LOGGED_GATEWAY_REFUSES;
    return isAmong(kEachDay, earlier) && isOutcome(sign);
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

bool isOutcome(Sign sign) {
    return isAmong(kGatewayOutcomes, sign) || isAmong(kTestOutcomes, sign);
}

void LogSigns::take(const LogRule& rule, Time when, const LogValues& values) {
    if (rule.event == LogEvent::CYCLE) ++cycle;
    if (cycle == 0 && reason && when - reason->when > kAttemptTime) reason.reset();
    concludeBackEnd(rule);
    if (rule.kept != Kept::NOTHING) {
        const std::string_view text = values[rule.keptValue - 1];
        value(rule.kept) = shownText(rule.kept == Kept::PORT ? portOf(text) : text);
    }
    clear(rule.cleared);
    if (rule.exception && isOfAttempt(*rule.exception, when)) return;
    for (const Sign sign : rule.set) set(sign, when, filled(rule.words, values));
}

// Without cycles in the log, attempts are told apart by the time.
bool LogSigns::isOfAttempt(Sign sign, Time when) const {
    if (!has(sign)) return false;
    return cycle > 0 ? cycles.at(sign) == cycle : when - *signs.at(sign).when <= kAttemptTime;
}

// Success is not logged at every severity.
void LogSigns::concludeBackEnd(const LogRule& rule) {
    if (backEndTold && rule.kept == Kept::ERROR) return;
    const bool fails = std::any_of(rule.set.begin(), rule.set.end(),
                                   [](Sign sign) { return isAmong(kBackEndSigns, sign); });
    if (backEndTold && !fails) clear(kBackEndSigns);
    backEndTold = rule.event == LogEvent::PUBLISHED || rule.event == LogEvent::WITHDRAWN;
}

void LogSigns::set(Sign sign, Time when, const std::string& text) {
    cycles[sign] = cycle;
    if (reason && reason->sign == sign && has(sign)) {
        signs[sign].when = when;  // the first of several tells most
        return;
    }
    signs[sign] = {Source::LOG, text, when};
    if (!explains(sign)) return;
    if (!reason || (reason->text.empty() && outweighs(sign, reason->sign))) {
        reason = Reason{sign, when};
    }
}

void LogSigns::clear(const std::vector<Sign>& cleared) {
    for (const Sign sign : cleared) signs.erase(sign);
    if (!reason || has(reason->sign) || !reason->text.empty()) return;
    const Time begin = reason->when;
    reason.reset();
    for (const auto& [sign, fact] : signs) {
        const bool isOfAttempt = cycle > 0 ? cycles.at(sign) == cycle : *fact.when >= begin;
        if (!isOfAttempt || !explains(sign)) continue;
        if (!reason || *fact.when < reason->when) reason = Reason{sign, *fact.when};
    }
}

void LogSigns::forget() {
    signs.clear();
    reason.reset();
    lookExpected.reset();
    cycle = 0;
    backEndTold = false;
}

void LogSigns::correct(const LogClock::Correction& correction) {
    for (auto& [sign, fact] : signs) {
        if (fact.when) fact.when = correction.of(*fact.when);
    }
    if (reason) reason->when = correction.of(reason->when);
    if (lookExpected) lookExpected = correction.of(*lookExpected);
}

// What is tested has been mapped, and the way to the service was there.
bool LogSigns::takeTestAnswer(std::string_view answer, Time when) {
    if (reason && !reason->text.empty()) reason.reset();
    clear(kServiceSigns);
    clear(kRefusals);
    clear({Sign::LOGGED_NO_ADDRESS, Sign::LOGGED_TEST_UNANSWERED, Sign::LOGGED_SERVICE_NONSENSE,
           Sign::LOGGED_SERVICE_WAIT, Sign::LOGGED_TEST_SKIPPED_DISK,
           Sign::LOGGED_CREDENTIALS_MISSING, Sign::LOGGED_MANUAL_PORT_INVALID});
    const std::string asked = shownText(tagged(answer, "external_ip"));
    const std::string seen = shownText(tagged(answer, "remote_external_ip"));
    if (!asked.empty()) value(Kept::TESTED) = asked;
    if (!seen.empty()) value(Kept::SERVICE) = seen;
    if (contains(answer, "Success")) {
        clear({Sign::LOGGED_TEST_FAILED, Sign::LOGGED_SECOND_NAT, Sign::LOGGED_OTHER_DEVICE,
               Sign::LOGGED_GATEWAY_WITHOUT_ADDRESS});
        return true;
    }
    if (!contains(answer, "<status>") && asked.empty() && seen.empty()) {
        set(Sign::LOGGED_SERVICE_NONSENSE, when, std::string{kNotUnderstood} + shownText(answer));
        return false;
    }
    if (!asked.empty()) value(Kept::GATEWAY) = asked;
    if (!asked.empty() && asked == seen) clear({Sign::LOGGED_SECOND_NAT});
    return false;
}

// An answer that stops in the middle was cut off by time.
void LogSigns::takeRefusal(std::string_view answer, Time when) {
    if (!has(Sign::LOGGED_BACK_END_REFUSES)) return;
    if (startsWith(answer, "[")) answer.remove_prefix(1);
    const bool isCut =
        startsWith(answer, "<") && !contains(answer, "</") && !contains(answer, "/>");
    if (!isCut) return;
    set(Sign::LOGGED_BACK_END_REFUSES, when,
        "an answer of the local back end stopped in the middle");
}

void LogSigns::failTest(Time when, bool byHand) {
    if (reason && isAmong(kServiceSigns, reason->sign)) reason->text = reasonText();
    if (!serviceFails() && !has(Sign::LOGGED_SERVICE_NONSENSE) &&
        !has(Sign::LOGGED_TEST_UNANSWERED)) {
        const bool isBeside = byHand && reason && reason->sign == Sign::LOGGED_NO_GATEWAY;
        if (isBeside) reason.reset();
        const std::string& port = value(Kept::PORT);
        set(Sign::LOGGED_TEST_FAILED, when,
            "the service could not reach " + (port.empty() ? "the port" : "port " + port));
        // That a port is opened is logged as progress only.
        if (cycle == 0) set(Sign::LOGGED_PORT_OPENED, when, "a port was opened");
    }
}

void LogSigns::failService(Time when) {
    const std::string error = std::exchange(value(Kept::ERROR), {});
    if (contains(error, kDropped)) return;
    if (contains(error, "resolve")) {
        set(Sign::LOGGED_SERVICE_UNRESOLVED, when, "the service's name does not resolve");
    } else if (contains(error, "certificate") || contains(error, "CA cert")) {
        set(Sign::LOGGED_SERVICE_CERTIFICATE, when, std::string{kNotAccepted} + error);
    } else if (contains(error, "connect to")) {
        set(Sign::LOGGED_SERVICE_UNREACHABLE, when, std::string{kNoConnection} + error);
    } else {
        set(Sign::LOGGED_SERVICE_SILENT, when,
            error.empty() ? std::string{"no answer from the service"}
                          : std::string{kNoAnswer} + error);
    }
}

void LogSigns::failTestRequest(Time when) {
    clear(kRefusals);
    failService(when);
    // Unlike the sign of the service as a whole, this one outlives its other answers.
    if (has(Sign::LOGGED_SERVICE_SILENT)) {
        set(Sign::LOGGED_TEST_UNANSWERED, when, "no answer to the port test");
    }
}

// The service has taken the record: then it is the back end that could not be told.
void LogSigns::failPublishing(std::optional<Time> stored) {
    blame(Sign::LOGGED_PUBLISHING_FAILED);
    const auto silent = signs.find(Sign::LOGGED_BACK_END_SILENT);
    if (silent == signs.end() || !stored) return;
    std::string& text = signs[Sign::LOGGED_PUBLISHING_FAILED].text;
    if (silent->second.when >= *stored && !contains(text, ": ")) {
        text += ": " + silent->second.text;
    }
}

void LogSigns::failGateway() {
    const auto found = signs.find(Sign::LOGGED_NO_GATEWAY);
    if (found != signs.end()) found->second.text = kNoGateway;
}

void LogSigns::blame(Sign sign) {
    const auto found = signs.find(sign);
    if (found != signs.end()) reason = Reason{sign, *found->second.when};
}

void LogSigns::blameRelay() {
    if (!reason || !isAmong(kRelaySolves, reason->sign)) return;
    for (const Sign sign : {Sign::LOGGED_RELAY_DOES_NOT_COME_UP, Sign::LOGGED_TUNNEL_NO_OUTPUT}) {
        blame(sign);
    }
}

std::string LogSigns::reasonText() const {
    if (!reason) return {};
    const auto found = signs.find(reason->sign);
    if (found == signs.end()) return reason->text;
    // Two addresses alone would be a riddle.
    if (reason->sign == Sign::LOGGED_SECOND_NAT) return "a second router: " + found->second.text;
    return found->second.text;
}

std::map<Sign, Fact> LogSigns::lasting(Time now, bool byHand) const {
    std::map<Sign, Fact> left;
    for (const auto& [sign, fact] : signs) {
        if (sign == Sign::LOGGED_PORT_OPENED) continue;
        const bool isOver = isReplaced(sign, byHand) || isStale(sign, *fact.when, now) ||
                            isNameRight(sign, *fact.when, now);
        if (!isOver) left[sign] = fact;
    }
    return left;
}

bool LogSigns::isReplaced(Sign sign, bool byHand) const {
    const auto isLater = [&](Sign other) { return has(other) && isEarlier(sign, other); };
    const bool isReplaceable =
        isOutcome(sign) || isAmong(kServiceSigns, sign) || sign == Sign::LOGGED_TEST_SKIPPED_DISK;
    if (!isReplaceable) return false;
    return std::any_of(kTestOutcomes.begin(), kTestOutcomes.end(), isLater) ||
           (!byHand && std::any_of(kGatewayOutcomes.begin(), kGatewayOutcomes.end(), isLater));
}

// Both are there.
bool LogSigns::isEarlier(Sign sign, Sign later) const {
    if (cycle > 0) return cycles.at(sign) < cycles.at(later);
    return *signs.at(later).when - *signs.at(sign).when > kAttemptTime;
}

// The names have been looked at since, and nothing was logged.
bool LogSigns::isNameRight(Sign sign, Time when, Time now) const {
    return isAmong(kEachDay, sign) && lookExpected && when <= *lookExpected &&
           now - *lookExpected > kLongestSearch;
}

std::string LogSigns::address() const {
    return value(value(Kept::TESTED).empty() ? Kept::GATEWAY : Kept::TESTED);
}

bool LogSigns::serviceFails() const {
    return std::any_of(kServiceSigns.begin(), kServiceSigns.end(),
                       [this](Sign sign) { return has(sign); });
}

std::string LogSigns::filled(std::string_view words, const LogValues& values) const {
    for (;;) {
        const std::size_t end = words.find('|');
        std::string text = filledWording(words.substr(0, end), values);
        if (end == std::string_view::npos || !contains(text, kMissing)) return text;
        words.remove_prefix(end + 1);
    }
}

std::string LogSigns::filledWording(std::string_view words, const LogValues& values) const {
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

}  // namespace pelorus::doctor
