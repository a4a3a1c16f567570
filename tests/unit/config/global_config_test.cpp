#include "config/global_config.h"

#include <sys/inotify.h>
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
    // Loads a configuration with a copy.
    void load(const std::string& dynamicText, const std::string& more = "") {
        writeFile("dynamicconfig.ini", dynamicText);
        EXPECT_TRUE(config.loadConfig(writeFile("static.ini", inUse + more)));
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
    const std::string inUse = "DYNAMIC_CONFIG=" + folder + "\nDYNAMIC_CONFIG_TMP=" + copy + "\n";
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
    writeFile("dynamicconfig.ini", "KEY=dynamic\n=v\nNOTHING\n");
    for (const char* none : {"", "DYNAMIC_CONFIG_TMP=empty\n", "DYNAMIC_CONFIG_TMP=\n"}) {
        const std::string text = "KEY=static\nDYNAMIC_CONFIG=" + folder + "\n" + none;
        EXPECT_TRUE(config.loadConfig(writeFile("static.ini", text)));
        EXPECT_EQ(config.getProperty("KEY") + config.getProperty(""), "dynamic");
        EXPECT_EQ(log.texts().back(), "LOADING dynamic config file settings.\n");
    }
}

TEST_F(ConfigTest, ACopyIsMadeForAllProgramsAndReadWhenItChanges) {
    const std::string text = "KEY=" + std::string(295, 'x') + "REST=1\nLAST=without line end";
    umask(077);
    load(text);
    EXPECT_EQ(readFile(copy), text);
    EXPECT_EQ(fs::status(copy).permissions(), fs::perms{0666});
    EXPECT_EQ(config.getProperty("LAST"), "without line end");
    EXPECT_EQ(config.getProperty("REST"), "1") << "the rest of a long line is a line";
    rewriteCopy("LAST=new\n");
    EXPECT_EQ(config.getProperty("KEY"), std::string(295, 'x'));
    EXPECT_EQ(config.getProperty("LAST"), "new");
    fs::rename(copy, path("moved"));
    EXPECT_EQ(config.getProperty("LAST") + config.getProperty("ABSENT"), "new");
    fs::rename(path("moved"), copy);
    EXPECT_EQ(config.getProperty("LAST"), "new");
    // Each lookup but that of its path stats the copy, the first one before it exists.
    const std::string noCopy =
        "GlobalConfig::getProperty() - failed to stat TEMP dynamic config file: [" + copy + "].\n";
    EXPECT_EQ(
        log.texts(),
        (Texts{"Getting path for dynamic config file.\n", noCopy,
               "Getting path for TEMP dynamic config file.\n",
               "Loading TEMP dynamic config file.\n", "Opening dynamic config file for copy.\n",
               "Creating temp copy of dynamic config file.\n", "Copying dynamic config file.\n",
               "Re-opening TEMP dynamic config file.\n", "Reload dynamicconfig.ini file.\n", noCopy,
               noCopy}));
    EXPECT_TRUE(config.refresh());
    EXPECT_EQ(readFile(copy), "LAST=new\n");
    rewriteCopy("LAST=unreadable\n");
    FakeFiles::get().redirect(copy, "");
    EXPECT_EQ(config.getProperty("LAST"), "new");
}

TEST_F(ConfigTest, AStoreThatLostItsSettingsLoadsThemAgain) {
    EXPECT_FALSE(config.loadConfig(writeFile("static.ini", "KEY=v\n"))) << "no dynamic file";
    config.deleteProperty("KEY");
    EXPECT_EQ(config.knownProperty("KEY"), "");
    EXPECT_EQ(config.getProperty("KEY"), "v");
    config.deleteProperty("KEY");
    config.deleteProperty("OTHER");
    EXPECT_EQ(config.knownProperty("KEY"), "v");
    config.deleteProperty("KEY");
    config.setProperty("OTHER", "1", false);
    EXPECT_EQ(config.knownProperty("KEY"), "v");
}

TEST_F(ConfigTest, AFailedLoadIsNamedInTheLogAndLeavesNoCopy) {
    fs::current_path(folder);
    writeFile("dynamicconfig.ini", "KEY=v\n");
    EXPECT_FALSE(config.loadConfig("static.ini"));
    const auto row = [&](const auto& text, const std::string& line, rlim_t limit = RLIM_INFINITY) {
        writeFile("static.ini", text);
        limitFiles(limit);
        EXPECT_FALSE(config.refresh());
        limitFiles(RLIM_INFINITY);
        EXPECT_EQ(log.texts().back(), "GlobalConfig::loadConfig" + line + "\n");
        EXPECT_FALSE(fs::exists(copy));
    };
    const std::string noOpen = "() - failed to open dynamic config settings file: ";
    const std::string noCopy = "() - failed to create temporary dynamic config file: ";
    row("nothing\nhere\n", "Settings() - failed to open config file: [static.ini].");
    row("DYNAMIC_CONFIG=gone\n", noOpen + "[gone/dynamicconfig.ini].");
    fs::remove("dynamicconfig.ini");
    mkfifo("dynamicconfig.ini", 0666);  // planted to block
    row("DYNAMIC_CONFIG=.\n", noOpen + "[./dynamicconfig.ini].");
    row("DYNAMIC_CONFIG_TMP=copy.ini\n", noOpen + "./dynamicconfig.ini");
    fs::remove("dynamicconfig.ini");
    writeFile("dynamicconfig.ini", "KEY=v\n");
    row("DYNAMIC_CONFIG=.\nDYNAMIC_CONFIG_TMP=gone/copy.ini\n", noCopy + "gone/copy.ini");
    for (const std::size_t size : {100U, 10'000U}) {
        writeFile("dynamicconfig.ini", std::string(size, 'x') + "\nLAST=1\n");
        row(inUse, "() - failed to write temporary dynamic config file: " + copy, size / 2);
    }
    log.onLine([&](const LogLine& last) {
        if (last.text == "Re-opening TEMP dynamic config file.\n") fs::remove(copy);
    });
    row(inUse, "() - failed to open temp dynamic config settings file: [" + copy + "].");
}

TEST_F(ConfigTest, OnlyTheStaticFileSetsTheKeysItReserves) {
    load("STARTCMD=id\nKEY=v\nSTATIC_ONLY_KEYS=KEY\n",
         "STARTCMD=openvpn\nSTATIC_ONLY_KEYS=STARTCMD GONE\nSTATIC_ONLY_KEYS=OTHER\n");
    EXPECT_EQ(config.getProperty("KEY"), "v");
    for (const char* text : {"STARTCMD=id\n", "OTHER=id\nGONE=x\n"}) {
        rewriteCopy(text);
        EXPECT_EQ(config.getProperty("STARTCMD"), "openvpn");
    }
    EXPECT_EQ(config.getProperty("OTHER") + config.getProperty("GONE"), "");
    EXPECT_EQ(log.countPart("only the static config file may set STARTCMD, ignored.\n"), 1);
    EXPECT_EQ(log.countPart("only the static config file may set "), 3);
}

TEST_F(ConfigTest, APlantedCopyIsReplacedAtTheStartAndIgnoredLater) {
    fs::current_path(folder);
    writeFile("stolen.ini", "KEY=stolen\n");
    const std::function<void()> plants[]{[&] { mkfifo(copy.c_str(), 0666); },
                                         [&] { fs::create_symlink("/dev/zero", copy); },
                                         [&] { fs::create_symlink("stolen.ini", copy); },
                                         [&] { fs::create_symlink("target", copy); }};
    for (const auto& plant : plants) {
        fs::remove(copy);
        plant();
        load("KEY=v\n");
        EXPECT_EQ(fs::symlink_status(copy).permissions(), fs::perms{0666});
        EXPECT_FALSE(fs::exists("target"));
        fs::remove(copy);
        plant();
        EXPECT_EQ(config.getProperty("KEY"), "v");
    }
}

// What the daemon reads as the dynamic file, others read in the copy.
TEST_F(ConfigTest, NobodyCanLinkTheDynamicFileToWhatHeMayNotRead) {
    constexpr uid_t kBackEnd = 33;
    writeFile("static.ini", inUse);
    const std::string dynamic = path("dynamicconfig.ini");
    const auto isLoaded = [&](uid_t maker, uid_t owner, mode_t mode, const auto& link) {
        const std::string target = writeFile("target", "KEY=v\n");
        fs::remove(copy);
        fs::remove(dynamic);
        link(target);
        EXPECT_EQ(chmod(target.c_str(), mode) + chown(target.c_str(), owner, owner) +
                      lchown(dynamic.c_str(), maker, maker),
                  0);
        return config.loadConfig(path("static.ini"));
    };
    const auto symbolic = [&](const auto& /*target*/) { fs::create_symlink("target", dynamic); };
    const auto hard = [&](const auto& target) { fs::create_hard_link(target, dynamic); };
    if (geteuid() == 0) {
        const int opened = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
        const auto toForeign = [&](const std::string& target) {
            symbolic(target);
            inotify_add_watch(opened, target.c_str(), IN_OPEN);
        };
        EXPECT_FALSE(isLoaded(kBackEnd, 0, 0644, toForeign));
        inotify_event event{};
        EXPECT_EQ(read(opened, &event, sizeof event), -1) << "opening a device may do something";
        close(opened);
        EXPECT_TRUE(isLoaded(kBackEnd, kBackEnd, 0600, symbolic));
        EXPECT_TRUE(isLoaded(0, kBackEnd, 0600, symbolic));
    }
    EXPECT_FALSE(isLoaded(geteuid(), geteuid(), 0640, hard));
    EXPECT_TRUE(isLoaded(geteuid(), geteuid(), 0644, hard));
}

TEST_F(ConfigTest, AHugeCopyCostsNeitherTimeNorMemory) {
    load("KEY=v\n");
    rewriteCopy("KEY=w\n" + std::string(1'050'000, '\n') + "BEYOND=x\n");
    const auto rewritten = fs::last_write_time(copy);
    fs::resize_file(copy, 1'000'000'000);
    fs::last_write_time(copy, rewritten);
    EXPECT_EQ(config.getProperty("KEY") + config.getProperty("BEYOND"), "w");
    std::string many;
    for (int key = 0; key < 20'000; ++key) many += "K" + std::to_string(key) + "=x\n";
    rewriteCopy(many + "KEY=y\n");
    EXPECT_EQ(config.getProperty("K9000") + config.getProperty("K11000"), "x");
    EXPECT_EQ(config.getProperty("KEY"), "y");
    EXPECT_EQ(log.countPart("() - 10000 settings are the most, further ones ignored.\n"), 1);
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
    givenConfig();
    const std::string file = path("static.ini");
    const std::string before = readFile(file);
    for (const std::string& value : {std::string{"a\nB=1"}, std::string(297, 'x')}) {
        for (const std::string& key : {value.substr(0, 1), "ADDED" + value}) {
            EXPECT_EQ(config.setProperty(key, value, true), value);
        }
    }
    EXPECT_EQ(log.countPart("setting cannot be written to config file: " + file + "\n"), 4);
    EXPECT_EQ(readFile(file), before);
    config.setProperty("A", "x", true);
    EXPECT_EQ(readFile(file), before + "A=x\n");
    config.setProperty("A", "y", true);
    EXPECT_EQ(commands.lines(), std::vector<std::string>{"sed -i 's/A=x/A=y/g' " + file});
    log.clear();
    commands.answer("sed", "", 1);
    EXPECT_EQ(config.setProperty("A", "new", true), "new");
    limitFiles(static_cast<rlim_t>(fs::file_size(file)));
    EXPECT_EQ(config.setProperty("B", "x", true), "x");
    limitFiles(RLIM_INFINITY);
    FakeFiles::get().redirect(file, "");
    EXPECT_EQ(config.setProperty("C", "x", true), "x");
    const std::string noUpdate =
        "GlobalConfig::setProperty() - failed to update config file: " + file + "\n";
    const std::string noOpen =
        "GlobalConfig::setProperty() - failed to open config file: " + file + "\n";
    EXPECT_EQ(log.texts(), (Texts{noUpdate, noUpdate, noOpen}));
}

}  // namespace
}  // namespace pelorus::support
