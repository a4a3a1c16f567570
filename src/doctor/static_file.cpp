#include "doctor/static_file.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <optional>
#include <sstream>

#include "common/files.h"
#include "doctor/daemon_look.h"
#include "doctor/process_table.h"

namespace pelorus::doctor {

namespace {

constexpr const char* kVariable = "TAVIK_STATIC_CONFIG";

// The last value that is given to the variable, if any is. The assignments end with @p separator.
std::optional<std::string> assignedIn(const std::string& text, char separator) {
    const std::string beginning = std::string{kVariable} + '=';
    std::optional<std::string> value;
    std::istringstream assignments{text};
    for (std::string line; std::getline(assignments, line, separator);) {
        if (line.rfind(beginning, 0) == 0) value = line.substr(beginning.size());
    }
    return value;
}

std::string unquoted(const std::string& value) {
    constexpr const char* kAround = "\"' \t\r";
    const std::size_t begin = value.find_first_not_of(kAround);
    if (begin == std::string::npos) return {};
    return value.substr(begin, value.find_last_not_of(kAround) - begin + 1);
}

// What the variable is to the daemon; nothing when it is not set.
std::optional<std::string> daemonsValue(const StaticFilePlaces& places) {
    const ProcessTable processes{places.processes};
    if (const auto daemon = findDaemon(processes, places.pidFile)) {
        const auto environment = processes.environment(daemon->pid);
        if (environment) return assignedIn(*environment, '\0');
    }
    const auto defaults = readForeignFile(places.defaults, Part::HEAD, Link::OWN).text;
    const auto value = assignedIn(defaults.value_or(""), '\n');
    return value ? std::optional{unquoted(*value)} : std::nullopt;
}

}  // namespace

StaticFile findStaticFile(const StaticFilePlaces& places) {
    const char* own = std::getenv(kVariable);
    const auto named = own != nullptr ? std::optional<std::string>{own} : daemonsValue(places);
    if (named) return {*named};
    if (!isAbsent(places.builtIn) || isAbsent(places.packaged)) return {places.builtIn};
    return {places.packaged, std::string{kVariable} + " is not set and " + places.builtIn +
                                 " does not exist, so the packaged file is looked at"};
}

bool isAbsent(const std::string& path) {
    if (access(path.c_str(), F_OK) == 0) return false;
    const int error = errno;
    return error == ENOENT || error == ENOTDIR;
}

}  // namespace pelorus::doctor
