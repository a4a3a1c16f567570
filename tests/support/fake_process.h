// The process of a test: fork, setsid, chdir, open and kill pass through here. They do what they
// say, but each can be told to fail, and a test does not end itself.
#ifndef PELORUS_SUPPORT_FAKE_PROCESS_H
#define PELORUS_SUPPORT_FAKE_PROCESS_H

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace pelorus::support {

class FakeProcess {
public:
    struct Opened {
        std::string path;
        int flags;
    };

    static FakeProcess& get();

    /// From now on these fail.
    void failFork() { forkFails = true; }
    void failSetsid() { setsidFails = true; }
    void failChdir() { chdirFails = true; }

    /// Opens @p target in place of @p path; such calls are recorded.
    void redirectOpen(const std::string& path, const std::string& target);
    [[nodiscard]] const std::vector<Opened>& redirected() const { return opened; }

    /// Signals this process sent to itself with kill. They are not sent, unless killForReal().
    [[nodiscard]] const std::vector<int>& selfKills() const { return kills; }
    void killForReal() { realKills = true; }

    void reset() { *this = FakeProcess{}; }

    pid_t doFork() const;
    pid_t doSetsid() const;
    int doChdir(const char* path) const;
    int doOpen(const char* path, int flags, mode_t mode);
    int doKill(pid_t pid, int signal);

private:
    FakeProcess() = default;

    bool forkFails = false;
    bool setsidFails = false;
    bool chdirFails = false;
    bool realKills = false;
    std::map<std::string, std::string> targets;
    std::vector<Opened> opened;
    std::vector<int> kills;
};

}  // namespace pelorus::support

#endif
