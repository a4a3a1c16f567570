// Each case of a unit test binary in a process of its own, however many are selected: the daemon's
// singletons start fresh.
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace pelorus::support {

namespace {

bool passesAlone(const ::testing::TestInfo& test) {
    std::string binary = "/proc/self/exe";
    std::string filter =
        std::string{"--gtest_filter="} + test.test_suite_name() + "." + test.name();
    std::string brief = "--gtest_brief=1";
    char* const arguments[] = {binary.data(), filter.data(), brief.data(), nullptr};
    pid_t child = 0;
    int status = -1;
    if (posix_spawn(&child, binary.c_str(), nullptr, nullptr, arguments, environ) != 0)
        return false;
    return waitpid(child, &status, 0) == child && status == 0;
}

class OwnProcess : public ::testing::EmptyTestEventListener {
    void OnTestProgramStart(const ::testing::UnitTest& program) override {
        const int selected = program.test_to_run_count();
        if (selected <= 1) return;
        int failed = 0;
        for (int suite = 0; suite < program.total_test_suite_count(); ++suite) {
            const auto& tests = *program.GetTestSuite(suite);
            for (int index = 0; index < tests.total_test_count(); ++index) {
                const auto& test = *tests.GetTestInfo(index);
                if (test.should_run() && !passesAlone(test)) ++failed;
            }
        }
        std::printf("%d passed, %d failed\n", selected - failed, failed);
        std::fflush(nullptr);
        std::_Exit(failed == 0 ? EXIT_SUCCESS : EXIT_FAILURE);
    }
};

const bool kAdded = [] {
    ::testing::UnitTest::GetInstance()->listeners().Append(new OwnProcess);
    return true;
}();

}  // namespace

}  // namespace pelorus::support
