// Owners of C library resources.
#ifndef PELORUS_COMMON_HANDLES_H
#define PELORUS_COMMON_HANDLES_H

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

namespace pelorus {

/// Deleter of a std::unique_ptr: passes the handle to the C function that releases it.
template <auto release>
struct Releaser {
    template <typename T>
    void operator()(T* handle) const {
        static_cast<void>(release(handle));
    }
};

/// An open file, closed at the end of the scope.
using FileHandle = std::unique_ptr<std::FILE, Releaser<std::fclose>>;

/// Opens @p path as fopen does; null, and errno set, when that fails. Pass "e" in @p mode, so that
/// no child process inherits the file.
inline FileHandle openFile(const std::string& path, const char* mode) {
    return FileHandle{std::fopen(path.c_str(), mode)};
}

/// A popen stream, waited for at the end of the scope.
using PipeHandle = std::unique_ptr<std::FILE, Releaser<pclose>>;

/// A malloc'd block that a library hands over.
template <typename T>
using MallocHandle = std::unique_ptr<T, Releaser<std::free>>;

}  // namespace pelorus

#endif
