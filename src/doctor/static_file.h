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

/// The path in TAVIK_STATIC_CONFIG: of this process, else of the running daemon, else of its
/// service. Without any the daemon's built-in one. The packaged one when that does not exist but
/// the packaged one does.
[[nodiscard]] std::string findStaticFile(const StaticFilePlaces& places = {});

}  // namespace pelorus::doctor

#endif
