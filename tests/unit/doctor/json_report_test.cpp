#include "doctor/json_report.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "made_up_diagnosis.h"

namespace pelorus::doctor {
namespace {

using nlohmann::json;

TEST(JsonReport, HasEverything) {
    Diagnosis diagnosis = relayed();
    diagnosis.ports = "9091 and 9444";
    diagnosis.untold = {"one", "two"};
    json report = json::parse(jsonReport(diagnosis));
    EXPECT_FALSE(report.at("version").get<std::string>().empty());
    report.erase("version");
    report.erase("exit_status");
    EXPECT_EQ(report, json::parse(R"json({
        "schema": 1, "now": "2026-11-22T15:27:00+00:00", "from_elsewhere": false,
        "reach": "relayed", "address": null, "ports": [9091, 9444],
        "since": "2026-11-22T12:07:00+00:00", "since_at_least": false,
        "before": {"reach": "direct", "since": "2026-11-10T12:07:00+00:00",
                   "until": "2026-11-22T12:07:00+00:00", "address": "203.0.113.7",
                   "cause": "ports forwarded"},
        "causes": [{"name": "second-nat",
                    "sentence": "A second router stands in front of your gateway.",
                    "remedy": "Put the provider's box into bridge mode.",
                    "facts": [{"text": "the gateway says 100.64.3.9", "source": "now", "when": null},
                              {"text": "the service sees 203.0.113.7", "source": "log",
                               "when": "2026-11-22T12:07:00+00:00"}]}],
        "checks": [{"verdict": "ok", "source": "now", "text": "daemon up 12 days (pid 812)"},
                   {"verdict": "ok", "source": "now", "text": "web server answers on 80 and 443"},
                   {"verdict": "problem", "source": "now", "text": "gateway has a shared address"},
                   {"verdict": "not-seen", "source": "settings", "text": "copy: not root"}],
        "daemon": {"pid": 812, "since": "2026-11-10T15:27:00+00:00", "options": "-l 6 -f 120",
                   "next_cycle": "2026-11-22T15:27:40+00:00"},
        "untold": ["one", "two"],
        "history": [{"reach": "direct", "since": "2026-11-10T12:07:00+00:00",
                     "until": "2026-11-22T12:07:00+00:00", "address": "203.0.113.7",
                     "cause": "ports forwarded"},
                    {"reach": "relayed", "since": "2026-11-22T12:07:00+00:00", "until": null,
                     "address": null, "cause": "second router found by the port test"}]})json"));
}

TEST(JsonReport, AnyBytesMakeValidJson) {
    Diagnosis diagnosis = relayed();
    diagnosis.ports = "99999999999999, none";
    diagnosis.checks.front().text = "\xFF\"\n\\\x01";
    const json report = json::parse(jsonReport(diagnosis));
    EXPECT_EQ(report.at("checks").at(0).at("text"), "\xEF\xBF\xBD\"\n\\\x01");
    EXPECT_EQ(report.at("ports"), json::array({65535}));
}

TEST(JsonReport, TimesHaveTheOffsetOfTheirDay) {
    Diagnosis diagnosis = relayed();
    diagnosis.since = diagnosis.now - hours{24 * 120};
    setenv("TZ", "EST5EDT,M3.2.0,M11.1.0", 1);
    tzset();
    const json report = json::parse(jsonReport(diagnosis));
    EXPECT_EQ(report.at("now"), "2026-11-22T10:27:00-05:00");
    EXPECT_EQ(report.at("since"), "2026-07-25T11:27:00-04:00");
}

}  // namespace
}  // namespace pelorus::doctor
