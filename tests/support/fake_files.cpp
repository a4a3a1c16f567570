#include "support/fake_files.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string_view>

using namespace std::string_view_literals;
using pelorus::support::FakeFiles;
using pelorus::support::FakeProcess;

namespace {

const char* targetOf(const char* path) {
    const auto& targets = FakeFiles::get().targets;
    const auto found = targets.find(path);
    return found == targets.end() ? path : found->second.c_str();
}

// True, and errno set, when the test wants it to fail.
bool openFails(const char* path, bool forWriting) {
    const auto& hook = FakeFiles::get().onOpen;
    const int error = hook ? hook(path, forWriting) : 0;
    if (error != 0) errno = error;
    return error != 0;
}

bool fails(const char* call) {
    errno = EPERM;
    return FakeProcess::get().failing.count(call) != 0;
}

// GoogleTest opens files of its own, between tests and to capture output.
void checkCloseOnExec(bool closes, const char* path) {
    if (::testing::UnitTest::GetInstance()->current_test_info() == nullptr) return;
    EXPECT_TRUE(closes || std::strstr(path, "/gtest_") != nullptr || path == "/dev/null"sv)
        << "child inherits: " << path;
}

}  // namespace

extern "C" {
std::FILE* __real_fopen(const char* path, const char* mode);
int __real_unlink(const char* path);
pid_t __real_fork();
pid_t __real_setsid();
int __real_chdir(const char* path);
int __real_open(const char* path, int flags, ...);
int __real_kill(pid_t pid, int signal);

std::FILE* __wrap_fopen(const char* path, const char* mode) {
    checkCloseOnExec(std::strchr(mode, 'e') != nullptr, path);
    if (openFails(path, std::strchr(mode, 'r') == nullptr)) return nullptr;
    return __real_fopen(targetOf(path), mode);
}

int __wrap_open(const char* path, int flags, ...) {
    va_list args;
    va_start(args, flags);
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(args, mode_t) : 0;
    va_end(args);
    checkCloseOnExec((flags & O_CLOEXEC) != 0, path);
    if (openFails(path, (flags & O_ACCMODE) != O_RDONLY)) return -1;
    return __real_open(targetOf(path), flags, mode);
}

int __wrap_unlink(const char* path) {
    const int result = __real_unlink(targetOf(path));
    int& replants = FakeFiles::get().replants;
    if (replants > 0) {
        --replants;
        close(__real_open(targetOf(path), O_CREAT | O_CLOEXEC, 0666));
    }
    return result;
}

pid_t __wrap_fork() {
    return fails("fork") ? -1 : __real_fork();
}

pid_t __wrap_setsid() {
    return fails("setsid") ? -1 : __real_setsid();
}

int __wrap_chdir(const char* path) {
    return fails("chdir") ? -1 : __real_chdir(path);
}

// How the linker calls the start of a std::thread.
#define START_THREAD(prefix) \
    prefix##_ZNSt6thread15_M_start_threadESt10unique_ptrINS_6_StateESt14default_deleteIS1_EEPFvvE
void START_THREAD(__real_)(void* thread, void* state, void (*depend)());
void START_THREAD(__wrap_)(void* thread, void* state, void (*depend)()) {
    if (FakeProcess::get().startsThreads) START_THREAD(__real_)(thread, state, depend);
}

int __wrap_kill(pid_t pid, int signal) {
    FakeProcess& process = FakeProcess::get();
    if (pid != getpid()) return __real_kill(pid, signal);
    process.selfKills.push_back(signal);
    if (process.onSelfKill) process.onSelfKill();
    return process.killForReal ? __real_kill(pid, signal) : 0;
}
}
