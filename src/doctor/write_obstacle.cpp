#include "doctor/write_obstacle.h"

#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>

#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

bool isFull(const struct statvfs& space) {
    // File systems without such a limit say 0 of 0.
    return (space.f_blocks > 0 && space.f_bfree == 0) || (space.f_files > 0 && space.f_ffree == 0);
}

}  // namespace

std::string folderOf(const std::string& path) {
    const std::size_t slash = path.rfind('/');
    return slash == std::string::npos || slash == 0 ? "/" : path.substr(0, slash);
}

std::string writeObstacle(const std::string& path) {
    const std::string folder = folderOf(path);
    const std::string shown = shownText(folder);
    struct stat status {};
    if (stat(folder.c_str(), &status) != 0) {
        const int error = errno;
        return error == ENOENT || error == ENOTDIR ? shown + " does not exist" : "";
    }
    if (!S_ISDIR(status.st_mode)) return shown + " is not a folder";
    if (access(folder.c_str(), W_OK) != 0) {
        const int error = errno;
        if (error == EROFS) return shown + " is on a read-only file system";
        if (geteuid() == 0) return shown + " cannot be written";
    }
    struct statvfs space {};
    if (statvfs(folder.c_str(), &space) == 0 && isFull(space)) return "no space left in " + shown;
    if (stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode)) {
        return shownText(path) + " is a folder";
    }
    return {};
}

}  // namespace pelorus::doctor
