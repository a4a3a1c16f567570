#include "support/fake_files.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
std::FILE* __real_fopen(const char* path, const char* mode);
std::FILE* __wrap_fopen(const char* path, const char* mode);
}
// NOLINTEND(bugprone-reserved-identifier)

namespace pelorus::support {

namespace {

// googletest and the fuzzer open files of their own.
bool isOfTheRunner(const char* path) {
    return testing::UnitTest::GetInstance()->current_test_info() == nullptr ||
           std::strstr(path, "gtest_captured_stream") != nullptr;
}

}  // namespace

FakeFiles::FakeFiles() {
    reset();
}

FakeFiles& FakeFiles::get() {
    static FakeFiles instance;
    return instance;
}

void FakeFiles::redirect(const std::string& path, const std::string& target) {
    targets[path] = target;
}

void FakeFiles::reset() {
    targets = {{kIdleMinutesFile, ""}};
}

std::FILE* FakeFiles::open(const char* path, const char* mode) {
    EXPECT_TRUE(isOfTheRunner(path) || std::strchr(mode, 'e') != nullptr)
        << path << " is inherited by children";
    const auto found = targets.find(path);
    if (found == targets.end()) return __real_fopen(path, mode);
    if (!found->second.empty()) return __real_fopen(found->second.c_str(), mode);
    errno = ENOENT;
    return nullptr;
}

}  // namespace pelorus::support

// NOLINTNEXTLINE(bugprone-reserved-identifier): a name the linker gives
std::FILE* __wrap_fopen(const char* path, const char* mode) {
    return pelorus::support::FakeFiles::get().open(path, mode);
}
