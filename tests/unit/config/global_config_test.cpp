#include "config/global_config.h"

#include <sys/stat.h>
#include <sys/time.h>

#include <cstdio>
#include <ostream>

#include "common/handles.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

class ConfigTest : public PelorusTest {
protected:
    GlobalConfig& config = *GlobalConfig::getInstance();

    void parse(const std::string& text) {
        const FileHandle file = openFile(writeFile("parsed.ini", text), "re");
        ASSERT_TRUE(file);
        EXPECT_TRUE(config.loadConfigSettings(file.get()));
    }
    // Writes both files with a temporary copy in use; returns the path of the static one.
    std::string writeConfig(const std::string& dynamicText) {
        writeFile("dynamicconfig.ini", dynamicText);
        return writeFile("static.ini",
                         "DYNAMIC_CONFIG=" + folder + "\nDYNAMIC_CONFIG_TMP=" + copy + "\n");
    }
    // As another program would, at another second.
    void rewriteCopy(const std::string& text, int secondsLater) {
        writeFile("copy.ini", text);
        struct stat status {};
        ASSERT_EQ(stat(copy.c_str(), &status), 0);
        const timeval changed{status.st_mtime + secondsLater, 0};
        const timeval times[] = {changed, changed};
        ASSERT_EQ(utimes(copy.c_str(), times), 0);
    }

    const std::string copy = path("copy.ini");
};

// --- lines ---------------------------------------------------------------------------------

struct LineRow {
    const char* name;
    std::string text;
    std::string key;
    std::string value;
};

void PrintTo(const LineRow& row, std::ostream* out) {
    *out << row.name;
}

class ConfigLine : public ConfigTest, public ::testing::WithParamInterface<LineRow> {};

// A second setting keeps the store from being loaded anew when the row has none.
TEST_P(ConfigLine, IsSplit) {
    parse(GetParam().text + "\nOTHER=1\n");
    EXPECT_EQ(config.getProperty(GetParam().key), GetParam().value);
    EXPECT_EQ(config.getProperty("OTHER"), "1");
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    ConfigLine,
    ::testing::Values(LineRow{"BlanksAroundTheLineGo", " \t KEY=value \t", "KEY", "value"},
                      LineRow{"ABlankBeforeTheEqualsSignStays", "KEY = v", "KEY ", "v"},
                      LineRow{"QuotesAroundTheValueGo", "KEY=\"a b\"", "KEY", "a b"},
                      LineRow{"QuotesWithinTheValueStay", "KEY=a\"b", "KEY", "a\"b"},
                      LineRow{"ACarriageReturnStays", "KEY=v\r", "KEY", "v\r"},
                      LineRow{"AQuoteBeforeACarriageReturnStays", "KEY=\"v\"\r", "KEY", "v\"\r"},
                      LineRow{"AnEmptyValue", "KEY=", "KEY", ""},
                      LineRow{"AValueOfBlanksAndQuotesIsEmpty", "KEY= \"\" ", "KEY", ""},
                      LineRow{"FurtherEqualsSignsBelongToTheValue", "KEY=a=b", "KEY", "a=b"},
                      LineRow{"AnEqualsSignInFrontBelongsToTheKey", "=A=b", "=A", "b"},
                      LineRow{"BlanksAloneAreNoKey", "  =v", "", ""},
                      LineRow{"ACommentIsAKey", "#KEY=v", "#KEY", "v"},
                      LineRow{"ALineWithoutEqualsSignIsIgnored", "KEY", "KEY", ""},
                      LineRow{"TheLaterLineWins", "KEY=a\nKEY=b", "KEY", "b"},
                      LineRow{"A299thCharacterStillBelongsToTheLine",
                              "KEY=" + std::string(295, 'x'), "KEY", std::string(295, 'x')},
                      LineRow{"ALongLineIsCut", "KEY=" + std::string(300, 'x'), "KEY",
                              std::string(295, 'x')},
                      LineRow{"TheRestOfALongLineIsALine",
                              "KEY=" + std::string(295, 'x') + "REST=1", "REST", "1"}),
    RowName{});

// --- loading -------------------------------------------------------------------------------

TEST_F(ConfigTest, TheDynamicFileIsReadDirectlyWithoutACopy) {
    for (const char* noCopy : {"", "DYNAMIC_CONFIG_TMP=empty\n", "DYNAMIC_CONFIG_TMP=\n"}) {
        writeFile("dynamicconfig.ini", "KEY=dynamic\n");
        const std::string file =
            writeFile("static.ini", "KEY=static\nDYNAMIC_CONFIG=" + folder + "\n" + noCopy);
        log.clear();
        EXPECT_TRUE(config.loadConfig(file));
        expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                     {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                     {LOG_INFO, "OPENING dynamic config file for read: \n"},
                     {LOG_INFO, path("dynamicconfig.ini")},
                     {LOG_INFO, "LOADING dynamic config file settings.\n"}});
        EXPECT_EQ(config.getProperty("KEY"), "dynamic");
    }
}

TEST_F(ConfigTest, TheFirstCopyIsMadeForAllPrograms) {
    const mode_t before = umask(077);
    const std::string content = "KEY=" + std::string(400, 'x') + "\nLAST=without line end";
    EXPECT_TRUE(config.loadConfig(writeConfig(content)));
    umask(before);
    // The copy is looked at by the first lookups already, before it is made.
    const std::string missing =
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n";
    expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                 {LOG_ERR, missing},
                 {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                 {LOG_INFO, "Loading TEMP dynamic config file.\n"},
                 {LOG_INFO, "Opening dynamic config file for copy.\n"},
                 {LOG_INFO, "Creating temp copy of dynamic config file.\n"},
                 {LOG_INFO, "Copying dynamic config file.\n"},
                 {LOG_INFO, "Re-opening TEMP dynamic config file.\n"}});
    EXPECT_EQ(readFile(copy), content);
    struct stat status {};
    ASSERT_EQ(stat(copy.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0666U);
    EXPECT_EQ(config.getProperty("LAST"), "without line end");
}

TEST_F(ConfigTest, AnExistingCopyIsReadAsItStands) {
    writeFile("copy.ini", "KEY=copied earlier\n");
    EXPECT_TRUE(config.loadConfig(writeConfig("KEY=newer\n")));
    EXPECT_EQ(config.getProperty("KEY"), "copied earlier");
    expectNotLogged("Copying");
    EXPECT_EQ(readFile(copy), "KEY=copied earlier\n");
}

struct FailureRow {
    const char* name;
    const char* staticText;  // FOLDER stands for the folder of the test; null: no static file
    const char* line;
};

void PrintTo(const FailureRow& row, std::ostream* out) {
    *out << row.name;
}

class ConfigFailure : public ConfigTest, public ::testing::WithParamInterface<FailureRow> {
protected:
    std::string inFolder(std::string text) const {
        const std::string word = "FOLDER";
        for (std::size_t at = 0; (at = text.find(word)) != std::string::npos;) {
            text.replace(at, word.size(), folder);
        }
        return text;
    }
};

TEST_P(ConfigFailure, IsLoggedAndReturned) {
    writeFile("dynamicconfig.ini", "KEY=v\n");
    if (GetParam().staticText != nullptr) writeFile("static.ini", inFolder(GetParam().staticText));
    EXPECT_FALSE(config.loadConfig(path("static.ini")));
    expectLogged(LOG_ERR, inFolder(GetParam().line));
    log.clear();
    EXPECT_FALSE(config.refresh());
    expectLogged(LOG_ERR, inFolder(GetParam().line));
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    ConfigFailure,
    ::testing::Values(
        FailureRow{
            "NoStaticFile", nullptr,
            "GlobalConfig::loadConfig() - failed to open config file: [FOLDER/static.ini].\n"},
        FailureRow{
            "AStaticFileWithoutASetting", "nothing\nhere\n",
            "GlobalConfig::loadConfigSettings() - failed to open config file: [FOLDER/static.ini].\n"},
        FailureRow{
            "NoDynamicFile", "DYNAMIC_CONFIG=FOLDER/gone\n",
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: [FOLDER/gone/dynamicconfig.ini].\n"},
        FailureRow{
            "NoDynamicFileToCopy",
            "DYNAMIC_CONFIG=FOLDER/gone\nDYNAMIC_CONFIG_TMP=FOLDER/copy.ini\n",
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: FOLDER/gone/dynamicconfig.ini\n"},
        FailureRow{
            "NoPlaceForTheCopy", "DYNAMIC_CONFIG=FOLDER\nDYNAMIC_CONFIG_TMP=FOLDER/gone/copy.ini\n",
            "GlobalConfig::loadConfig() - failed to create temporary dynamic config file: FOLDER/gone/copy.ini\n"}),
    RowName{});

TEST_F(ConfigTest, AFailedLoadKeepsWhatWasMerged) {
    EXPECT_FALSE(config.loadConfig(writeFile("static.ini", "KEY=v\nDYNAMIC_CONFIG=/gone\n")));
    EXPECT_EQ(config.getProperty("KEY"), "v");
}

// --- lookups -------------------------------------------------------------------------------

TEST_F(ConfigTest, AChangedCopyIsMergedAtTheNextLookupOfAnyKey) {
    ASSERT_TRUE(config.loadConfig(writeConfig("KEY=old\nGONE=kept\n")));
    log.clear();
    EXPECT_EQ(config.getProperty("KEY"), "old");
    EXPECT_TRUE(log.lines().empty()) << log.dump();

    rewriteCopy("KEY=new\n", -7);  // any other time counts as a change
    EXPECT_EQ(config.getProperty("GONE"), "kept");
    EXPECT_EQ(config.getProperty("KEY"), "new");
    expectLogIs({{LOG_INFO, "Reload dynamicconfig.ini file.\n"}});
}

TEST_F(ConfigTest, TheKeyOfTheCopyItselfDoesNotLookAtTheCopy) {
    ASSERT_TRUE(config.loadConfig(writeConfig("KEY=old\n")));
    log.clear();
    rewriteCopy("DYNAMIC_CONFIG_TMP=/elsewhere\n", 5);
    EXPECT_EQ(config.getProperty("DYNAMIC_CONFIG_TMP"), copy);
    EXPECT_TRUE(log.lines().empty()) << log.dump();
}

TEST_F(ConfigTest, AMissingCopyIsAnErrorLineAtEveryLookup) {
    ASSERT_TRUE(config.loadConfig(writeConfig("KEY=v\n")));
    ASSERT_EQ(std::remove(copy.c_str()), 0);
    log.clear();
    EXPECT_EQ(config.getProperty("KEY"), "v");
    EXPECT_EQ(config.getProperty("ABSENT"), "");
    const LogLine line{
        LOG_ERR,
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n"};
    expectLogIs({line, line});
}

TEST_F(ConfigTest, DeletingForgetsUntilTheNextLoad) {
    givenConfig({{"KEY", "v"}});
    config.deleteProperty("KEY");
    EXPECT_EQ(config.getProperty("KEY"), "");
    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(config.getProperty("KEY"), "v");
}

// --- write-through -------------------------------------------------------------------------

TEST_F(ConfigTest, ASettingInMemoryTouchesNoFile) {
    givenConfig({{"KEY", "v"}});
    const std::string before = readFile(path("static.ini"));
    EXPECT_EQ(config.setProperty("KEY", "new", false), "new");
    EXPECT_EQ(config.getProperty("KEY"), "new");
    EXPECT_EQ(readFile(path("static.ini")), before);
    EXPECT_TRUE(commands.lines().empty());
}

TEST_F(ConfigTest, ANewSettingIsAppendedToTheStaticFile) {
    givenConfig();
    const std::string before = readFile(path("static.ini"));
    EXPECT_EQ(config.setProperty("A", "x", true), "x");
    EXPECT_EQ(readFile(path("static.ini")), before + "A=x\n");
    EXPECT_TRUE(commands.lines().empty());
}

TEST_F(ConfigTest, AKnownSettingIsReplacedBySed) {
    givenConfig({{"KEY", "old"}});
    config.setProperty("KEY", "new", true);
    EXPECT_EQ(commands.lines(),
              (std::vector<std::string>{"sed -i 's/KEY=old/KEY=new/g' " + path("static.ini")}));
}

struct WriteRow {
    const char* name;
    const char* oldValue;
    const char* newValue;
};

void PrintTo(const WriteRow& row, std::ostream* out) {
    *out << row.name;
}

class ConfigWrite : public ConfigTest, public ::testing::WithParamInterface<WriteRow> {};

// Runs the real shell and the real sed: no character of a value means anything to either.
TEST_P(ConfigWrite, TakesValuesAsTheyAre) {
    const std::string others = "OLDX=1\n\n#KEY\n";
    const std::string odd = "it's $(touch hurt)";  // the path is quoted as well
    ASSERT_EQ(mkdir(path(odd).c_str(), 0700), 0);
    writeFile("dynamicconfig.ini", "");
    const std::string rest = "DYNAMIC_CONFIG=" + folder + "\n" + others;
    const std::string file =
        writeFile(odd + "/static.ini", std::string{"KEY="} + GetParam().oldValue + "\n" + rest);
    ASSERT_TRUE(config.loadConfig(file));
    commands.runForReal();
    config.setProperty("KEY", GetParam().newValue, true);
    EXPECT_EQ(readFile(file), std::string{"KEY="} + GetParam().newValue + "\n" + rest);
    EXPECT_EQ(config.getProperty("KEY"), GetParam().newValue);
    config.deleteProperty("KEY");
    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(config.getProperty("KEY"), GetParam().newValue);
}

INSTANTIATE_TEST_SUITE_P(Rows,
                         ConfigWrite,
                         ::testing::Values(WriteRow{"Slashes", "http://a/b", "/c/d"},
                                           WriteRow{"PatternCharacters", "a.*[x]^$\\", "plain"},
                                           WriteRow{"ReplacementCharacters", "plain", "a&b\\1\\n&"},
                                           WriteRow{"SingleQuotes", "it's", "'; touch hurt; '"},
                                           WriteRow{"ShellCharacters", "$HOME `id`",
                                                    "$(touch hurt) | \" ; > x"}),
                         RowName{});

TEST_F(ConfigTest, ASettingThatWouldDamageTheFileIsKeptInMemoryOnly) {
    givenConfig({{"KEY", "old"}});
    const std::string before = readFile(path("static.ini"));
    for (const std::string& value : {std::string(300, 'x'), std::string{"a\nB=1"}}) {
        for (const char* key : {"KEY", "NEW"}) {
            log.clear();
            EXPECT_EQ(config.setProperty(key, value, true), value);
            EXPECT_EQ(log.lines().size(), 1U) << log.dump();
            config.setProperty(key, std::string{key} == "KEY" ? "old" : "", false);
        }
    }
    EXPECT_EQ(readFile(path("static.ini")), before);
    EXPECT_TRUE(commands.lines().empty());
}

TEST_F(ConfigTest, AFileThatCannotBeAppendedToIsAnErrorLine) {
    EXPECT_FALSE(config.loadConfig(path("gone/static.ini")));
    parse("OTHER=1\n");
    log.clear();
    EXPECT_EQ(config.setProperty("KEY", "v", true), "v");
    expectLogIs({{LOG_ERR, "GlobalConfig::setProperty() - failed to open config file: " +
                               path("gone/static.ini") + "\n"}});
}

}  // namespace
}  // namespace pelorus::support
