#include "doctor/json_report.h"

#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>

#include "common/version.h"
#include "doctor/check_words.h"
#include "doctor/local_time.h"
#include "doctor/reach_words.h"

namespace pelorus::doctor {

namespace {

using Json = nlohmann::ordered_json;

constexpr int kSchema = 1;
constexpr int kIndent = 2;

Json moment(const std::optional<Time>& when) {
    return when ? Json(rfc3339(*when)) : Json(nullptr);
}

Json textOrNull(const std::string& text) {
    return text.empty() ? Json(nullptr) : Json(text);
}

// The numbers in "9091 and 9444".
Json portList(const std::string& ports) {
    Json list = Json::array();
    int port = 0;
    for (const char letter : ports + " ") {
        constexpr int kMost = 65535;
        if (letter >= '0' && letter <= '9') {
            port = std::min(port * 10 + (letter - '0'), kMost);
        } else if (port > 0) {
            list.push_back(std::exchange(port, 0));
        }
    }
    return list;
}

Json periodObject(const Period& period, const std::optional<Time>& until) {
    return {{"reach", wordsFor(period.reach).name},
            {"since", moment(period.since)},
            {"until", moment(until)},
            {"address", textOrNull(period.address)},
            {"cause", textOrNull(period.cause)}};
}

Json causeList(const std::vector<NamedCause>& causes) {
    Json list = Json::array();
    for (const NamedCause& named : causes) {
        Json facts = Json::array();
        for (const Fact& fact : named.proofs) {
            facts.push_back({{"text", fact.text},
                             {"source", wordsFor(fact.source).name},
                             {"when", moment(fact.when)}});
        }
        list.push_back({{"name", named.cause->name},
                        {"sentence", named.cause->sentence},
                        {"remedy", named.cause->remedy},
                        {"facts", std::move(facts)}});
    }
    return list;
}

Json checkList(const std::vector<Check>& checks) {
    Json list = Json::array();
    for (const Check& check : checks) {
        list.push_back({{"verdict", wordsFor(check.verdict).name},
                        {"source", wordsFor(check.source).name},
                        {"text", check.text}});
    }
    return list;
}

Json historyList(const Diagnosis& diagnosis) {
    Json list = Json::array();
    const std::vector<Period>& all = diagnosis.history;
    for (std::size_t index = 0; index < all.size(); ++index) {
        const bool isLast = index + 1 == all.size();
        list.push_back(
            periodObject(all[index], isLast ? std::optional<Time>{} : all[index + 1].since));
    }
    return list;
}

Json daemonObject(const DaemonState& daemon) {
    return {{"pid", daemon.pid > 0 ? Json(daemon.pid) : Json(nullptr)},
            {"since", moment(daemon.since)},
            {"options", textOrNull(daemon.options)},
            {"next_cycle", moment(daemon.nextCycle)}};
}

}  // namespace

std::string jsonReport(const Diagnosis& diagnosis) {
    const Json before =
        diagnosis.before ? periodObject(*diagnosis.before, diagnosis.since) : Json(nullptr);
    const Json report{{"schema", kSchema},
                      {"version", GetPelorusVersion()},
                      {"now", moment(diagnosis.now)},
                      {"from_elsewhere", diagnosis.fromElsewhere},
                      {"exit_status", exitStatus(diagnosis)},
                      {"reach", wordsFor(diagnosis.reach).name},
                      {"address", textOrNull(diagnosis.address)},
                      {"ports", portList(diagnosis.ports)},
                      {"since", moment(diagnosis.since)},
                      {"since_at_least", diagnosis.isSinceAtLeast},
                      {"before", before},
                      {"causes", causeList(diagnosis.causes)},
                      {"checks", checkList(diagnosis.checks)},
                      {"daemon", daemonObject(diagnosis.daemon)},
                      {"untold", diagnosis.untold},
                      {"history", historyList(diagnosis)}};
    return report.dump(kIndent, ' ', false, Json::error_handler_t::replace) + "\n";
}

}  // namespace pelorus::doctor
