// The processes of this machine.
#ifndef PELORUS_DOCTOR_PROCESS_TABLE_H
#define PELORUS_DOCTOR_PROCESS_TABLE_H

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "doctor/evidence.h"

namespace pelorus::doctor {

struct Process {
    pid_t pid{};
    pid_t parent{};
    std::string name;             ///< as the kernel knows it, at most 15 characters
    std::string path;             ///< of its program; empty if only root may know it
    std::string program;          ///< the file name in it
    std::string arguments;        ///< separated by blanks
    std::string workingFolder;    ///< empty if only root may know it
    std::optional<Time> since{};  ///< its start
};

/// Reads /proc, or a folder that looks like it.
class ProcessTable {
public:
    explicit ProcessTable(std::string processFolder);

    /// The process with this pid. Nothing when there is none, or only its exit status is left.
    [[nodiscard]] std::optional<Process> find(pid_t pid) const;

    /// The processes with this name or program, without those of other pid namespaces (containers),
    /// lowest pid first.
    [[nodiscard]] std::vector<Process> named(const std::string& name) const;

    /// Its environment, each variable followed by a zero byte. Nothing when this user may not know.
    [[nodiscard]] std::optional<std::string> environment(pid_t pid) const;

    /// False when this user cannot see the processes of others.
    [[nodiscard]] bool showsAll() const;

private:
    [[nodiscard]] std::string read(pid_t pid, const std::string& file) const;
    [[nodiscard]] bool isOfThisNamespace(pid_t pid) const;
    [[nodiscard]] std::vector<pid_t> pids() const;

    const std::string folder;
    std::optional<long> bootTime{};  // seconds since the epoch
};

/// The pid that a pid file holds: nothing when @p text does not begin with a number above 0.
[[nodiscard]] std::optional<pid_t> readPid(const std::string& text);

}  // namespace pelorus::doctor

#endif
