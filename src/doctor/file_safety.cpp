#include "doctor/file_safety.h"

#include <sys/stat.h>

#include <algorithm>
#include <optional>

#include "doctor/write_obstacle.h"

namespace pelorus::doctor {

namespace {

std::optional<struct stat> statusOf(const std::string& path) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) return std::nullopt;
    return status;
}

Writers writersBy(const struct stat& status) {
    if ((status.st_mode & S_IWOTH) != 0) return Writers::EVERYBODY;
    const bool isGroupWritable = (status.st_mode & S_IWGRP) != 0 && status.st_gid != 0;
    return status.st_uid != 0 || isGroupWritable ? Writers::SOME : Writers::ROOT;
}

// In a sticky folder nobody can move or remove the files of others.
Writers replacersIn(const struct stat& folder) {
    if ((folder.st_mode & S_ISVTX) == 0) return writersBy(folder);
    return folder.st_uid == 0 ? Writers::ROOT : Writers::SOME;
}

Writers worse(Writers left, Writers right) {
    return static_cast<int>(left) > static_cast<int>(right) ? left : right;
}

}  // namespace

Writers writersOf(const std::string& path) {
    const auto file = statusOf(path);
    const auto folder = statusOf(folderOf(path));
    if (!file || !folder) return Writers::UNKNOWN;
    Writers writers = writersBy(*file);
    const bool isOpen = (folder->st_mode & S_IXOTH) != 0;
    if (writers == Writers::EVERYBODY && !isOpen) {
        const bool isForGroup = (folder->st_mode & S_IXGRP) != 0 && folder->st_gid != 0;
        writers = isForGroup || folder->st_uid != 0 ? Writers::SOME : Writers::ROOT;
    }
    return worse(writers, replacersIn(*folder));
}

Writers creatorsOf(const std::string& path) {
    const auto folder = statusOf(folderOf(path));
    return folder ? writersBy(*folder) : Writers::UNKNOWN;
}

}  // namespace pelorus::doctor
