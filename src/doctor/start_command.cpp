#include "doctor/start_command.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <set>
#include <sstream>
#include <vector>

#include "common/text.h"

namespace pelorus::doctor {

namespace {

const std::set<std::string> kPrefixes{"env", "exec", "nohup", "setsid"};
// They run what stands in their arguments.
const std::set<std::string> kWrappers{
    "ash", "bash", "busybox",     "chroot", "dash", "nice", "runuser", "sh", "start-stop-daemon",
    "su",  "sudo", "systemd-run", "timeout"};

// The commands of a shell command line. A separator in quotes is part of a word, and so is the
// ampersand of a redirection.
std::vector<std::string> commandsIn(const std::string& line) {
    std::vector<std::string> commands(1);
    char quote = '\0';
    char before = '\0';
    for (std::size_t at = 0; at < line.size(); before = line[at++]) {
        const char letter = line[at];
        if (quote != '\0') {
            if (letter == quote) quote = '\0';
        } else if (letter == '"' || letter == '\'') {
            quote = letter;
        }
        const bool isOfRedirection =
            letter == '&' && (before == '>' || (at + 1 < line.size() && line[at + 1] == '>'));
        const bool isSeparator = contains(";&|\n", std::string{letter}) && !isOfRedirection;
        if (isSeparator && quote == '\0') {
            commands.emplace_back();
        } else {
            commands.back() += letter;
        }
    }
    return commands;
}

bool isAssignment(const std::string& word) {
    const std::string name = word.substr(0, word.find('='));
    return name.size() < word.size() && !name.empty() &&
           std::all_of(name.begin(), name.end(), [](unsigned char letter) {
               return std::isalnum(letter) != 0 || letter == '_';
           });
}

// Empty when the shell would have to work it out.
std::string programOf(const std::string& command) {
    std::istringstream words{command};
    bool isBehindEnv = false;
    std::string word;
    while (words >> word) {
        if (isBehindEnv && word == "-u") {
            words >> word;
        } else if (kPrefixes.count(word) != 0) {
            isBehindEnv = word == "env";
        } else if (!isAssignment(word)) {
            break;
        }
    }
    const bool isPlain =
        words && std::all_of(word.begin(), word.end(), [](unsigned char letter) {
            return std::isalnum(letter) != 0 || std::strchr("/._+-", letter) != nullptr;
        });
    return isPlain ? word : std::string{};
}

std::string nameOf(const std::string& program) {
    return program.substr(program.rfind('/') + 1);
}

bool isTunnelClient(const std::string& program) {
    return nameOf(program).rfind("openvpn", 0) == 0;
}

}  // namespace

std::optional<std::string> relayClientOf(const std::string& command, const std::string& folder) {
    std::set<std::string> programs;
    std::set<std::string> clients;
    for (const std::string& part : commandsIn(command)) {
        if (part.find_first_not_of(" \t\r") == std::string::npos) continue;
        const std::string program = programOf(part);
        programs.insert(program);
        if (isTunnelClient(program)) clients.insert(program);
    }
    if (clients.empty() && programs.size() == 1) {
        const std::string& only = *programs.begin();
        const bool isClear = only.rfind('/', 0) == 0 && kWrappers.count(nameOf(only)) == 0;
        return isClear ? std::optional{only} : std::nullopt;
    }
    if (clients.size() != 1) return std::nullopt;
    const std::string& client = *clients.begin();
    if (client.front() == '/') return client;
    if (!contains(client, "/")) {
        return contains(" " + command, " PATH=") ? std::nullopt : std::optional{client};
    }
    if (programs.count("cd") != 0) return std::nullopt;
    return folder + "/" + client;
}

}  // namespace pelorus::doctor
