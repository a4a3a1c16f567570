// Files that others may have put there, changed or replaced.
#ifndef PELORUS_COMMON_FILES_H
#define PELORUS_COMMON_FILES_H

#include <sys/types.h>

#include <optional>
#include <string>

#include "common/handles.h"

namespace pelorus {

/// Most that is read of a foreign file, bytes.
inline constexpr std::size_t kMostForeignBytes = 1024UL * 1024;

/// Which part of a file that is too large is read.
enum class Part { HEAD, TAIL };

/// Whether a link in place of a file is followed.
enum class Link {
    REFUSE,  ///< no symbolic link
    OWN,     ///< one of root, or of the file's owner; neither does a hard link give others access
};

/// What a foreign file held when it was read.
struct ForeignText {
    std::optional<std::string> text{};  ///< nothing when the file cannot be read
    int error = 0;                      ///< errno then
    bool isRefused = false;  ///< it is not a regular file, or a link that is not followed
    bool isCut = false;      ///< it is longer than kMostForeignBytes
};

/// Reads a file that another program may write. Never blocks and never logs.
[[nodiscard]] ForeignText readForeignFile(const std::string& path,
                                          Part part = Part::HEAD,
                                          Link link = Link::REFUSE);

/// Opens a file that another program may write, and reads it at once: what the handle delivers is
/// what the file held at that moment. Never blocks. Null, and errno set, when the file cannot be
/// read; EINVAL, and one log line, when it is not a regular file or a link is refused.
FileHandle openForeignFile(const std::string& path,
                           Part part = Part::HEAD,
                           Link link = Link::REFUSE);

/// Creates @p path for writing, in place of whatever has that name (a directory aside), so that
/// neither a link nor a file of somebody else receives what is written. It has exactly @p mode.
/// Null, and errno set, on failure.
FileHandle createFile(const std::string& path, mode_t mode);

}  // namespace pelorus

#endif
