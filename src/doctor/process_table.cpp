#include "doctor/process_table.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>
#include <memory>
#include <sstream>
#include <utility>

#include "common/files.h"
#include "common/handles.h"
#include "common/text.h"
#include "doctor/shown_text.h"

namespace pelorus::doctor {

namespace {

constexpr std::string_view kDeleted = " (deleted)";  // what the kernel adds to a removed program
constexpr int kFieldsToStart = 17;                   // between the parent and the start
constexpr std::size_t kMostArguments = 200;          // characters

using FolderHandle = std::unique_ptr<DIR, Releaser<closedir>>;

// What stands behind the first line that begins with @p label.
std::string lineBehind(const std::string& text, const std::string& label) {
    std::istringstream lines{text};
    for (std::string line; std::getline(lines, line);) {
        if (line.rfind(label, 0) == 0) return line.substr(label.size());
    }
    return {};
}

std::string fileName(const std::string& path) {
    std::string name = path.substr(path.rfind('/') + 1);  // npos + 1 is 0
    const std::size_t end = name.rfind(kDeleted);
    if (end != std::string::npos && end + kDeleted.size() == name.size()) name.resize(end);
    return name;
}

// The arguments behind the program's own name; the kernel ends each with a zero byte.
std::string argumentsOf(std::string commandLine) {
    while (!commandLine.empty() && commandLine.back() == '\0') commandLine.pop_back();
    const std::size_t first = commandLine.find('\0');
    if (first == std::string::npos) return {};
    std::string arguments = commandLine.substr(first + 1);
    std::replace(arguments.begin(), arguments.end(), '\0', ' ');
    return shownText(arguments, kMostArguments);
}

std::string linkTarget(const std::string& path) {
    std::array<char, PATH_MAX> target{};
    const ssize_t size = readlink(path.c_str(), target.data(), target.size());
    return size <= 0 ? std::string{} : std::string(target.data(), static_cast<std::size_t>(size));
}

// State letter, parent and start, in clock ticks since the machine started.
struct StatusLine {
    char state{};
    pid_t parent{};
    long start{};
};

std::optional<StatusLine> readStatusLine(const std::string& text) {
    // The name, in brackets, may hold anything.
    const std::size_t nameEnd = text.rfind(')');
    if (nameEnd == std::string::npos) return std::nullopt;
    std::istringstream fields{text.substr(nameEnd + 1)};
    StatusLine line;
    std::string skipped;
    fields >> line.state >> line.parent;
    for (int field = 0; field < kFieldsToStart; ++field) fields >> skipped;
    fields >> line.start;
    return fields ? std::optional{line} : std::nullopt;
}

}  // namespace

ProcessTable::ProcessTable(std::string processFolder) : folder{std::move(processFolder)} {
    const auto status = readForeignFile(folder + "/stat").text;
    const auto seconds = scanInt64(lineBehind(status.value_or(""), "btime ").c_str());
    if (seconds) bootTime = static_cast<long>(*seconds);
}

std::string ProcessTable::read(pid_t pid, const std::string& file) const {
    return readForeignFile(folder + "/" + std::to_string(pid) + "/" + file).text.value_or("");
}

std::optional<Process> ProcessTable::find(pid_t pid) const {
    const auto status = readStatusLine(read(pid, "stat"));
    if (!status || status->state == 'Z' || status->state == 'X') return std::nullopt;
    Process process{pid, status->parent, read(pid, "comm"), "", "", "", "", std::nullopt};
    while (!process.name.empty() && process.name.back() == '\n') process.name.pop_back();
    const std::string ownFolder = folder + "/" + std::to_string(pid);
    process.path = linkTarget(ownFolder + "/exe");
    process.program = fileName(process.path);
    process.workingFolder = linkTarget(ownFolder + "/cwd");
    process.arguments = argumentsOf(read(pid, "cmdline"));
    const long ticks = sysconf(_SC_CLK_TCK);
    if (bootTime && ticks > 0) {
        process.since = Time{std::chrono::seconds{*bootTime + status->start / ticks}};
    }
    return process;
}

std::vector<Process> ProcessTable::named(const std::string& name) const {
    std::vector<Process> found;
    for (const pid_t pid : pids()) {
        auto process = find(pid);
        if (!process || (process->name != name && process->program != name)) continue;
        if (isOfThisNamespace(pid)) found.push_back(std::move(*process));
    }
    return found;
}

std::optional<std::string> ProcessTable::environment(pid_t pid) const {
    return readForeignFile(folder + "/" + std::to_string(pid) + "/environ").text;
}

bool ProcessTable::showsAll() const {
    struct stat status {};
    return geteuid() == 0 || stat((folder + "/1").c_str(), &status) == 0;
}

// A process of another namespace has a pid there as well.
bool ProcessTable::isOfThisNamespace(pid_t pid) const {
    std::istringstream numbers{lineBehind(read(pid, "status"), "NSpid:")};
    int count = 0;
    for (long number = 0; numbers >> number;) ++count;
    return count <= 1;
}

std::vector<pid_t> ProcessTable::pids() const {
    std::vector<pid_t> found;
    const FolderHandle entries{opendir(folder.c_str())};
    while (const dirent* entry = entries ? readdir(entries.get()) : nullptr) {
        const std::string name{static_cast<const char*>(entry->d_name)};
        const auto pid = readPid(name);
        if (pid && name.find_first_not_of("0123456789") == std::string::npos) found.push_back(*pid);
    }
    std::sort(found.begin(), found.end());
    return found;
}

std::optional<pid_t> readPid(const std::string& text) {
    const auto pid = scanInt(text.c_str());
    return pid && *pid > 0 ? std::optional<pid_t>{*pid} : std::nullopt;
}

}  // namespace pelorus::doctor
