#include "doctor/file_safety.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>
#include <sstream>
#include <vector>

#include "doctor/write_obstacle.h"

namespace pelorus::doctor {

namespace {

constexpr int kMostLinks = 40;

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

Writers entrantsOf(const struct stat& folder) {
    if ((folder.st_mode & S_IXOTH) != 0) return Writers::EVERYBODY;
    const bool isForGroup = (folder.st_mode & S_IXGRP) != 0 && folder.st_gid != 0;
    return isForGroup || folder.st_uid != 0 ? Writers::SOME : Writers::ROOT;
}

// Who can enter the folder @p path, which has no link in it, and all above it.
Writers entrantsUpTo(const std::string& path) {
    Writers entrants = Writers::EVERYBODY;
    struct stat status {};
    for (std::size_t end = 0; end != path.npos;) {
        end = path.find('/', end + 1);
        if (stat(path.substr(0, end).c_str(), &status) != 0) return entrants;
        entrants = std::min(entrants, entrantsOf(status));
    }
    return entrants;
}

// Goes from the root down to a file, through each folder and each link.
class Walk {
public:
    // Who can write the file or put another in its place; UNKNOWN when it cannot be looked at. As
    // for the daemon, a path that begins with no slash begins at the root.
    Writers to(const std::string& path) {
        struct stat status {};
        split(path);
        while (!names.empty()) {
            const std::string name = names.back();
            names.pop_back();
            if (name == "..") {
                place.resize(place.empty() ? 0 : place.rfind('/'));
                continue;
            }
            if (!enter()) return Writers::UNKNOWN;
            const std::string next = place + "/" + name;
            if (lstat(next.c_str(), &status) != 0) return Writers::UNKNOWN;
            if (!S_ISLNK(status.st_mode)) {
                place = next;
            } else if (!follow(next, status)) {
                return Writers::UNKNOWN;
            }
        }
        return std::max(writers, std::min(writersBy(status), entrants));
    }

private:
    bool enter() {
        struct stat folder {};
        const std::string path = place.empty() ? "/" : place;
        if (stat(path.c_str(), &folder) != 0) return false;
        entrants = entrantsUpTo(path);
        writers = std::max(writers, std::min(replacersIn(folder), entrants));
        return true;
    }

    void split(const std::string& path) {
        std::istringstream parts{path};
        std::vector<std::string> added;
        for (std::string name; std::getline(parts, name, '/');) {
            if (!name.empty() && name != ".") added.push_back(name);
        }
        names.insert(names.end(), added.rbegin(), added.rend());
    }

    // In a sticky folder a link is still its maker's.
    bool follow(const std::string& link, const struct stat& status) {
        std::array<char, PATH_MAX> target{};
        const ssize_t size = readlink(link.c_str(), target.data(), target.size() - 1);
        if (size <= 0 || ++links > kMostLinks) return false;
        if (status.st_uid != 0) writers = std::max(writers, std::min(Writers::SOME, entrants));
        if (target.front() == '/') place.clear();
        split(target.data());
        return true;
    }

    std::string place;               // has no link in it; empty is the root
    std::vector<std::string> names;  // that lead on from there, the next one last
    int links = 0;
    Writers entrants = Writers::EVERYBODY;
    Writers writers = Writers::ROOT;
};

}  // namespace

Writers writersOf(const std::string& path) {
    return Walk{}.to(path);
}

Writers creatorsOf(const std::string& path) {
    return writersOf(folderOf(path));
}

}  // namespace pelorus::doctor
