#include "doctor/text_report.h"

#include <gtest/gtest.h>

#include <sstream>

#include "doctor/lines.h"
#include "made_up_diagnosis.h"

namespace pelorus::doctor {
namespace {

std::vector<std::string> linesOf(const Diagnosis& diagnosis, const Layout& layout) {
    std::vector<std::string> lines;
    std::istringstream text{textReport(diagnosis, layout)};
    for (std::string line; std::getline(text, line);) lines.push_back(line);
    return lines;
}

TEST(TextReport, ReadsLikeANote) {
    EXPECT_EQ(
        textReport(relayed(), {}),
        R"(RELAYED since 12:07 today (3 h 20 min). Before that reached directly on 203.0.113.7, 12 days.

Why    A second router stands in front of your gateway: the gateway says 100.64.3.9; the service
       sees 203.0.113.7 (log, 12:07).
Helps  Put the provider's box into bridge mode.

ok       daemon up 12 days (pid 812), next cycle in 40 s seen now
ok       web server answers on 80 and 443                seen now
PROBLEM  gateway has a shared address                    seen now
not seen copy: not root                                  settings

10 Nov 12:07  direct             12 days     ports forwarded                      log
12:07         direct -> relayed  3 h 20 min  second router found by the port test log
)");
}

TEST(TextReport, ItsHeadlineSaysWhatIsKnown) {
    struct Row {
        Reach reach;
        std::optional<minutes> age;
        bool isElsewhere;
        std::string wanted;
        bool isAtLeast = false;
    };
    const std::string direct = "REACHED DIRECTLY on 203.0.113.7, ports 9091 and 9444";
    const Row rows[]{
        {Reach::DIRECT, minutes{30}, false, direct + ", since 14:57 today (30 min)."},
        {Reach::RELAYED, hours{24}, false, "RELAYED since 15:27 yesterday (1 day)."},
        {Reach::NOT_REACHED, hours{48}, false, "NOT REACHED since 15:27 on 20 Nov (2 days)."},
        {Reach::NOT_RUNNING, hours{24 * 400}, false,
         "NOT RUNNING since 15:27 on 18 Oct 2025 (400 days)."},
        {Reach::SWITCHED_OFF, std::nullopt, false, "SWITCHED OFF, since when could not be told."},
        {Reach::UNKNOWN, std::nullopt, false, "IT COULD NOT BE TOLD how the device is reached."},
        {Reach::RELAYED, minutes{5}, true,
         "RELAYED as of 15:27 yesterday, where the log ends; since 15:22 yesterday (5 min)."},
        {Reach::RELAYED, hours{24}, false, "RELAYED since at least 15:27 yesterday (1 day).", true},
        {Reach::RELAYED, -minutes{5}, false, "RELAYED since 15:32 today (0 s)."}};
    for (const Row& row : rows) {
        Diagnosis diagnosis;
        diagnosis.now = noonish();
        diagnosis.reach = row.reach;
        diagnosis.fromElsewhere = row.isElsewhere;
        diagnosis.address = "203.0.113.7";
        diagnosis.ports = "9091 and 9444";
        diagnosis.isSinceAtLeast = row.isAtLeast;
        if (row.age) diagnosis.since = diagnosis.now - *row.age;
        Layout layout;
        if (row.isElsewhere) layout.today = diagnosis.now + hours{24};
        const auto lines = linesOf(diagnosis, layout);
        EXPECT_EQ(lines.front(), row.wanted);
        const bool isExplained = row.reach != Reach::DIRECT && row.reach != Reach::UNKNOWN;
        EXPECT_EQ(lines.size(), isExplained ? 3U : 1U) << "a healthy device needs no reason";
    }
}

TEST(TextReport, FitsTheTerminal) {
    Diagnosis diagnosis = relayed();
    diagnosis.untold = {"the result of the port test: start the daemon with -l 6"};
    diagnosis.checks.front().text += " " + std::string(250, 'x');
    for (const int width : {1, 40, 41, 57, 80, 120, 200, 1000}) {
        for (const std::string& line : linesOf(diagnosis, {width, false, {}})) {
            EXPECT_LE(letters(line), static_cast<std::size_t>(std::clamp(width, 40, 200))) << line;
        }
    }
    for (int number = 0; number < 60; ++number) {
        diagnosis.checks.push_back({Check::Verdict::OK, Source::NOW, std::to_string(number)});
        diagnosis.history.push_back({Reach::DIRECT, diagnosis.now, "", ""});
    }
    const std::string text = textReport(diagnosis, {});
    EXPECT_LE(std::count(text.begin(), text.end(), '\n'), 40);
    EXPECT_NE(text.find("PROBLEM  gateway has a shared address"), std::string::npos);
    EXPECT_NE(text.find("; 59 "), std::string::npos);
    EXPECT_NE(text.find("(54 earlier"), std::string::npos);
    for (Check& check : diagnosis.checks) check.text += " " + std::string(60, 'x');
    Layout small;
    small.height = 23;
    const auto lines = linesOf(diagnosis, small);
    EXPECT_LE(lines.size(), 23U);
    const std::string hidden = "ok       62 more that are ok: see --json";
    EXPECT_EQ(std::count(lines.begin(), lines.end(), hidden), 1);
}

TEST(TextReport, ColoursOnlyChangeTheLook) {
    std::string text = textReport(relayed(), {100, true, {}});
    EXPECT_EQ(text.rfind("\033[1;33mRELAYED\033[0m since", 0), 0U);
    for (std::size_t at = 0; (at = text.find('\033')) != std::string::npos;) {
        text.erase(at, text.find('m', at) + 1 - at);
    }
    EXPECT_EQ(text, textReport(relayed(), {}));
}

TEST(TextReport, NamesWhatLiesBehindTheCause) {
    const Cause other{"other", {}, {}, {}, "Two things: one of them is odd.", ""};
    Diagnosis diagnosis = relayed();
    for (int number = 0; number < 5; ++number) {
        diagnosis.causes.push_back({&other, {{Source::SETTINGS, "a fact.", {}}}});
    }
    diagnosis.causes[2].proofs.front() = {Source::NOW, "it was cut...", {}};
    const std::string text = textReport(diagnosis, {});
    EXPECT_NE(text.find("Also   Two things: one of them is odd; a fact (settings).\n"),
              std::string::npos)
        << text;
    EXPECT_NE(text.find("is odd; it was cut...\n"), std::string::npos) << text;
    EXPECT_NE(text.find("And    other, other.\n"), std::string::npos);
}

}  // namespace
}  // namespace pelorus::doctor
