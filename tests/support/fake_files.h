// Fixed paths of a test: fopen of a path that is the same on every machine ends in a file of the
// test. All other paths are opened as they are. A file that is not opened close-on-exec fails the
// test.
#ifndef PELORUS_SUPPORT_FAKE_FILES_H
#define PELORUS_SUPPORT_FAKE_FILES_H

#include <cstdio>
#include <map>
#include <string>

namespace pelorus::support {

/// The count of minutes that tells whether the disk may sleep.
inline constexpr const char* kIdleMinutesFile = "/tmp/minutes_since_disk_access";

/// At first kIdleMinutesFile is missing, whatever the machine has there, and nothing else is
/// redirected.
class FakeFiles {
public:
    static FakeFiles& get();

    /// Opens @p target (see PelorusTest::path and writeFile) in place of @p path.
    void redirect(const std::string& path, const std::string& target);
    void reset();

    std::FILE* open(const char* path, const char* mode);

private:
    FakeFiles();

    std::map<std::string, std::string> targets;  // an empty one is a missing file
};

}  // namespace pelorus::support

#endif
