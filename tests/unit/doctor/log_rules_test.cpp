#include "doctor/log_rules.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <sstream>

namespace pelorus::doctor {
namespace {

namespace fs = std::filesystem;

// What calls the daemon logs by, with the severity of each.
const std::map<std::string, int> kCalls{
    {"logError(", 3},          {"logWarning(", 4},     {"logNotice(", 5},    {"logInfo(", 6},
    {"logLine(LOG_ALERT,", 1}, {"logConfigError(", 3}, {"logConfigInfo(", 6}};

std::string sources() {
    std::string all;
    for (const auto& entry : fs::recursive_directory_iterator{PELORUS_SOURCES}) {
        const fs::path module = *entry.path().lexically_relative(PELORUS_SOURCES).begin();
        if (entry.path().extension() != ".cpp" || module == "doctor") continue;
        std::ostringstream text;
        text << std::ifstream{entry.path()}.rdbuf();
        all += text.str();
    }
    return all;
}

TEST(LogRules, EachIsALineThatTheDaemonLogsAtThatSeverity) {
    const std::string all = sources();
    for (const LogRule& rule : logRules()) {
        const std::size_t found = all.find('"' + std::string{rule.text});
        ASSERT_NE(found, std::string::npos) << rule.text;
        const std::size_t call = all.find_last_not_of(" \n", found - 1);
        bool named = false;
        for (const auto& [name, severity] : kCalls) {
            if (call + 1 < name.size()) continue;
            if (all.compare(call + 1 - name.size(), name.size(), name) != 0) continue;
            named = true;
            EXPECT_EQ(rule.severity, severity) << rule.text;
        }
        EXPECT_TRUE(named) << rule.text;
    }
}

TEST(LogRules, EachWordKnowsItsValue) {
    for (const LogRule& rule : logRules()) {
        for (std::size_t open = rule.words.find('{'); open != std::string_view::npos;
             open = rule.words.find('{', open + 1)) {
            const std::string_view name =
                rule.words.substr(open + 1, rule.words.find('}', open) - open - 1);
            const bool number = name.size() == 1 && name[0] >= '1' && name[0] <= '8';
            EXPECT_TRUE(number || keptNamed(name) != Kept::NOTHING) << rule.words;
        }
        EXPECT_EQ(rule.set.empty(), rule.words.empty()) << rule.text;
        // What was not logged leaves no gap.
        const std::string_view last = rule.words.substr(rule.words.rfind('|') + 1);
        const std::size_t open = last.find('{');
        EXPECT_TRUE(open == std::string_view::npos || std::isdigit(last[open + 1])) << rule.words;
    }
}

TEST(LogRules, EachIsFoundByItsName) {
    for (const LogRule& rule : logRules()) {
        EXPECT_LT(rule.text.find_first_of(" (["), rule.beginning) << rule.text;
        EXPECT_NE(rule.text.back(), ' ') << "which is taken off a line's end: " << rule.text;
    }
}

TEST(LogRules, FindsValues) {
    LogValues values;
    const LogRule* rule = findLogRule(
        "Router::mapPort() - fail - failed to map external port: 9091, to internal port: 80, "
        "status: -718",
        values);
    ASSERT_NE(rule, nullptr);
    EXPECT_EQ(values[2], "-718");
    rule = findLogRule(
        "ConnectionManager::checkDNS - DNS check failed for 4-level device domain name, DNS IP "
        "address is 203.0.113.9, local value of IP address is 203.0.113.7",
        values);
    ASSERT_NE(rule, nullptr);
    EXPECT_EQ(values[0], "203.0.113.9");
    EXPECT_EQ(values[1], "203.0.113.7");
    rule = findLogRule(
        "TavikClient::testPort - PORT TEST RESPONSE, GOT EXTERNAL IP: [203.0.113.7], start: [100], "
        "end: [111]. ",
        values);
    ASSERT_NE(rule, nullptr);
    EXPECT_EQ(values[0], "203.0.113.7");
    EXPECT_EQ(findLogRule("DaemonControl::run - sleep x secs.", values), nullptr);
    EXPECT_EQ(findLogRule("", values), nullptr);
}

TEST(LogRules, FindsAnAnswerThatHoldsWhatStandsBehindItOrWasCut) {
    const std::string begin = "TavikClient::testPort[1] - httpGet got ";
    const std::string answer = "<p>Sorry, 3 bytes, or so</p>" + std::string(200, 'x');
    for (const char* const end : {", 90 bytes from central server.", ", 90 by", ", 9", ",", ""}) {
        LogValues values;
        const std::string line = begin + answer + end;
        ASSERT_NE(findLogRule(line, values), nullptr) << end;
        EXPECT_EQ(values[1].substr(0, answer.size()), answer) << end;
    }
    LogValues values;
    EXPECT_EQ(findLogRule(begin + "<p>Sorry, no</p>", values), nullptr);
}

}  // namespace
}  // namespace pelorus::doctor
