#include "support/fake_process.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdarg>

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
pid_t __real_fork();
pid_t __real_setsid();
int __real_chdir(const char* path);
int __real_open(const char* path, int flags, ...);
int __real_kill(pid_t pid, int signal);
pid_t __wrap_fork();
pid_t __wrap_setsid();
int __wrap_chdir(const char* path);
int __wrap_open(const char* path, int flags, ...);
int __wrap_kill(pid_t pid, int signal);
}
// NOLINTEND(bugprone-reserved-identifier)

namespace pelorus::support {

namespace {

int failWith(int error) {
    errno = error;
    return -1;
}

}  // namespace

FakeProcess& FakeProcess::get() {
    static FakeProcess instance;
    return instance;
}

void FakeProcess::redirectOpen(const std::string& path, const std::string& target) {
    targets[path] = target;
}

pid_t FakeProcess::doFork() const {
    return forkFails ? failWith(EAGAIN) : __real_fork();
}

pid_t FakeProcess::doSetsid() const {
    return setsidFails ? failWith(EPERM) : __real_setsid();
}

int FakeProcess::doChdir(const char* path) const {
    return chdirFails ? failWith(EACCES) : __real_chdir(path);
}

int FakeProcess::doOpen(const char* path, int flags, mode_t mode) {
    const auto found = targets.find(path);
    if (found == targets.end()) return __real_open(path, flags, mode);
    opened.push_back({path, flags});
    return __real_open(found->second.c_str(), flags, mode);
}

int FakeProcess::doKill(pid_t pid, int signal) {
    if (pid != getpid()) return __real_kill(pid, signal);
    kills.push_back(signal);
    return realKills ? __real_kill(pid, signal) : 0;
}

}  // namespace pelorus::support

using pelorus::support::FakeProcess;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
pid_t __wrap_fork() {
    return FakeProcess::get().doFork();
}

pid_t __wrap_setsid() {
    return FakeProcess::get().doSetsid();
}

int __wrap_chdir(const char* path) {
    return FakeProcess::get().doChdir(path);
}

int __wrap_open(const char* path, int flags, ...) {
    mode_t mode = 0;
    if ((flags & O_CREAT) != 0) {
        va_list args;
        va_start(args, flags);
        mode = va_arg(args, mode_t);
        va_end(args);
    }
    return FakeProcess::get().doOpen(path, flags, mode);
}

int __wrap_kill(pid_t pid, int signal) {
    return FakeProcess::get().doKill(pid, signal);
}
// NOLINTEND(bugprone-reserved-identifier)
