#include "common/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <optional>

#include "common/log.h"

namespace pelorus {

namespace {

constexpr std::size_t kPieceSize = 4096;  // bytes

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

}  // namespace

FileHandle openForeignFile(const std::string& path, Part part, Link link) {
    const int noLink = link == Link::REFUSE ? O_NOFOLLOW : 0;
    const Descriptor file{
        open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | noLink)};
    struct stat status {};
    const bool isOpen = file.number >= 0 && fstat(file.number, &status) == 0;
    if (!isOpen && errno != ELOOP) return nullptr;
    if (!isOpen || !S_ISREG(status.st_mode)) {
        logWarning("openForeignFile - %s is not a regular file and is not read.\n", path.c_str());
        errno = EINVAL;
        return nullptr;
    }
    const off_t excess = status.st_size - static_cast<off_t>(kMostForeignBytes);
    const off_t offset = part == Part::TAIL ? std::max<off_t>(excess, 0) : 0;
    if (excess > 0 && part == Part::HEAD) {
        logWarning("openForeignFile - only the first %zu bytes of %s are read.\n",
                   kMostForeignBytes, path.c_str());
    }
    const auto text = readFrom(file.number, offset);
    return text ? streamOf(*text) : nullptr;
}

FileHandle createFile(const std::string& path, mode_t mode) {
    static_cast<void>(unlink(path.c_str()));
    const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
    if (file < 0) return nullptr;
    static_cast<void>(fchmod(file, mode));  // whatever the umask
    std::FILE* const stream = fdopen(file, "w");
    if (stream == nullptr) static_cast<void>(close(file));
    return FileHandle{stream};
}

}  // namespace pelorus
