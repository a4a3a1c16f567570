#include "doctor/doctor_options.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <set>
#include <sstream>

namespace pelorus::doctor {
namespace {

std::string describe(const DoctorOptions& options) {
    std::string text;
    for (const std::string& log : options.logs) text += "log=" + log + " ";
    if (!options.probes) text += "files ";
    if (options.askService) text += "ask ";
    if (options.settingsOnly) text += "settings ";
    if (options.json) text += "json ";
    if (options.share) text += "share ";
    if (!options.picture.empty()) text += "svg=" + options.picture + " ";
    return text + (options.exitStatus ? "exit" : "");
}

TEST(DoctorOptions, AreReadOrRefusedInOneLine) {
    struct Row {
        const char *arguments, *wanted, *complaint;
    };
    // Two names of one file: a log must not be overwritten by the picture of it.
    const std::string log = testing::TempDir() + "pelorus-doctor-options.log", link = log + ".svg";
    std::ofstream{log} << "<?xml";
    unlink(link.c_str());
    ASSERT_EQ(symlink(log.c_str(), link.c_str()), 0);
    const std::string overwrites = "--log a --log " + log + " --svg " + link;
    const std::string notPicture = "--svg " + log;
    const std::string drawn = testing::TempDir() + "pelorus-doctor-options.svg";
    std::ofstream{drawn} << "<svg ";
    const std::string picture = "--svg " + drawn, picturePath = "svg=" + drawn + " ";
    const Row rows[]{{"", "", ""},
                     {overwrites.c_str(), "", "--svg would overwrite a log"},
                     {notPicture.c_str(), "", "--svg would overwrite a file that is no picture"},
                     {picture.c_str(), picturePath.c_str(), ""},
                     {"--s", "", "ambiguous option: --s"},
                     {"--log a --log - --no-probes --json --svg b --share",
                      "log=a log=- files json share svg=b ", ""},
                     {"--ask-service --log=c", "log=c ask ", ""},
                     {"--settings --share", "settings share ", ""},
                     {"-x", "", "no such option: -x"},
                     {"--bad", "", "no such option: --bad"},
                     {"--json=1", "", "no such option: --json=1"},
                     {"--log", "", "--log needs a file"},
                     {"--svg=", "", "the name of a file is empty"},
                     {"file --json", "", "unexpected argument: file"},
                     {"--no-probes --ask-service", "",
                      "--ask-service is a probe, it does not go with --no-probes"},
                     {"--settings --json", "", "--settings goes only with --share"}};
    for (const Row& row : rows) {
        std::vector<std::string> words{"pelorus-doctor"};
        std::istringstream stream{row.arguments};
        for (std::string word; stream >> word;) words.push_back(word);
        std::vector<char*> arguments;
        for (std::string& word : words) arguments.push_back(word.data());
        arguments.push_back(nullptr);
        testing::internal::CaptureStderr();
        const auto options = parseDoctorOptions(static_cast<int>(words.size()), arguments.data());
        const std::string complaint = testing::internal::GetCapturedStderr();
        if (*row.complaint == '\0') {
            EXPECT_EQ(describe(options), row.wanted);
            EXPECT_EQ(complaint, "");
        } else {
            EXPECT_EQ(options.exitStatus, kWrongUsage) << row.arguments;
            EXPECT_EQ(complaint, "pelorus-doctor: " + std::string{row.complaint} +
                                     ", see pelorus-doctor --help\n");
        }
    }
}

TEST(DoctorOptions, HelpThatCannotBeWrittenIsAFailure) {
    std::string name = "pelorus-doctor", option = "--help";
    char* arguments[]{name.data(), option.data(), nullptr};
    EXPECT_EXIT(
        {
            const bool isFull = std::freopen("/dev/full", "w", stdout) != nullptr;
            std::_Exit(isFull ? parseDoctorOptions(2, arguments).exitStatus.value_or(0) : 1);
        },
        testing::ExitedWithCode(kNotWritten), "cannot write to standard output");
}

std::string readFile(const std::string& name) {
    std::ifstream file{std::string{PELORUS_SOURCES} + "/../" + name};
    return {std::istreambuf_iterator<char>{file}, {}};
}

std::set<std::string> optionsIn(std::string text) {
    text.erase(std::remove(text.begin(), text.end(), '\\'), text.end());  // of the man page
    std::set<std::string> options;
    for (auto at = text.find("--"); at != std::string::npos; at = text.find("--", at)) {
        const auto end = text.find_first_not_of("-abcdefghijklmnopqrstuvwxyz", at);
        const auto option = text.substr(at, end - at);
        if (option.size() > 2 && option[2] != '-') options.insert(option);
        at += option.size();
    }
    return options;
}

TEST(DoctorOptions, HelpManPageAndCompletionNameAll) {
    const std::set<std::string> all{"--ask-service", "--help",  "--json", "--log",    "--no-probes",
                                    "--settings",    "--share", "--svg",  "--version"};
    std::string name = "pelorus-doctor", option = "--help";
    char* arguments[]{name.data(), option.data(), nullptr};
    testing::internal::CaptureStdout();
    EXPECT_EQ(parseDoctorOptions(2, arguments).exitStatus, 0);
    EXPECT_EQ(optionsIn(testing::internal::GetCapturedStdout()), all);
    EXPECT_EQ(optionsIn(readFile("packaging/pelorus-doctor.8")), all);
    EXPECT_EQ(optionsIn(readFile("packaging/pelorus-doctor.bash")), all);
    const std::set<std::string> explained = optionsIn(readFile("docs/doctor.md"));
    EXPECT_TRUE(std::includes(explained.begin(), explained.end(), all.begin(), all.end()));
}

}  // namespace
}  // namespace pelorus::doctor
