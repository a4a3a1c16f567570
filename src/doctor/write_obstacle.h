// Why a file cannot be written, without trying it.
#ifndef PELORUS_DOCTOR_WRITE_OBSTACLE_H
#define PELORUS_DOCTOR_WRITE_OBSTACLE_H

#include <string>

namespace pelorus::doctor {

/// The folder that @p path is in; "/" when it names none.
[[nodiscard]] std::string folderOf(const std::string& path);

/// Why root cannot create or write @p path: "/run/x does not exist". Empty when nothing is known
/// against it; what only root can see counts as unknown.
[[nodiscard]] std::string writeObstacle(const std::string& path);

}  // namespace pelorus::doctor

#endif
