#include "doctor/device_log.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <zlib.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "doctor/log_source.h"

namespace pelorus::doctor {
namespace {

namespace fs = std::filesystem;

const std::string kFirst =
    "2026-11-20T10:00:00Z nas cron[1]: Pelorus: no line of the daemon\n"
    "2026-11-20T10:00:01Z nas Pelorus: main - pelorus daemon starting up, Version: [1], PID: [1]\n"
    "2026-11-20T10:00:09Z nas Pelorus: TavikClient::updateLocalCommStatus - Update COMMUNICATION "
    "status : [relayed].\n";
const std::string kSecond =
    "2026-11-21T10:00:00Z nas Pelorus: TavikClient::updateLocalCommStatus - Update COMMUNICATION "
    "status : [portforwarded].\n"
    "2026-11-21T10:02:00Z nas Pelorus: DaemonControl::run - sleep 300 secs.";

class DeviceLogTest : public testing::Test {
protected:
    DeviceLogTest() {
        folder = fs::temp_directory_path() / "pelorus-log-XXXXXX";
        if (mkdtemp(folder.data()) == nullptr) throw std::runtime_error{"no temporary folder"};
        // No journal of this machine.
        setenv("PATH", folder.c_str(), 1);
    }
    void TearDown() override { fs::remove_all(folder); }

    [[nodiscard]] std::string path(const std::string& name) const { return folder + "/" + name; }

    std::string plain(const std::string& name, const std::string& text) {
        std::ofstream{path(name)} << text;
        return path(name);
    }

    std::string zipped(const std::string& name, const std::string& text) {
        gzFile file = gzopen(path(name).c_str(), "wb");
        gzwrite(file, text.data(), static_cast<unsigned>(text.size()));
        gzclose(file);
        return path(name);
    }

    void journal(const std::string& script) {
        plain("journalctl", "#!/bin/sh\n" + script + "\n");
        chmod(path("journalctl").c_str(), 0700);
    }

    Evidence look(const std::vector<std::string>& files) {
        Evidence evidence;
        evidence.now = Time{std::chrono::seconds{1795316400}};
        evidence.fromElsewhere = true;
        LogChoice choice;
        choice.files = files;
        choice.folder = folder;
        choice.journalPatience = std::chrono::seconds{1};
        lookAtLog(choice, evidence);
        return evidence;
    }

    void expectWhole(const Evidence& evidence) {
        ASSERT_EQ(evidence.history.size(), 2U);
        EXPECT_EQ(evidence.history[0].reach, Reach::RELAYED);
        EXPECT_EQ(evidence.history[1].reach, Reach::DIRECT);
        ASSERT_FALSE(evidence.checks.empty());
        EXPECT_NE(evidence.checks.back().text.find(", 1 start of the daemon"), std::string::npos);
        EXPECT_EQ(evidence.now, evidence.logEnd);
        EXPECT_EQ(evidence.logHosts, std::set<std::string>{"nas"});
    }

    std::string folder;
};

TEST_F(DeviceLogTest, FilesInAnyOrderPlainOrZippedAndRepeated) {
    const std::string first = plain("a", kFirst);
    const std::string second = zipped("b", kSecond);
    const std::string both = plain("c", kFirst + kSecond);
    for (const auto& files : std::vector<std::vector<std::string>>{
             {first, second}, {second, first}, {second, first, second, first}, {both, second}}) {
        expectWhole(look(files));
    }
}

TEST_F(DeviceLogTest, EndsWithTheLastLineOfAnyProgram) {
    const Evidence evidence =
        look({plain("a", kFirst + "2026-11-20T12:00:00Z nas cron[1]: other\nno stamp")});
    EXPECT_EQ(evidence.now - *evidence.logEnd, std::chrono::seconds{7191});
}

TEST_F(DeviceLogTest, AClockThatWasWrongHidesNoFile) {
    const std::string said = "T10:30:00Z nas Pelorus: main - x\n";
    const struct {
        const char* name;
        std::string first, second;  // the files' names
        std::string before, after;  // lines around those of the first file
        std::string unset;          // line before those of the second file
    } rows[]{{"ahead at the end", "b", "a", "", "2026-11-21" + said, ""},
             {"not set at the start", "b", "a", "", "", "2026-01-01" + said},
             {"ahead at the start of a rotated file", "log.1", "log", "2026-11-22" + said, "", ""}};
    for (const auto& row : rows) {
        const std::string first = plain(row.first, row.before + kFirst + row.after);
        const std::string second = plain(row.second, row.unset + kSecond);
        const Evidence evidence = look({second, first});
        EXPECT_EQ(evidence.history.back().reach, Reach::DIRECT) << row.name;
    }
}

TEST_F(DeviceLogTest, StampsWithoutYearsReachFurtherBackThanOne) {
    std::string log =
        "Oct  1 12:00:00 nas Pelorus: main - pelorus daemon starting up, Version: [1]\n";
    for (const char* const day : {"Nov 22", "Nov 26", "Dec 30", "Jan  2", "Nov 20"}) {
        log += std::string{day} + " 12:00:00 nas Pelorus: x\n";
    }
    const Evidence evidence = look({plain("a", log)});
    EXPECT_EQ((*evidence.logEnd - *evidence.logBegin).count(), 415 * 86400);
    EXPECT_EQ(evidence.daemon.since, evidence.logBegin);
}

TEST_F(DeviceLogTest, TimeGoesOnInAnHourThatComesTwice) {
    setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
    tzset();
    std::string log;
    for (const char* const time : {"01:50", "02:10", "02:50", "02:10", "02:50", "03:10"}) {
        log += "Oct 25 " + std::string{time} + ":00 nas Pelorus: x\n";
    }
    const Evidence evidence = look({plain("a", log)});
    EXPECT_EQ(evidence.checks.back().text.find("jumped"), std::string::npos);
    EXPECT_EQ(*evidence.logEnd - *evidence.logBegin, std::chrono::minutes{140});
}

TEST_F(DeviceLogTest, SaysThatTheLinesMayBeOfSeveralDevices) {
    std::string other = kSecond;
    other.replace(other.find("nas"), 3, "box");
    const Evidence evidence = look({plain("a", kFirst + other)});
    EXPECT_NE(evidence.untold.front().find("box, nas"), std::string::npos);
}

TEST_F(DeviceLogTest, RotatedSystemLogsOldestFirst) {
    plain("messages", kFirst + kSecond);  // the same lines once more
    plain("syslog", kSecond);
    plain("syslog.1.old", kFirst);
    for (const char* const name : {"syslog.2.gz", "syslog-20261121.gz"}) {
        const std::string rotated = zipped(name, kFirst);
        fs::last_write_time(rotated, fs::file_time_type::clock::now() - std::chrono::hours{24});
        expectWhole(look({}));
        fs::remove(rotated);
    }
}

TEST_F(DeviceLogTest, ACollectedLogNamesManyHosts) {
    std::string lines;
    for (int number = 0; number < 50; ++number) {
        const std::size_t host = kSecond.find(" nas ");
        lines += std::string{kSecond}.replace(host + 1, 3, "nas" + std::to_string(number)) + "\n";
    }
    const auto evidence = look({plain("a", lines)});
    EXPECT_EQ(evidence.logHosts.count("nas49"), 1U);
    EXPECT_NE(evidence.untold.at(0).find(" nas, nas0, nas1 and 48 more;"), std::string::npos);
}

TEST_F(DeviceLogTest, TheJournalComesFirst) {
    plain("syslog", kFirst);
    plain("lines", kFirst + kSecond);
    journal("exec /bin/cat " + path("lines"));
    expectWhole(look({}));
}

TEST_F(DeviceLogTest, AJournalThatCannotBeReadIsSaid) {
    plain("syslog", kFirst + kSecond);
    const std::pair<std::string, std::string> rows[]{
        {"echo 'No permission.\nMore.' >&2; exit 1", "journal: No permission."},
        {"exit 3", "journal: journalctl ended with status 3"},
        {"exec /bin/sleep 60", "journal: no line for 1 s"}};
    for (const auto& [script, problem] : rows) {
        journal(script);
        const Evidence evidence = look({});
        EXPECT_EQ(evidence.checks.front().verdict, Check::Verdict::NOT_SEEN);
        EXPECT_EQ(evidence.checks.front().text, problem);
        expectWhole(evidence);
    }
}

TEST_F(DeviceLogTest, AJournalMayBeSlowerThanItsLinesAre) {
    plain("first", kFirst);
    plain("second", kSecond);
    const std::string cat = "/bin/cat " + path("first") + "; /bin/sleep 0.6; echo other; ";
    journal(cat + "/bin/sleep 0.6; exec /bin/cat " + path("second"));
    const Evidence evidence = look({});
    EXPECT_EQ(evidence.checks.front().verdict, Check::Verdict::OK);
    expectWhole(evidence);
}

TEST_F(DeviceLogTest, WhatCannotBeReadIsSaid) {
    const std::string whole = zipped("whole.gz", kFirst + std::string(100000, 'x') + kSecond);
    std::ifstream file{whole};
    std::string bytes{std::istreambuf_iterator<char>{file}, {}};
    bytes.resize(bytes.size() - 20);
    const struct {
        std::string file;
        std::string problem;
    } rows[]{{plain("cut.gz", bytes), "its end is missing"},
             {plain("boot", "[    2.345678] nas Pelorus[12]: x\n"),
              "the time stamp of 1 line of the daemon is not understood"},
             {path("absent"), "No such file or directory"},
             {folder, "it is no regular file"},
             {plain("bad.gz", bytes.substr(0, 40) + std::string(400, '?')), "it is damaged"}};
    for (const auto& row : rows) {
        const Evidence evidence = look({row.file});
        ASSERT_FALSE(evidence.checks.empty());
        EXPECT_EQ(evidence.checks[0].verdict, Check::Verdict::NOT_SEEN);
        EXPECT_NE(evidence.checks[0].text.find(row.problem), std::string::npos)
            << evidence.checks[0].text;
    }
    EXPECT_TRUE(look({path("cut.gz")}).hasLog);
    EXPECT_FALSE(look({plain("empty", "")}).hasLog);
    EXPECT_EQ(look({path("empty")}).untold.size(), 1U);
    EXPECT_TRUE(look({path("boot")}).untold.empty());
}

TEST(LineFilter, CutsWhereverThePiecesEnd) {
    const std::string text =
        "other\n elorus 0\nelorus 1\n  a elorus\n\tb\nother\n c\nx elorus 2\n" +
        std::string(9000, 'y') + "elorus\nelorus " + std::string(9000, 'z') + "\n y\nelorus 3\n d";
    const std::vector<std::string> wanted{" elorus 0", "elorus 1 a elorus b", "x elorus 2",
                                          "elorus " + std::string(8185, 'z'), "elorus 3 d"};
    for (const std::size_t size : {1U, 2U, 7U, 8192U, 100000U}) {
        std::vector<std::string> lines;
        LineFilter filter{[&lines](std::string_view line) {
            if (line[0] != 'y') lines.emplace_back(line);
        }};
        for (std::size_t i = 0; i < text.size(); i += size) {
            filter.take(std::string_view{text}.substr(i, size));
        }
        filter.finish();
        EXPECT_EQ(lines, wanted) << size;
    }
}

}  // namespace
}  // namespace pelorus::doctor
