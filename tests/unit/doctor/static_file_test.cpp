#include "doctor/static_file.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;

// A machine whose processes are files, with both the built-in and the packaged settings.
class StaticFileTest : public PelorusTest {
protected:
    StaticFileTest() {
        unsetenv("TAVIK_STATIC_CONFIG");
        writeFile("built-in", "");
        writeFile("packaged", "");
    }

    void daemonWith(const std::string& environment) const {
        fs::create_directories(path("proc/812"));
        writeFile("proc/812/stat",
                  "812 (pelorus) S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 9 0");
        writeFile("proc/812/comm", "pelorus\n");
        writeFile("proc/812/environ", environment);
        writeFile("pid", "812");
    }

    [[nodiscard]] doctor::StaticFile find() const {
        return doctor::findStaticFile(
            {path("proc"), path("pid"), path("defaults"), path("built-in"), path("packaged")});
    }
    [[nodiscard]] std::string found() const {
        const std::string file = find().path;
        return file.rfind(path(""), 0) == 0 ? file.substr(path("").size()) : file;
    }
};

TEST_F(StaticFileTest, TheNearestToTheDaemonCounts) {
    EXPECT_EQ(found(), "built-in");
    writeFile("defaults", "#TAVIK_STATIC_CONFIG=/no\nTAVIK_STATIC_CONFIG=\"/of the/service\" \n");
    EXPECT_EQ(found(), "/of the/service") << "the daemon knows no other, even if it is missing";
    writeFile("named", "");
    writeFile("defaults", "TAVIK_STATIC_CONFIG=" + path("named") + "\n");
    EXPECT_EQ(found(), "named");

    writeFile("of daemon", "");
    const std::string assigned = "TAVIK_STATIC_CONFIG=" + path("of daemon");
    daemonWith(std::string{"PATH=/bin"} + '\0' + assigned + '\0');
    EXPECT_EQ(found(), "of daemon");
    daemonWith(std::string{"PATH=/bin"} + '\0' + "X" + assigned + '\0');
    EXPECT_EQ(found(), "built-in");
    fs::remove(path("proc/812/environ"));
    EXPECT_EQ(found(), "named");

    setenv("TAVIK_STATIC_CONFIG", path("packaged").c_str(), 1);
    EXPECT_EQ(found(), "packaged");
    setenv("TAVIK_STATIC_CONFIG", "", 1);
    EXPECT_EQ(found(), "");
    unsetenv("TAVIK_STATIC_CONFIG");
}

TEST_F(StaticFileTest, ThePackagedOneStandsInForAMissingOne) {
    EXPECT_EQ(find().remark, "");
    fs::remove(path("built-in"));
    EXPECT_EQ(found(), "packaged");
    EXPECT_TRUE(holds(find().remark, "TAVIK_STATIC_CONFIG is not set and " + path("built-in")));
    fs::remove(path("packaged"));
    EXPECT_EQ(found(), "built-in");
}

TEST_F(StaticFileTest, OneThatMayNotBeLookedAtIsNotMissing) {
    constexpr uid_t kNobody = 65534;
    fs::permissions(folder, fs::perms{0711});
    fs::create_directory(path("closed"));
    fs::permissions(path("closed"), fs::perms::none);
    const uid_t user = getuid();
    ASSERT_TRUE(user != 0 || setresuid(kNobody, kNobody, 0) == 0);
    const auto file = doctor::findStaticFile(
        {path("proc"), path("pid"), path("defaults"), path("closed/built-in"), path("packaged")});
    ASSERT_EQ(setresuid(user, user, user), 0);
    EXPECT_EQ(file.path, path("closed/built-in"));
    fs::permissions(path("closed"), fs::perms::owner_all);
}

}  // namespace
}  // namespace pelorus::support
