#include "doctor/settings_report.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include "doctor/file_safety.h"
#include "doctor/known_settings.h"
#include "doctor/setting_value.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;

constexpr uid_t kNobody = 65534;

using doctor::checkSettings;
using doctor::SettingsReport;
using doctor::Writers;

// The samples of the package, with a copy in a closed folder.
class SettingsReportTest : public PelorusTest {
protected:
    SettingsReportTest() {
        fs::permissions(folder, fs::perms{0755});
        fs::create_directory(path("run"));
        fs::permissions(path("run"), fs::perms{0700});
        dynamic =
            std::regex_replace(sample("dynamicconfig.ini"), std::regex{"(DEVICEID|DEVICEAUTH)=\n"},
                               std::string{"$1="} + kDeviceAuth + "\n");
        fixed =
            std::regex_replace(sample("globalconfig.ini"), std::regex{"/var/lib/pelorus"}, folder);
        fixed = std::regex_replace(fixed, std::regex{"/run/pelorus/"}, path("run/"));
    }

    static std::string sample(const std::string& name) {
        const fs::path tree = fs::path{__FILE__}.parent_path() / "../../..";
        return readFile(tree / "packaging/config" / name);
    }
    [[nodiscard]] SettingsReport check(const std::string& more = {},
                                       const std::string& moreDynamic = {}) const {
        writeFile("dynamicconfig.ini", dynamic + moreDynamic);
        auto report = checkSettings(writeFile("static.ini", fixed + more));
        for (const auto& list : {report.problems, report.remarks}) {
            for (const auto& line : list) EXPECT_FALSE(holds(line, kDeviceAuth)) << line;
        }
        return report;
    }
    // In tests of a user other than root, the files are not root's.
    static Texts withoutOwners(const Texts& lines) {
        Texts left;
        for (const auto& line : lines) {
            if (!holds(line, "others than root")) left.push_back(line);
        }
        return left;
    }
    // The text of the one problem, behind the name of its file.
    [[nodiscard]] std::string problem(const std::string& more,
                                      const std::string& moreDynamic = {}) {
        const Texts problems = withoutOwners(check(more, moreDynamic).problems);
        EXPECT_LE(problems.size(), 1U) << ::testing::PrintToString(problems);
        return problems.empty() ? "" : problems.front().substr(folder.size() + 1);
    }

    std::string fixed, dynamic;
};

TEST_F(SettingsReportTest, TheSamplesHaveEveryKeyAndNoFault) {
    const auto report = check();
    EXPECT_TRUE(report.usable);
    EXPECT_EQ(withoutOwners(report.problems), Texts{});
    EXPECT_EQ(report.remarks, Texts{});
    EXPECT_FALSE(fs::exists(path("run/dynamicconfig.ini"))) << "nothing is created";
    const std::string both = "\n" + fixed + dynamic;
    for (const auto& known : doctor::knownSettings()) {
        EXPECT_TRUE(holds(both, "\n" + std::string{known.key} + "=")) << known.key;
    }
    const std::regex setting{"\n([A-Z0-9_]+)="};
    for (std::sregex_iterator found{both.begin(), both.end(), setting}, end; found != end;
         ++found) {
        EXPECT_NE(doctor::findKnownSetting((*found)[1].str()), nullptr) << (*found)[1];
    }
}

TEST_F(SettingsReportTest, AFaultIsNamedWithFileAndLine) {
    const auto count = [](const std::string& text) {
        return std::to_string(std::count(text.begin(), text.end(), '\n') + 1);
    };
    const std::string inStatic = "static.ini:" + count(fixed) + ": ";
    const std::string inDynamic = "dynamicconfig.ini:" + count(dynamic) + ": ";
    const char* const rows[][2]{
        {"INTERNAL_HTTP_PORT=http", "INTERNAL_HTTP_PORT=http is no number"},
        {"INTERNAL_HTTP_PORT=70000", "INTERNAL_HTTP_PORT=70000 is no port, 1 to 65535"},
        {"MANUAL_PORT_FORWARD=true", "MANUAL_PORT_FORWARD=true is not TRUE, so it is off"},
        {"DEVICEID=", "DEVICEID is empty: the daemon idles"},
        {"DEVICEID = x", "the blank in front of = makes another key than DEVICEID"},
        {"Deviceid=x", "Deviceid is another key than DEVICEID"},
        {"DEFAULT_PORTS_ONLY=TRUE\r",
         "DOS line end: the carriage return becomes part of the value"},
    };
    for (const auto& [line, fault] : rows) {
        EXPECT_EQ(problem("", std::string{line} + "\n"), inDynamic + fault);
    }
    EXPECT_EQ(problem("ENABLEREMOTEACCESS=yes\n"),
              inStatic + "ENABLEREMOTEACCESS=yes is not 1, so remote access is off");
    EXPECT_EQ(problem("SERVER_BASE_URL=cloud.kavra.example\n"),
              inStatic + "SERVER_BASE_URL has no // in front of the host");
    EXPECT_EQ(problem("LOCAL_DELFORWARDURL=http://127.0.0.1:%d/%s\n"),
              inStatic +
                  "LOCAL_DELFORWARDURL has the wrong kind of placeholder as number 2: no "
                  "URL is built");
    EXPECT_EQ(problem("X=" + std::string(300, 'x') + "\n"),
              inStatic + "has 302 characters: what follows the 299th is read as another line");
}

TEST(SettingValue, ATemplateMustTakeWhatItIsGiven) {
    const char* const rows[][2]{
        {"/%s?port=%u&part=100%%", ""},
        {"/", ""},
        {"/%s/%d/%s", "has more than 2 placeholders: no URL is built"},
        {"/%d", "has the wrong kind of placeholder as number 1: no URL is built"},
        {"/%5s", "has a percent sign that is neither %s, %d, %i, %u nor %%: no URL is built"},
        {"/%", "has a percent sign that is neither %s, %d, %i, %u nor %%: no URL is built"},
    };
    for (const auto& [text, fault] : rows) EXPECT_EQ(doctor::templateFault(text, "sd"), fault);
}

TEST_F(SettingsReportTest, WhatHasNoEffectIsRemarkedOn) {
    const std::string copy = path("run/dynamicconfig.ini");
    writeFile("run/dynamicconfig.ini",
              dynamic +
                  "DEVICETYPE=5\nSTARTCMD=id\nEXTRA=1\n"
                  "DEFAULT_PORTS_ONLY=TRUE\nSUBDOMAIN=OLDS3CRET\nSUBDOMAIN=here\n");
    const auto report = check(
        "#DEVICETYPE=1\nOTHER=1\nOTHER=1\nEXTERNAL_IP=1\n"
        "DEVICEAUTH: s3cret==\n#OLDAUTH s3cret==\nAs3cret==\n#OLDS3CRET=1\n#NEWS3CRET=1\n",
        "#DeviceAuth = NEWS3CRET\n");
    const std::string all = ::testing::PrintToString(report.remarks);
    EXPECT_EQ(all.find("OTHER"), all.rfind("OTHER")) << "once";
    EXPECT_FALSE(holds(all, "s3cret") || holds(all, "S3CRET") || holds(all, "EXTERNAL_IP")) << all;
    for (const char* part :
         {"# begins no comment: it sets #DEVICETYPE", "DEVICETYPE=5 replaces 1 of ",
          "does not know DEVICEAUTH\"", "it sets #OLDAUTH\"", "does not know this key",
          "STARTCMD is ignored: only the static", "the daemon does not know EXTRA",
          "EXTRA is only in the copy", "the daemon does not know OTHER",
          "DEFAULT_PORTS_ONLY=TRUE replaces FALSE of line ",
          "SUBDOMAIN replaces the value of line ", "DEFAULT_PORTS_ONLY differs from "}) {
        EXPECT_TRUE(holds(all, part)) << part << " in " << all;
    }
    EXPECT_EQ(withoutOwners(report.problems), Texts{});
    EXPECT_TRUE(report.usable);
}

TEST_F(SettingsReportTest, AStartThatWouldFailIsForetold) {
    fs::create_directory(path("folder"));
    ASSERT_EQ(mkfifo(path("pipe").c_str(), 0600), 0);
    writeFile("empty.ini", "nothing here\n");
    const char* const others[][2]{
        {"gone", " cannot be read: No such file or directory"},
        {"empty.ini", " holds no setting"},
        {"folder", " cannot be read: it is a folder"},
        {"pipe", " cannot be read: not a regular file, or a link of somebody else"}};
    for (const auto& [name, fault] : others) {
        const auto report = checkSettings(path(name));
        EXPECT_FALSE(report.usable);
        EXPECT_EQ(withoutOwners(report.problems),
                  Texts{"the daemon would not start: " + path(name) + fault});
        EXPECT_EQ(report.remarks, Texts{});
    }
    const auto reported = [this](const std::string& more) {
        const auto report = check(more);
        EXPECT_FALSE(report.usable);
        return withoutOwners(report.problems);
    };
    EXPECT_EQ(reported("DYNAMIC_CONFIG=/gone\n"),
              Texts{"the daemon would not start: /gone/dynamicconfig.ini cannot be read: No such "
                    "file or directory"})
        << "whatever may be in it is not missing";
    EXPECT_EQ(reported("DYNAMIC_CONFIG=/gone\nSTARTCMD=\n").size(), 2U);
    EXPECT_EQ(reported("DYNAMIC_CONFIG_TMP=/gone/copy.ini\n").front(),
              "the daemon would not start: the copy /gone/copy.ini cannot be made: /gone does not "
              "exist");
}

TEST_F(SettingsReportTest, WhatOnlyRootCanReadIsNotJudged) {
    EXPECT_TRUE(check().usable);
    fs::permissions(path("run"), fs::perms::none);
    const uid_t user = geteuid();
    ASSERT_TRUE(user != 0 || seteuid(kNobody) == 0);
    const auto report = checkSettings(path("static.ini"));
    ASSERT_EQ(seteuid(user), 0);
    fs::permissions(path("run"), fs::perms::owner_all);
    EXPECT_FALSE(report.usable);
    EXPECT_TRUE(report.needsRoot);
    EXPECT_EQ(
        withoutOwners(report.problems),
        Texts{path("run/dynamicconfig.ini") + " cannot be read by this user: run it as root"});
}

TEST_F(SettingsReportTest, WhatOthersCanChangeIsUnsafe) {
    const std::string file = path("run/dynamicconfig.ini");
    writeFile("run/dynamicconfig.ini", dynamic);
    chmod(file.c_str(), 0666);
    EXPECT_EQ(problem(""), "") << "nobody else can enter the folder";
    fs::permissions(path("run"), fs::perms{0755});
    EXPECT_EQ(problem(""), "run/dynamicconfig.ini: everybody can write or replace it");
    chmod(file.c_str(), 0600);
    fs::permissions(path("run"), fs::perms{01777});
    EXPECT_TRUE(holds(problem(""), ": everybody can take its name before the daemon starts"));
    fixed = std::regex_replace(fixed, std::regex{"STATIC_ONLY_KEYS=.*STARTCMD.*\n"}, "");
    const auto report = check();
    EXPECT_TRUE(holds(::testing::PrintToString(report.problems),
                      "STATIC_ONLY_KEYS lacks UPDATE_CONF_WITH_SERVER_CMD STARTCMD"))
        << ::testing::PrintToString(report.problems);
}

TEST_F(SettingsReportTest, EveryFolderAndLinkOnTheWayCounts) {
    if (geteuid() != 0) GTEST_SKIP() << "only root's files are safe";
    const auto make = [this](const std::string& name, unsigned mode) {
        fs::create_directories(path(name));
        fs::permissions(path(name), fs::perms{mode});
    };
    for (const char* name : {"open/conf", "safe/conf"}) make(name, 0755);
    make("closed/open", 0777);
    make("closed", 0700);
    make("open", 0777);
    for (const char* name : {"open/conf/f", "safe/conf/f", "closed/open/f"}) writeFile(name, "");
    fs::create_symlink("../open/conf", path("safe/link"));
    fs::create_symlink(path("safe"), path("open/link"));
    fs::create_symlink(path("safe/link"), path("closed/link"));
    const std::pair<const char*, Writers> rows[]{
        {"safe/conf/f", Writers::ROOT},           {"open/conf/f", Writers::EVERYBODY},
        {"safe/link/f", Writers::EVERYBODY},      {"open/link/conf/f", Writers::EVERYBODY},
        {"closed/open/f", Writers::ROOT},         {"closed/link/f", Writers::EVERYBODY},
        {"closed/../safe/conf/f", Writers::ROOT}, {"safe/gone", Writers::UNKNOWN},
    };
    for (const auto& [name, writers] : rows)
        EXPECT_EQ(doctor::writersOf(path(name)), writers) << name;
    EXPECT_EQ(doctor::creatorsOf(path("open/conf/new")), Writers::EVERYBODY);
}

TEST_F(SettingsReportTest, OnlyTheStaticFileIsReadWhole) {
    const std::string filler(1'100'000, '\n');
    fixed.insert(0, filler);
    EXPECT_TRUE(check().usable);
    EXPECT_EQ(problem(""), "");
    EXPECT_EQ(problem("", filler),
              "dynamicconfig.ini: is longer than 1 MiB; only its beginning is read");
}

TEST_F(SettingsReportTest, RubbishGivesABoundedReport) {
    std::string rubbish;
    for (int line = 0; line < 1000; ++line) {
        rubbish += std::string{static_cast<char>(line % 256), static_cast<char>(line % 7)} +
                   std::to_string(line) + "=\x01\xFF\n";
    }
    const auto report = check("", rubbish);
    EXPECT_EQ(report.problems.size(), 101U);
    EXPECT_EQ(report.remarks.size(), 101U);
    EXPECT_TRUE(std::regex_match(report.remarks.back(), std::regex{"and \\d+ more"}));
}

}  // namespace
}  // namespace pelorus::support
