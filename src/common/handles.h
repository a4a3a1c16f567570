// Owners for what the C library hands out.
#ifndef PELORUS_COMMON_HANDLES_H
#define PELORUS_COMMON_HANDLES_H

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

namespace pelorus {

struct FileCloser {
    void operator()(std::FILE* file) const { static_cast<void>(std::fclose(file)); }
};
/// An open file, closed at the end of the scope.
using FileHandle = std::unique_ptr<std::FILE, FileCloser>;

/// Opens @p path as fopen does; null, and errno set, when that fails. Pass "e" in @p mode, so that
/// no child process inherits the file.
inline FileHandle openFile(const std::string& path, const char* mode) {
    return FileHandle{std::fopen(path.c_str(), mode)};
}

struct PipeCloser {
    void operator()(std::FILE* pipe) const { static_cast<void>(pclose(pipe)); }
};
/// A popen stream, waited for at the end of the scope.
using PipeHandle = std::unique_ptr<std::FILE, PipeCloser>;

struct MallocFreer {
    void operator()(void* block) const { std::free(block); }  // NOLINT(*-no-malloc)
};
/// A malloc'd block that a library hands over.
template <typename T>
using MallocHandle = std::unique_ptr<T, MallocFreer>;

}  // namespace pelorus

#endif
