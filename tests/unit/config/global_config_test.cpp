#include "config/global_config.h"

#include <sys/resource.h>
#include <sys/stat.h>

#include <filesystem>

#include "config/setting_line.h"
#include "support/fake_files.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;

class ConfigTest : public PelorusTest {
protected:
    // Writes both files with a temporary copy in use; returns the path of the static one.
    std::string writeConfig(const std::string& dynamicText) {
        writeFile("dynamicconfig.ini", dynamicText);
        return writeFile("static.ini",
                         "DYNAMIC_CONFIG=" + folder + "\nDYNAMIC_CONFIG_TMP=" + copy + "\n");
    }
    // As another program would, at another second: even an earlier one counts as a change.
    void rewriteCopy(const std::string& text) {
        const auto before = fs::last_write_time(copy);
        writeFile("copy.ini", text);
        fs::last_write_time(copy, before - std::chrono::seconds{7});
    }
    // A full disk: files cannot grow beyond this size until the end of the test.
    static void limitFiles(rlim_t size) {
        std::signal(SIGXFSZ, SIG_IGN);
        rlimit limit{};
        getrlimit(RLIMIT_FSIZE, &limit);
        limit.rlim_cur = size;
        setrlimit(RLIMIT_FSIZE, &limit);
    }

    GlobalConfig& config = *GlobalConfig::getInstance();
    const std::string copy = path("copy.ini");
};

TEST(SettingLine, IsSplitIntoKeyAndValue) {
    const char* const rows[][3]{{" \t KEY= \tvalue \t\n", "KEY", "value"},
                                {"KEY = v", "KEY ", "v"},
                                {"KEY=\"a \"b\" \"", "KEY", "a \"b"},
                                {"KEY=\"v\"\r\n", "KEY", "v\"\r"},
                                {"KEY= \"\" \n", "KEY", ""},
                                {"=A=b=c", "=A", "b=c"},
                                {"  =v", "", "v"},
                                {"KEY\n", "", ""}};
    for (const auto& [line, key, value] : rows) {
        EXPECT_EQ(parseSettingLine(line).key, key) << line;
        EXPECT_EQ(parseSettingLine(line).value, value) << line;
    }
}

TEST_F(ConfigTest, TheDynamicFileIsReadDirectlyWithoutACopy) {
    for (const char* none : {"", "DYNAMIC_CONFIG_TMP=empty\n", "DYNAMIC_CONFIG_TMP=\n"}) {
        writeFile("dynamicconfig.ini", "KEY=dynamic\n=v\nNOTHING\n");
        const std::string file =
            writeFile("static.ini", "KEY=static\nDYNAMIC_CONFIG=" + folder + "\n" + none);
        log.clear();
        EXPECT_TRUE(config.loadConfig(file));
        EXPECT_EQ(config.getProperty("KEY") + config.getProperty(""), "dynamic");
        expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                     {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                     {LOG_INFO, "OPENING dynamic config file for read: \n"},
                     {LOG_INFO, path("dynamicconfig.ini")},
                     {LOG_INFO, "LOADING dynamic config file settings.\n"}});
    }
}

TEST_F(ConfigTest, ACopyIsMadeForAllProgramsAndReadWhenItChanges) {
    const std::string noCopy =
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n";
    const mode_t before = umask(077);
    const std::string content = "KEY=" + std::string(295, 'x') + "REST=1\nLAST=without line end";
    EXPECT_TRUE(config.loadConfig(writeConfig(content)));
    umask(before);
    EXPECT_EQ(readFile(copy), content);
    EXPECT_EQ(fs::status(copy).permissions(), fs::perms{0666});
    EXPECT_EQ(config.getProperty("LAST"), "without line end");
    EXPECT_EQ(config.getProperty("REST"), "1") << "the rest of a long line is a line";
    rewriteCopy("LAST=new\n");
    EXPECT_EQ(config.getProperty("DYNAMIC_CONFIG_TMP"), copy);
    // The first lookups stat the copy before it exists; that of its path looks for no change.
    expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                 {LOG_ERR, noCopy},
                 {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                 {LOG_INFO, "Loading TEMP dynamic config file.\n"},
                 {LOG_INFO, "Opening dynamic config file for copy.\n"},
                 {LOG_INFO, "Creating temp copy of dynamic config file.\n"},
                 {LOG_INFO, "Copying dynamic config file.\n"},
                 {LOG_INFO, "Re-opening TEMP dynamic config file.\n"}});
    log.clear();
    EXPECT_EQ(config.getProperty("KEY"), std::string(295, 'x'));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    fs::rename(copy, path("moved"));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    EXPECT_EQ(config.getProperty("ABSENT"), "");
    fs::rename(path("moved"), copy);
    EXPECT_EQ(config.getProperty("LAST"), "new");
    expectLogIs(
        {{LOG_INFO, "Reload dynamicconfig.ini file.\n"}, {LOG_ERR, noCopy}, {LOG_ERR, noCopy}});
    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(readFile(copy), "LAST=new\n");
    rewriteCopy("LAST=unreadable\n");
    FakeFiles::get().redirect(copy, "");
    EXPECT_EQ(config.getProperty("LAST"), "new");
}

TEST_F(ConfigTest, AStoreThatLostItsSettingsLoadsThemAgain) {
    const std::function<void()> uses[]{[&] { config.setProperty("NEW", "1", false); },
                                       [&] { config.deleteProperty("NEW"); },
                                       [&] { EXPECT_EQ(config.getProperty("KEY"), "v"); }};
    for (const auto& use : uses) {
        EXPECT_TRUE(config.loadConfig(writeConfig("KEY=v\n")));
        for (const char* key : {"DYNAMIC_CONFIG", "DYNAMIC_CONFIG_TMP", "KEY", "NEW"}) {
            config.deleteProperty(key);
        }
        use();
        EXPECT_EQ(config.knownProperty("KEY"), "v");
    }
}

TEST_F(ConfigTest, AFailedLoadIsNamedInTheLogAndLeavesNoCopy) {
    fs::current_path(folder);
    writeFile("dynamicconfig.ini", "KEY=v\n");
    EXPECT_FALSE(config.loadConfig("static.ini"));
    const auto row = [&](const std::string& text, const std::string& line) {
        writeFile("static.ini", text);
        EXPECT_FALSE(config.refresh());
        EXPECT_EQ(log.lines().back(), (LogLine{LOG_ERR, "GlobalConfig::loadConfig" + line + "\n"}));
        EXPECT_FALSE(fs::exists(copy));
    };
    const std::string inUse = "DYNAMIC_CONFIG=.\nDYNAMIC_CONFIG_TMP=";
    // clang-format off
    row("nothing\nhere\n", "Settings() - failed to open config file: [static.ini].");
    row("DYNAMIC_CONFIG=gone\n", "() - failed to open dynamic config settings file: [gone/dynamicconfig.ini].");
    row("DYNAMIC_CONFIG_TMP=copy.ini\n", "() - failed to open dynamic config settings file: gone/dynamicconfig.ini");
    row(inUse + "gone/copy.ini\n", "() - failed to create temporary dynamic config file: gone/copy.ini");
    for (const std::size_t size : {100U, 10'000U}) {
        writeFile("dynamicconfig.ini", std::string(size, 'x') + "\nLAST=1\n");
        limitFiles(size / 2);
        row(inUse + "copy.ini", "() - failed to write temporary dynamic config file: copy.ini");
        limitFiles(RLIM_INFINITY);
    }
    log.onLine([&](const LogLine& last) {
        if (last.text == "Re-opening TEMP dynamic config file.\n") fs::remove(copy);
    });
    row(inUse + "copy.ini", "() - failed to open temp dynamic config settings file: [copy.ini].");
    // clang-format on
}

// Runs the real shell and the real sed: no character of a value means anything to either.
TEST_F(ConfigTest, AWriteThroughTakesValuesAsTheyAre) {
    const std::string file = path("it's $(touch hurt)");
    commands.realPart = "sed";
    const std::string rest = "\nOLDX=1\n\n#KEY\nKEY=abx\n";
    std::string before = "plain";
    for (const char* value : {"http://a/b", "a.*[x]^$\\", "ab.", "a&b\\1\\n&", "it's",
                              "'; touch hurt; '", "$HOME `id` | \" ; > x", "last"}) {
        writeFile("it's $(touch hurt)", "KEY=" + before + rest);
        EXPECT_FALSE(config.loadConfig(file)) << "there is no dynamic file";
        config.setProperty("KEY", before, false);
        before = config.setProperty("KEY", value, true);
        EXPECT_EQ(readFile(file), "KEY=" + before + rest);
    }
}

TEST_F(ConfigTest, OnlyAWriteThroughThatFitsTouchesTheStaticFile) {
    givenConfig({{"KEY", "old"}});
    const std::string file = path("static.ini");
    const std::string before = readFile(file);
    for (const std::string& value : {std::string(300, 'x'), std::string{"a\nB=1"}}) {
        EXPECT_EQ(config.setProperty("KEY", "new", false), "new");
        EXPECT_EQ(config.setProperty("KEY", value, true), value);
        EXPECT_EQ(config.setProperty("ADDED" + value, value, true), value);
    }
    EXPECT_EQ(log.countPart("setting cannot be written to config file: " + file + "\n"), 4);
    EXPECT_EQ(readFile(file), before);
    config.setProperty("A", "x", true);
    EXPECT_EQ(readFile(file), before + "A=x\n");
    config.setProperty("A", "y", true);
    EXPECT_EQ(commands.lines(), (std::vector<std::string>{"sed -i 's/A=x/A=y/g' " + file}));
    log.clear();
    commands.answer("sed", "", 1);
    EXPECT_EQ(config.setProperty("A", "new", true), "new");
    limitFiles(static_cast<rlim_t>(fs::file_size(file)));
    EXPECT_EQ(config.setProperty("B", "x", true), "x");
    limitFiles(RLIM_INFINITY);
    const std::string error = "GlobalConfig::setProperty() - failed to ";
    const LogLine notUpdated{LOG_ERR, error + "update config file: " + file + "\n"};
    FakeFiles::get().redirect(file, "");
    EXPECT_EQ(config.setProperty("C", "x", true), "x");
    expectLogIs({notUpdated, notUpdated, {LOG_ERR, error + "open config file: " + file + "\n"}});
}

}  // namespace
}  // namespace pelorus::support
