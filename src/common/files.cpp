#include "common/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <optional>

#include "common/log.h"

namespace pelorus {

namespace {

constexpr std::size_t kPieceSize = 4096;  // bytes
constexpr int kReading = O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW;

constexpr int kMostAttempts = 1000;

class Descriptor {
public:
    explicit Descriptor(int descriptor) : number{descriptor} {}
    ~Descriptor() {
        const int error = errno;
        if (number >= 0) static_cast<void>(close(number));
        errno = error;
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;

    const int number;
};

// The bytes from @p offset on, as far as they are read. Nothing, and errno set, on an error.
std::optional<std::string> readFrom(int file, off_t offset) {
    std::string text;
    std::array<char, kPieceSize> piece{};  // most files are short
    while (text.size() < kMostForeignBytes) {
        const ssize_t count =
            pread(file, piece.data(), std::min(piece.size(), kMostForeignBytes - text.size()),
                  offset + static_cast<off_t>(text.size()));
        if (count < 0) return std::nullopt;
        if (count == 0) break;
        text.append(piece.data(), static_cast<std::size_t>(count));
    }
    return text;
}

// A stream that owns a copy of @p text.
FileHandle streamOf(const std::string& text) {
    FileHandle stream{fmemopen(nullptr, text.size() + 1, "w+")};
    if (stream) {
        static_cast<void>(std::fwrite(text.data(), 1, text.size(), stream.get()));
        std::rewind(stream.get());
    }
    return stream;
}

// The file that the link @p path leads to; ELOOP unless root made the link, or the file's owner.
int openLinked(const std::string& path) {
    const Descriptor link{open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC)};
    struct stat maker {};
    std::array<char, PATH_MAX> text{};
    if (link.number < 0 || fstat(link.number, &maker) != 0) return -1;
    const ssize_t size = readlinkat(link.number, "", text.data(), text.size());
    if (size <= 0) return -1;
    std::string name{text.data(), static_cast<std::size_t>(size)};
    if (name.front() != '/') name.insert(0, path, 0, path.rfind('/') + 1);
    // Opening a device may do something, so what the link leads to is looked at first.
    const Descriptor target{open(name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC)};
    struct stat status {};
    if (target.number < 0 || fstat(target.number, &status) != 0) return -1;
    const bool isOwn = maker.st_uid == 0 || maker.st_uid == status.st_uid;
    if (S_ISREG(status.st_mode) && isOwn) {
        const std::string found = "/proc/self/fd/" + std::to_string(target.number);
        return open(found.c_str(), kReading & ~O_NOFOLLOW);
    }
    errno = ELOOP;
    return -1;
}

int openForReading(const std::string& path, Link link) {
    const int file = open(path.c_str(), kReading);
    return file < 0 && errno == ELOOP && link == Link::OWN ? openLinked(path) : file;
}

}  // namespace

ForeignText readForeignFile(const std::string& path, Part part, Link link) {
    ForeignText found;
    const Descriptor file{openForReading(path, link)};
    struct stat status {};
    const bool isOpen = file.number >= 0 && fstat(file.number, &status) == 0;
    if (!isOpen) found.error = errno;
    if (!isOpen && found.error != ELOOP) return found;
    // Some kernels let everybody give a second name to a file that he may not read.
    const bool isStolen =
        link == Link::OWN && status.st_nlink > 1 && (status.st_mode & S_IROTH) == 0;
    if (!isOpen || !S_ISREG(status.st_mode) || isStolen) {
        found.error = EINVAL;
        found.isRefused = true;
        return found;
    }
    const off_t excess = status.st_size - static_cast<off_t>(kMostForeignBytes);
    const off_t offset = part == Part::TAIL ? std::max<off_t>(excess, 0) : 0;
    found.isCut = excess > 0;
    found.text = readFrom(file.number, offset);
    if (!found.text) found.error = errno;
    return found;
}

FileHandle openForeignFile(const std::string& path, Part part, Link link) {
    const ForeignText found = readForeignFile(path, part, link);
    if (found.isCut && part == Part::HEAD) {
        logWarning("openForeignFile - only the first %zu bytes of %s are read.\n",
                   kMostForeignBytes, path.c_str());
    }
    if (found.text) return streamOf(*found.text);
    if (found.isRefused) {
        logWarning("openForeignFile - %s is not a regular file and is not read.\n", path.c_str());
    }
    errno = found.error;
    return nullptr;
}

FileHandle createFile(const std::string& path, mode_t mode) {
    int file = -1;
    // Whoever keeps taking the name in a shared folder wins some of the races for it, not all.
    for (int attempt = 0; attempt < kMostAttempts && file < 0; ++attempt) {
        static_cast<void>(unlink(path.c_str()));
        file = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
        if (file < 0 && errno != EEXIST) return nullptr;
    }
    if (file < 0) return nullptr;
    static_cast<void>(fchmod(file, mode));  // whatever the umask
    std::FILE* const stream = fdopen(file, "w");
    if (stream == nullptr) static_cast<void>(close(file));
    return FileHandle{stream};
}

}  // namespace pelorus
