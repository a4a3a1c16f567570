// Which file the static settings are in.
#ifndef PELORUS_DOCTOR_STATIC_FILE_H
#define PELORUS_DOCTOR_STATIC_FILE_H

#include <string>

namespace pelorus::doctor {

struct StaticFilePlaces {
    std::string processes = "/proc";
    std::string pidFile = "/tmp/tavik_cm_pid";
    std::string defaults = "/etc/default/pelorus";  ///< the service's environment
    std::string builtIn = "/var/www/rest-api/config/globalconfig.ini";
    std::string packaged = "/etc/pelorus/globalconfig.ini";
};

struct StaticFile {
    std::string path{};    ///< empty when the variable is
    std::string remark{};  ///< why the daemon by itself would read another one; usually empty
};

/// The path in TAVIK_STATIC_CONFIG: of this process, else of the running daemon, else of its
/// service. Without any the daemon's built-in one, for which the packaged one stands in when it
/// does not exist.
[[nodiscard]] StaticFile findStaticFile(const StaticFilePlaces& places = {});

/// There is no such file. False when this user may not know.
[[nodiscard]] bool isAbsent(const std::string& path);

}  // namespace pelorus::doctor

#endif
