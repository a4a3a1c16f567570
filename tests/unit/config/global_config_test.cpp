#include "config/global_config.h"

#include <sys/resource.h>
#include <sys/stat.h>

#include <filesystem>

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
    LogLine lastLine() { return log.lines().back(); }

    GlobalConfig& config = *GlobalConfig::getInstance();
    const std::string copy = path("copy.ini");
    const std::string noCopy =
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n";
};

TEST_F(ConfigTest, TheDynamicFileIsReadDirectlyWithoutACopy) {
    for (const char* none : {"", "DYNAMIC_CONFIG_TMP=empty\n", "DYNAMIC_CONFIG_TMP=\n"}) {
        writeFile("dynamicconfig.ini", "KEY=dynamic\n=v\nNOTHING\n");
        const std::string file =
            writeFile("static.ini", "KEY=static\nDYNAMIC_CONFIG=" + folder + "\n" + none);
        log.clear();
        EXPECT_TRUE(config.loadConfig(file));
        EXPECT_EQ(config.getProperty("KEY"), "dynamic");
        EXPECT_EQ(config.getProperty(""), "");
        expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                     {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                     {LOG_INFO, "OPENING dynamic config file for read: \n"},
                     {LOG_INFO, path("dynamicconfig.ini")},
                     {LOG_INFO, "LOADING dynamic config file settings.\n"}});
        config.deleteProperty("KEY");
        EXPECT_EQ(config.getProperty("KEY"), "");
        EXPECT_TRUE(config.refresh());
        EXPECT_EQ(config.getProperty("KEY"), "dynamic");
    }
}

TEST_F(ConfigTest, ACopyIsMadeForAllProgramsAndReadWhenItChanges) {
    const mode_t before = umask(077);
    const std::string content = "KEY=" + std::string(295, 'x') + "REST=1\nLAST=without line end";
    EXPECT_TRUE(config.loadConfig(writeConfig(content)));
    umask(before);
    // The first lookups stat the copy before it exists.
    expectLogIs({{LOG_INFO, "Getting path for dynamic config file.\n"},
                 {LOG_ERR, noCopy},
                 {LOG_INFO, "Getting path for TEMP dynamic config file.\n"},
                 {LOG_INFO, "Loading TEMP dynamic config file.\n"},
                 {LOG_INFO, "Opening dynamic config file for copy.\n"},
                 {LOG_INFO, "Creating temp copy of dynamic config file.\n"},
                 {LOG_INFO, "Copying dynamic config file.\n"},
                 {LOG_INFO, "Re-opening TEMP dynamic config file.\n"}});
    EXPECT_EQ(readFile(copy), content);
    EXPECT_EQ(fs::status(copy).permissions(), fs::perms{0666});
    log.clear();
    EXPECT_EQ(config.getProperty("LAST"), "without line end");
    EXPECT_EQ(config.getProperty("REST"), "1") << "the rest of a long line is a line";

    rewriteCopy("LAST=new\n");
    EXPECT_EQ(config.getProperty("DYNAMIC_CONFIG_TMP"), copy);
    expectLogIs({});
    EXPECT_EQ(config.getProperty("KEY"), std::string(295, 'x'));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    expectLogIs({{LOG_INFO, "Reload dynamicconfig.ini file.\n"}});

    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(readFile(copy), "LAST=new\n");

    log.clear();
    fs::rename(copy, path("moved"));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    EXPECT_EQ(config.getProperty("ABSENT"), "");
    fs::rename(path("moved"), copy);
    EXPECT_EQ(config.getProperty("LAST"), "new");
    expectLogIs({{LOG_ERR, noCopy}, {LOG_ERR, noCopy}});

    rewriteCopy("LAST=unreadable\n");
    FakeFiles::get().redirect(copy, "");
    EXPECT_EQ(config.getProperty("LAST"), "new");
}

TEST_F(ConfigTest, AnIncompleteCopyIsRemoved) {
    const std::string line =
        "GlobalConfig::loadConfig() - failed to write temporary dynamic config file: " + copy;
    for (const std::size_t size : {100U, 10'000U}) {
        const std::string file = writeConfig(std::string(size, 'x') + "\nLAST=1\n");
        limitFiles(50);
        EXPECT_FALSE(config.loadConfig(file));
        limitFiles(RLIM_INFINITY);
        EXPECT_EQ(lastLine(), (LogLine{LOG_ERR, line + "\n"}));
        EXPECT_FALSE(fs::exists(copy));
    }
    log.onLine([&](const LogLine& last) {
        if (last.text == "Re-opening TEMP dynamic config file.\n") fs::remove(copy);
    });
    EXPECT_FALSE(config.refresh()) << "nor is there one to read";
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

TEST_F(ConfigTest, AFileThatIsMissingIsNamedInTheLog) {
    fs::current_path(folder);
    writeFile("dynamicconfig.ini", "KEY=v\n");
    EXPECT_FALSE(config.loadConfig("static.ini"));
    const std::vector<std::pair<const char*, const char*>> rows{
        {"nothing\nhere\n",
         "GlobalConfig::loadConfigSettings() - failed to open config file: [static.ini].\n"},
        {"DYNAMIC_CONFIG=gone\n",
         "GlobalConfig::loadConfig() - failed to open dynamic config settings file: [gone/dynamicconfig.ini].\n"},
        {"DYNAMIC_CONFIG_TMP=copy.ini\n",
         "GlobalConfig::loadConfig() - failed to open dynamic config settings file: gone/dynamicconfig.ini\n"},
        {"DYNAMIC_CONFIG=.\nDYNAMIC_CONFIG_TMP=gone/copy.ini\n",
         "GlobalConfig::loadConfig() - failed to create temporary dynamic config file: gone/copy.ini\n"}};
    for (const auto& [text, line] : rows) {
        writeFile("static.ini", text);
        EXPECT_FALSE(config.refresh());
        EXPECT_EQ(lastLine(), (LogLine{LOG_ERR, line}));
    }
}

// Runs the real shell and the real sed: no character of a value means anything to either.
TEST_F(ConfigTest, AWriteThroughTakesValuesAsTheyAre) {
    const std::string file = path("it's $(touch hurt)");
    commands.runForReal("sed");
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
    EXPECT_EQ(config.setProperty("KEY", "new", false), "new");
    for (const std::string& value : {std::string(300, 'x'), std::string{"a\nB=1"}}) {
        for (const char* key : {"KEY", "ADDED"}) {
            config.setProperty(key, std::string{key} == "KEY" ? "new" : "", false);
            log.clear();
            EXPECT_EQ(config.setProperty(key, value, true), value);
            EXPECT_EQ(log.lines().size(), 1U) << log.dump();
        }
    }
    EXPECT_TRUE(commands.lines().empty());
    EXPECT_EQ(readFile(file), before);
    config.setProperty("A", "x", true);
    EXPECT_EQ(readFile(file), before + "A=x\n");
    config.setProperty("A", "y", true);
    EXPECT_EQ(commands.lines(), (std::vector<std::string>{"sed -i 's/A=x/A=y/g' " + file}));
    EXPECT_EQ(log.lines().size(), 1U) << "only the failures are logged";
}

TEST_F(ConfigTest, AFailedWriteIsLoggedAndTheValueKept) {
    givenConfig({{"KEY", "old"}});
    const std::string file = path("static.ini");
    const LogLine notUpdated{
        LOG_ERR, "GlobalConfig::setProperty() - failed to update config file: " + file + "\n"};
    commands.answer("sed", "", 1);
    EXPECT_EQ(config.setProperty("KEY", "new", true), "new");
    expectLogIs({notUpdated});
    limitFiles(static_cast<rlim_t>(fs::file_size(file)));
    EXPECT_EQ(config.setProperty("A", "x", true), "x");
    limitFiles(RLIM_INFINITY);
    expectLogIs({notUpdated, notUpdated});
    FakeFiles::get().redirect(file, "");
    EXPECT_EQ(config.setProperty("B", "x", true), "x");
    EXPECT_EQ(lastLine(),
              (LogLine{LOG_ERR, "GlobalConfig::setProperty() - failed to open config file: " +
                                    file + "\n"}));
}

}  // namespace
}  // namespace pelorus::support
