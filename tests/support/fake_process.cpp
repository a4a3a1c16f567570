#include "support/fake_process.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdarg>

namespace pelorus::support {

FakeProcess& FakeProcess::get() {
    static FakeProcess instance;
    return instance;
}

}  // namespace pelorus::support

using pelorus::support::FakeProcess;

namespace {

bool fails(const char* call) {
    errno = EPERM;
    return FakeProcess::get().failing.count(call) != 0;
}

}  // namespace

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
pid_t __real_fork();
pid_t __real_setsid();
int __real_chdir(const char* path);
int __real_open(const char* path, int flags, ...);
int __real_kill(pid_t pid, int signal);

pid_t __wrap_fork() {
    return fails("fork") ? -1 : __real_fork();
}

pid_t __wrap_setsid() {
    return fails("setsid") ? -1 : __real_setsid();
}

int __wrap_chdir(const char* path) {
    return fails("chdir") ? -1 : __real_chdir(path);
}

int __wrap_open(const char* path, int flags, ...) {
    va_list args;
    va_start(args, flags);
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(args, mode_t) : 0;
    va_end(args);
    const auto& targets = FakeProcess::get().targets;
    const auto found = targets.find(path);
    return __real_open(found == targets.end() ? path : found->second.c_str(), flags, mode);
}

int __wrap_kill(pid_t pid, int signal) {
    FakeProcess& process = FakeProcess::get();
    if (pid != getpid()) return __real_kill(pid, signal);
    process.selfKills.push_back(signal);
    return process.killForReal ? __real_kill(pid, signal) : 0;
}
}
// NOLINTEND(bugprone-reserved-identifier)
