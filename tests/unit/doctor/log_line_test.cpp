#include "doctor/log_line.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace pelorus::doctor {
namespace {

Time at(std::int64_t seconds) {
    return Time{std::chrono::seconds{seconds}};
}

constexpr std::int64_t kNow = 1795316400;  // 2026-11-22 03:00:00 UTC

class LogLineTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1), 0);
        tzset();
    }
};

TEST_F(LogLineTest, StampsOfEveryLogger) {
    const struct {
        const char* line;
        std::int64_t seconds;  // -1: not a line of the daemon's
    } rows[]{
        {"Nov 22 03:00:00 nas Pelorus[12]: x", kNow - 3600},
        {"Nov  2 12:07:01 nas Pelorus: x", 1793617621},
        {"<134>Nov 22 03:00:00 Pelorus: x", kNow - 3600},
        {"Jul  1 12:00:00 nas local0.info Pelorus: x", 1782900000},  // summer time
        {"Dec 24 12:00:00 nas pelorus: x", 1766574000},              // last year's
        {"Feb 29 12:00:00 nas Pelorus: x", 1709204400},              // the year that had one
        {"2026-11-22T02:40:00.123+01:00 nas Pelorus: x", kNow - 4800},
        {"2026-11-22T02:40:00+0100 nas Pelorus[7]: x", kNow - 4800},
        {"2026-11-22T01:40:00Z nas Pelorus[7]: x", kNow - 4800},
        {"2026-11-22T02:40:00 nas Pelorus: x", kNow - 4800},
        {"Nov 22 03:00:00.123456 nas Pelorus[12]: x", kNow - 3600},
        {"1795316400.123456 nas Pelorus[12]: x", kNow},
        {"<133>1 2026-11-22T01:40:00.123Z nas Pelorus 12 - - x", kNow - 4800},
        {"1795316400 nas Pelorus[12]: x", -1},
        {"2026-11-23T03:00:00Z nas Pelorus: x", kNow + 86400},  // a clock or zone of another device
        {"2026-11-23T03:00:01Z nas Pelorus: x", -1},
        {"Nov 31 12:00:00 nas Pelorus: x", -1},
        {"Foo 22 03:00:00 nas Pelorus: x", -1},
        {"Nov 22 24:00:00 nas Pelorus: x", -1},
        {"2026-13-22T02:40:00Z nas Pelorus: x", -1},
        {"<134Nov 22 03:00:00 nas Pelorus: x", -1},
        {"Pelorus: x", -1},
        {"", -1},
    };
    for (const auto& row : rows) {
        const auto line = readLogLine(row.line, at(kNow));
        EXPECT_EQ(line ? line->when.time_since_epoch().count() : -1, row.seconds) << row.line;
    }
}

TEST_F(LogLineTest, AnHourThatComesTwiceIsItsFirstOne) {
    for (const char* const line :
         {"Oct 25 02:30:00 nas Pelorus: x", "2026-10-25 02:30:00 nas Pelorus: x"}) {
        const auto read = readLogLine(line, at(kNow));
        ASSERT_TRUE(read) << line;
        EXPECT_EQ(read->when, at(1792888200)) << line;
        EXPECT_TRUE(read->isTwice) << line;
    }
    EXPECT_FALSE(readLogLine("Oct 25 03:30:00 nas Pelorus: x", at(kNow))->isTwice);
    EXPECT_FALSE(readLogLine("Oct 25 01:30:00 nas Pelorus: x", at(kNow))->isTwice);
}

TEST_F(LogLineTest, MayLackAStamp) {
    const std::pair<const char*, bool> rows[]{
        {"[    2.345678] nas Pelorus[12]: x", true},
        {"Sun 2026-11-22 03:00:00 UTC nas Pelorus[12]: x", true},
        {"2036-11-22T03:00:00Z nas Pelorus[12]: x", true},
        {"[    2.345678] nas kernel: elorus", false},
        {"Nov 22 03:00:00 nas cron: Pelorus: x", false},
    };
    for (const auto& [line, lacks] : rows) EXPECT_EQ(lacksStamp(line, at(kNow)), lacks) << line;
}

TEST_F(LogLineTest, OnlyTheDaemonsLinesWithoutTheirEnds) {
    const struct {
        const char* rest;
        const char* text;  // null: foreign
    } rows[]{
        {"nas Pelorus[12]: sigTrap - x.#012#012 ", "sigTrap - x."},
        {"nas pelorus:  desc: y\r", " desc: y"},
        {"pelorus Pelorus: host of that name", "host of that name"},
        {"nas Pelorus[12]: message repeated 84 times: [ sigTrap - x.]", "sigTrap - x."},
        {"nas Pelorus: message repeated by hand: [ x]", "message repeated by hand: [ x]"},
        {"nas pelorus-doctor[3]: x", nullptr},
        {"nas pelorus.sh: x", nullptr},
        {"nas Pelorus[]: x", nullptr},
        {"nas Pelorus[1a]: x", nullptr},
        {"nas sudo: root ran Pelorus: x", nullptr},
        {"nas kernel: Pelorus: x", nullptr},
        {"nas some words Pelorus: x", nullptr},
        {"nas PELORUS: x", nullptr},
    };
    for (const auto& row : rows) {
        const std::string whole = std::string{"Nov 22 03:00:00 "} + row.rest;
        const auto line = readLogLine(whole, at(kNow));
        EXPECT_EQ(line ? line->text : "foreign", row.text != nullptr ? row.text : "foreign")
            << row.rest;
    }
    const auto line = readLogLine(
        "<133>1 2026-11-22T01:40:00Z nas pelorus 12 - [a b=\"c d\"] \xEF\xBB\xBFx - y", at(kNow));
    EXPECT_EQ(line ? line->text : "foreign", "x - y");
}

}  // namespace
}  // namespace pelorus::doctor
