// Who may write a file.
#ifndef PELORUS_DOCTOR_FILE_SAFETY_H
#define PELORUS_DOCTOR_FILE_SAFETY_H

#include <string>

namespace pelorus::doctor {

/// Who, besides root, can change what @p path holds, or put another file in its place.
enum class Writers {
    ROOT,
    SOME,  ///< an owner or a group
    EVERYBODY,
    UNKNOWN,  ///< it is not there, or cannot be looked at
};

/// Looks at the file and at every folder and link on the way to it; a folder that others cannot
/// enter protects what is in it.
[[nodiscard]] Writers writersOf(const std::string& path);

/// The same for a file that may not be there yet: whoever can write the folder can take its name.
[[nodiscard]] Writers creatorsOf(const std::string& path);

}  // namespace pelorus::doctor

#endif
