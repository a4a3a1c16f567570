// Files and process of a test: fopen, open, unlink, fork, setsid, chdir, kill and std::thread. Most go
// straight through. A file opened without close-on-exec fails the test: a child process would inherit it.
#ifndef PELORUS_SUPPORT_FAKE_FILES_H
#define PELORUS_SUPPORT_FAKE_FILES_H

#include <map>

#include "support/fake.h"

namespace pelorus::support {

/// The count of minutes that tells whether the disk may sleep. Missing until redirected, whatever
/// the machine has there.
inline constexpr const char* kIdleMinutesFile = "/tmp/minutes_since_disk_access";

struct FakeFiles : Single<FakeFiles> {
    /// Opens @p target in place of @p path; an empty target is a missing file.
    void redirect(const std::string& path, const std::string& target) { targets[path] = target; }

    /// Runs before each file is opened; other than 0 it is the errno of a failure.
    std::function<int(const std::string& path, bool forWriting)> onOpen{};
    /// How often somebody else takes the name of a file that is unlinked.
    int replants = 0;

    std::map<std::string, std::string> targets{{kIdleMinutesFile, ""}};
};

struct FakeProcess : Single<FakeProcess> {
    std::set<std::string> failing;       ///< of "fork", "setsid", "chdir"
    std::vector<int> selfKills;          ///< signals this process sent to itself
    bool startsThreads = true;           ///< off: a std::thread does nothing
    bool killForReal = false;            ///< also delivers those
    std::function<void()> onSelfKill{};  ///< runs before
};

}  // namespace pelorus::support

#endif
