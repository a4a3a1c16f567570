#include "doctor/side_by_side.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <stdexcept>
#include <string>

namespace pelorus::doctor {

namespace {

constexpr std::chrono::milliseconds kLimit{400};

void hang(Findings& /*findings*/) {
    while (true) pause();
}

void find(Findings& findings) {
    findings.add(Sign::GATEWAY_FOUND, "gateway");
    findings.ok("a check");
    findings.set("address", "44.128.0.20");
}

// The descriptor of the pipe is the one that is no standard file.
void writeToPipe(const std::string& text) {
    for (int descriptor = 3; descriptor < 64; ++descriptor) {
        static_cast<void>(!write(descriptor, text.data(), text.size()));
    }
}

struct Ending {
    std::string name;
    Probe probe;
    bool keepsFindings;
};

class FailingProbe : public ::testing::TestWithParam<Ending> {};

TEST_P(FailingProbe, LeavesTheOthersTheirFindings) {
    const auto began = std::chrono::steady_clock::now();
    const auto found = runSideBySide({GetParam().probe, find}, kLimit);
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(5));
    ASSERT_EQ(found.size(), 2U);
    EXPECT_FALSE(found[0].finished());
    EXPECT_EQ(found[0].has(Sign::BACK_END_ANSWERS), GetParam().keepsFindings);
    EXPECT_TRUE(found[1].finished());
    EXPECT_TRUE(found[1].has(Sign::GATEWAY_FOUND));
    EXPECT_EQ(found[1].checks().at(0).text, "a check");
    EXPECT_EQ(found[1].value("address"), "44.128.0.20");
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), -1);
    EXPECT_EQ(errno, ECHILD);
}

const Ending kEndings[] = {
    {"Hangs", hang, false},
    {"HangsAfterAFinding",
     [](Findings& findings) {
         findings.add(Sign::BACK_END_ANSWERS, "");
         hang(findings);
     },
     true},
    {"IgnoresSignals",
     [](Findings& findings) {
         signal(SIGTERM, SIG_IGN);
         hang(findings);
     },
     false},
    {"Crashes",
     [](Findings& findings) {
         findings.add(Sign::BACK_END_ANSWERS, "");
         static_cast<void>(raise(SIGSEGV));
     },
     true},
    {"Throws", [](Findings&) { throw std::runtime_error("no"); }, false},
    {"WritesRubbish",
     [](Findings& findings) {
         findings.add(Sign::BACK_END_ANSWERS, "");
         writeToPipe("rubbish\n");
         hang(findings);
     },
     false},
    {"Floods",
     [](Findings& findings) {
         findings.add(Sign::BACK_END_ANSWERS, "");
         while (true) writeToPipe(std::string(1000, 'x'));
     },
     false},
};

INSTANTIATE_TEST_SUITE_P(SideBySide,
                         FailingProbe,
                         ::testing::ValuesIn(kEndings),
                         [](const auto& row) { return row.param.name; });

TEST(SideBySide, RunsAllAtOnce) {
    const auto slow = [](Findings&) { usleep(200'000); };
    const auto began = std::chrono::steady_clock::now();
    const auto found = runSideBySide({slow, slow, slow, slow, slow}, std::chrono::seconds(10));
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(900));
    for (const Findings& each : found) EXPECT_TRUE(each.finished());
}

TEST(SideBySide, GivesProbesDefaultSignals) {
    signal(SIGUSR1, SIG_IGN);
    const auto found =
        runSideBySide({[](Findings&) { static_cast<void>(raise(SIGUSR1)); }}, kLimit);
    EXPECT_FALSE(found.at(0).finished());
}

struct Lines {
    std::string name;
    std::string text;
    bool isRead;
};

class SentLines : public ::testing::TestWithParam<Lines> {};

TEST_P(SentLines, AreValidated) {
    Findings findings;
    EXPECT_EQ(findings.read(GetParam().text), GetParam().isRead);
}

const std::string kGoodSign =
    "S " + std::to_string(static_cast<int>(Sign::BACK_END_ANSWERS)) + " the back end answers\n";

const Lines kLines[] = {
    {"Nothing", "", true},
    {"End", "END\n", true},
    {"Everything", kGoodSign + "C 1 a check\nV name value\nEND\n", true},
    {"AnUnfinishedLine", kGoodSign + "C 1 a che", true},
    {"ASignOfTheLog", "S " + std::to_string(static_cast<int>(Sign::LOGGED_END)) + " ended\n",
     false},
    {"ASignOfAFile", "S 0 unreadable\n", false},
    {"ANegativeSign", "S -1 x\n", false},
    {"AHugeSign", "S 99999999999 x\n", false},
    {"AnUnknownVerdict", "C 3 x\n", false},
    {"ANameWithADigit", "V a1 x\n", false},
    {"ControlCharacters", "C 0 \x1b[31m\n", false},
    {"OtherLetters", "C 0 \xc3\xa4\n", false},
    {"AnEmptyLine", "\n", false},
    {"ShortLine", "S\n", false},
    {"MoreAfterTheEnd", "END\nC 0 x\n", false},
};

INSTANTIATE_TEST_SUITE_P(Findings, SentLines, ::testing::ValuesIn(kLines), [](const auto& row) {
    return row.param.name;
});

TEST(Findings, ArriveAsTheyWereSent) {
    std::string sent;
    Findings sender{[&](const std::string& line) { sent += line; }};
    sender.add(Sign::CLOCK_WRONG, "a\nS 1 b\x01" + std::string(500, 'c'));
    sender.finish();
    Findings receiver;
    ASSERT_TRUE(receiver.read(sent));
    EXPECT_TRUE(receiver.finished());
    ASSERT_EQ(receiver.signs().size(), 1U);
    EXPECT_EQ(receiver.signs()[0].text, sender.signs()[0].text);
    EXPECT_EQ(receiver.signs()[0].text.rfind("aS 1 bccc", 0), 0U);
}

}  // namespace

}  // namespace pelorus::doctor
