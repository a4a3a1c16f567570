#include "config/global_config.h"

#include <sys/stat.h>

#include <filesystem>

#include "common/handles.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

class ConfigTest : public PelorusTest {
protected:
    void parse(const std::string& text) {
        const FileHandle file = openFile(writeFile("parsed.ini", text), "re");
        EXPECT_TRUE(config.loadConfigSettings(file.get()));
    }
    // Writes both files with a temporary copy in use; returns the path of the static one.
    std::string writeConfig(const std::string& dynamicText) {
        writeFile("dynamicconfig.ini", dynamicText);
        return writeFile("static.ini",
                         "DYNAMIC_CONFIG=" + folder + "\nDYNAMIC_CONFIG_TMP=" + copy + "\n");
    }
    // As another program would, at another second: even an earlier one counts as a change.
    void rewriteCopy(const std::string& text) {
        const auto before = std::filesystem::last_write_time(copy);
        writeFile("copy.ini", text);
        std::filesystem::last_write_time(copy, before - std::chrono::seconds{7});
    }

    GlobalConfig& config = *GlobalConfig::getInstance();
    const std::string copy = path("copy.ini");
    const std::string noCopy =
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n";
};

struct LineRow {
    const char* name;
    std::string text;
    std::string key;
    std::string value;
};

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
    ::testing::Values(LineRow{"BlanksAroundTheLineGo", " \t KEY= \tvalue \t", "KEY", "value"},
                      LineRow{"ABlankBeforeTheEqualsSignStays", "KEY = v", "KEY ", "v"},
                      LineRow{"QuotesAroundTheValueGo", "KEY=\"a \"b\" \"", "KEY", "a \"b"},
                      LineRow{"ACarriageReturnStays", "KEY=\"v\"\r", "KEY", "v\"\r"},
                      LineRow{"AValueOfBlanksAndQuotesIsEmpty", "KEY=a\nKEY= \"\" ", "KEY", ""},
                      LineRow{"FurtherEqualsSignsBelongToTheValue", "KEY=a=b", "KEY", "a=b"},
                      LineRow{"AnEqualsSignInFrontBelongsToTheKey", "=A=b", "=A", "b"},
                      LineRow{"BlanksAloneAreNoKey", "  =v", "", ""},
                      LineRow{"ALineWithoutEqualsSignIsIgnored", "KEY", "KEY", ""},
                      LineRow{"ALineEndsAtANul", std::string{"KEY=a\0b\xff", 8}, "KEY", "a"},
                      LineRow{"OtherBytesAreText", "K\x80\xff=\x01", "K\x80\xff", "\x01"},
                      LineRow{"ALongLineIsCut", "KEY=" + std::string(300, 'x'), "KEY",
                              std::string(295, 'x')},
                      LineRow{"TheRestOfALongLineIsALine",
                              "KEY=" + std::string(295, 'x') + "REST=1", "REST", "1"}),
    RowName{});

TEST_F(ConfigTest, TheDynamicFileIsReadDirectlyWithoutACopy) {
    for (const char* none : {"", "DYNAMIC_CONFIG_TMP=empty\n", "DYNAMIC_CONFIG_TMP=\n"}) {
        writeFile("dynamicconfig.ini", "KEY=dynamic\n");
        const std::string file =
            writeFile("static.ini", "KEY=static\nDYNAMIC_CONFIG=" + folder + "\n" + none);
        log.clear();
        EXPECT_TRUE(config.loadConfig(file));
        EXPECT_EQ(config.getProperty("KEY"), "dynamic");
        config.deleteProperty("KEY");
        EXPECT_EQ(config.getProperty("KEY"), "");
        expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                     {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                     {LOG_INFO, "OPENING dynamic config file for read: \n"},
                     {LOG_INFO, path("dynamicconfig.ini")},
                     {LOG_INFO, "LOADING dynamic config file settings.\n"}});
        EXPECT_TRUE(config.refresh());
        EXPECT_EQ(config.getProperty("KEY"), "dynamic");
    }
}

TEST_F(ConfigTest, ACopyIsMadeForAllProgramsAndReadWhenItChanges) {
    const mode_t before = umask(077);
    const std::string content = "KEY=" + std::string(400, 'x') + "\nLAST=without line end";
    EXPECT_TRUE(config.loadConfig(writeConfig(content)));
    umask(before);
    // The copy is looked at by the first lookups already, before it is made.
    expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                 {LOG_ERR, noCopy},
                 {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                 {LOG_INFO, "Loading TEMP dynamic config file.\n"},
                 {LOG_INFO, "Opening dynamic config file for copy.\n"},
                 {LOG_INFO, "Creating temp copy of dynamic config file.\n"},
                 {LOG_INFO, "Copying dynamic config file.\n"},
                 {LOG_INFO, "Re-opening TEMP dynamic config file.\n"}});
    EXPECT_EQ(readFile(copy), content);
    EXPECT_EQ(std::filesystem::status(copy).permissions(), std::filesystem::perms{0666});
    log.clear();
    EXPECT_EQ(config.getProperty("LAST"), "without line end");

    rewriteCopy("LAST=new\n");
    EXPECT_EQ(config.getProperty("DYNAMIC_CONFIG_TMP"), copy);
    expectLogIs({});
    EXPECT_EQ(config.getProperty("KEY"), std::string(295, 'x'));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    expectLogIs({{LOG_INFO, "Reload dynamicconfig.ini file.\n"}});

    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(readFile(copy), "LAST=new\n");

    std::filesystem::remove(copy);
    log.clear();
    EXPECT_EQ(config.getProperty("LAST"), "new");
    EXPECT_EQ(config.getProperty("ABSENT"), "");
    expectLogIs({{LOG_ERR, noCopy}, {LOG_ERR, noCopy}});
}

struct FailureRow {
    const char* name;
    const char* staticText;  // null: no static file
    const char* line;
};

class ConfigFailure : public ConfigTest, public ::testing::WithParamInterface<FailureRow> {};

TEST_P(ConfigFailure, IsLoggedAndReturned) {
    std::filesystem::current_path(folder);
    writeFile("dynamicconfig.ini", "KEY=v\n");
    if (GetParam().staticText != nullptr) writeFile("static.ini", GetParam().staticText);
    EXPECT_FALSE(config.loadConfig("static.ini"));
    log.clear();
    EXPECT_FALSE(config.refresh());
    EXPECT_EQ(log.lines().back(), (LogLine{LOG_ERR, GetParam().line}));
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    ConfigFailure,
    ::testing::Values(
        FailureRow{"NoStaticFile", nullptr,
                   "GlobalConfig::loadConfig() - failed to open config file: [static.ini].\n"},
        FailureRow{
            "AStaticFileWithoutASetting", "nothing\nhere\n",
            "GlobalConfig::loadConfigSettings() - failed to open config file: [static.ini].\n"},
        FailureRow{
            "NoDynamicFile", "DYNAMIC_CONFIG=gone\n",
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: [gone/dynamicconfig.ini].\n"},
        FailureRow{
            "NoDynamicFileToCopy", "DYNAMIC_CONFIG=gone\nDYNAMIC_CONFIG_TMP=copy.ini\n",
            "GlobalConfig::loadConfig() - failed to open dynamic config settings file: gone/dynamicconfig.ini\n"},
        FailureRow{
            "NoPlaceForTheCopy", "DYNAMIC_CONFIG=.\nDYNAMIC_CONFIG_TMP=gone/copy.ini\n",
            "GlobalConfig::loadConfig() - failed to create temporary dynamic config file: gone/copy.ini\n"}),
    RowName{});

TEST_F(ConfigTest, OnlyAWriteThroughTouchesTheStaticFile) {
    givenConfig({{"KEY", "old"}});
    const std::string before = readFile(path("static.ini"));
    EXPECT_EQ(config.setProperty("KEY", "new", false), "new");
    EXPECT_EQ(readFile(path("static.ini")), before);
    EXPECT_EQ(config.setProperty("A", "x", true), "x");
    EXPECT_EQ(readFile(path("static.ini")), before + "A=x\n");
    EXPECT_TRUE(commands.lines().empty());
    config.setProperty("KEY", "newer", true);
    EXPECT_EQ(commands.lines(),
              (std::vector<std::string>{"sed -i 's/KEY=new/KEY=newer/g' " + path("static.ini")}));
}

// Runs the real shell and the real sed: no character of a value means anything to either.
TEST_F(ConfigTest, AWriteThroughTakesValuesAsTheyAre) {
    const std::string odd = "it's $(touch hurt)";  // the path is quoted as well
    std::filesystem::create_directory(path(odd));
    writeFile("dynamicconfig.ini", "");
    commands.runForReal("sed");
    const std::vector<std::pair<std::string, std::string>> rows{
        {"http://a/b", "/c/d"},           {"a.*[x]^$\\", "plain"},
        {"ab.", "the dot is no pattern"}, {"plain", "a&b\\1\\n&"},
        {"it's", "'; touch hurt; '"},     {"$HOME `id`", "$(touch hurt) | \" ; > x"}};
    for (const auto& [before, after] : rows) {
        const std::string rest = "\nDYNAMIC_CONFIG=" + folder + "\nOLDX=1\n\n#KEY\nKEY=abx\n";
        const std::string file = writeFile(odd + "/static.ini", "KEY=" + before + rest);
        ASSERT_TRUE(config.loadConfig(file));
        config.setProperty("KEY", before, false);
        config.setProperty("KEY", after, true);
        EXPECT_EQ(readFile(file), "KEY=" + after + rest);
    }
}

TEST_F(ConfigTest, ASettingThatWouldDamageTheFileIsKeptInMemoryOnly) {
    givenConfig({{"KEY", "old"}});
    const std::string before = readFile(path("static.ini"));
    for (const std::string& value : {std::string(300, 'x'), std::string{"a\nB=1"}}) {
        for (const char* key : {"KEY", "NEW"}) {
            config.setProperty(key, std::string{key} == "KEY" ? "old" : "", false);
            log.clear();
            EXPECT_EQ(config.setProperty(key, value, true), value);
            EXPECT_EQ(log.lines().size(), 1U) << log.dump();
        }
    }
    EXPECT_EQ(readFile(path("static.ini")), before);
    EXPECT_TRUE(commands.lines().empty());
}

TEST_F(ConfigTest, AFileThatCannotBeAppendedToIsAnErrorLine) {
    EXPECT_FALSE(config.loadConfig(path("gone/static.ini")));
    parse("OTHER=1\n");
    EXPECT_EQ(config.setProperty("KEY", "v", true), "v");
    expectLogged(LOG_ERR, "GlobalConfig::setProperty() - failed to open config file: " +
                              path("gone/static.ini") + "\n");
}

}  // namespace
}  // namespace pelorus::support
