#include "doctor/doctor_options.h"

#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <iterator>
#include <string_view>

#include "common/handles.h"
#include "common/version.h"

namespace pelorus::doctor {

namespace {

constexpr const char* kHelp =
    R"(Usage: pelorus-doctor [OPTION]...
Says why this device is not reached directly, since when, and what would help.
Changes nothing: not on the device, not on the gateway, not at the service.

      --log FILE     read this log, - for standard input, also compressed (.gz);
                     repeatable; without it the journal or the files of syslog
      --no-probes    look at files and the log only, not at the network
      --ask-service  also ask the service for the public address, and for one
                     test of a published port, with the device's credentials
      --settings     check the settings files only, before anything is started
      --json         print everything for programs
      --svg FILE     also draw the history into this file
      --share        mask addresses and host names, for a place others can read
  -h, --help         print this and exit
      --version      print the version and exit

Exit status: 0 reached directly, 1 relayed, 2 not reached, 3 could not be told,
64 wrong usage, 73 output could not be written. With --settings: 0 or 2.
)";

// Values beyond those of characters.
enum Option : int { LOG = 256, NO_PROBES, ASK_SERVICE, SETTINGS, JSON, SVG, SHARE, VERSION };

constexpr option kOptions[]{{"help", no_argument, nullptr, 'h'},
                            {"version", no_argument, nullptr, VERSION},
                            {"log", required_argument, nullptr, LOG},
                            {"no-probes", no_argument, nullptr, NO_PROBES},
                            {"ask-service", no_argument, nullptr, ASK_SERVICE},
                            {"settings", no_argument, nullptr, SETTINGS},
                            {"json", no_argument, nullptr, JSON},
                            {"svg", required_argument, nullptr, SVG},
                            {"share", no_argument, nullptr, SHARE},
                            {nullptr, 0, nullptr, 0}};

int complain(const std::string& what) {
    std::fprintf(stderr, "pelorus-doctor: %s, see pelorus-doctor --help\n", what.c_str());
    return kWrongUsage;
}

int print(const std::string& text) {
    const bool isWritten = std::fputs(text.c_str(), stdout) >= 0 && std::fflush(stdout) == 0;
    if (isWritten) return 0;
    std::perror("pelorus-doctor: cannot write to standard output");
    return kNotWritten;
}

// Of a shortened option: the beginning of several.
bool isAmbiguous(const std::string& argument) {
    if (argument.compare(0, 2, "--") != 0) return false;
    const std::string name = argument.substr(2, argument.find('=') - 2);
    const auto fits = [&](const option& known) {
        return known.name != nullptr && std::string_view{known.name}.substr(0, name.size()) == name;
    };
    return std::count_if(std::begin(kOptions), std::end(kOptions), fits) > 1;
}

// What an option without an argument does.
struct Switch {
    bool DoctorOptions::*field;
    int option;
    bool value;
};

constexpr Switch kSwitches[]{{&DoctorOptions::probes, NO_PROBES, false},
                             {&DoctorOptions::askService, ASK_SERVICE, true},
                             {&DoctorOptions::settingsOnly, SETTINGS, true},
                             {&DoctorOptions::json, JSON, true},
                             {&DoctorOptions::share, SHARE, true}};

// What getopt_long() stopped at: a short option, or the whole argument.
std::string badArgument(char** argv) {
    if (optopt > 0 && optopt < LOG) return std::string{"-"} + static_cast<char>(optopt);
    return argv[optind - 1];
}

std::optional<int> readOption(int found, char** argv, DoctorOptions& options) {
    for (const Switch& known : kSwitches) {
        if (known.option != found) continue;
        options.*known.field = known.value;
        return std::nullopt;
    }
    switch (found) {
        case 'h':
            return print(kHelp);
        case VERSION:
            return print(std::string{"pelorus-doctor "} + GetPelorusVersion() + '\n');
        case LOG:
            options.logs.emplace_back(optarg);
            return std::nullopt;
        case SVG:
            options.picture = optarg;
            return std::nullopt;
        case ':':
            return complain(std::string{argv[optind - 1]} + " needs a file");
        default:
            return complain(
                (isAmbiguous(badArgument(argv)) ? "ambiguous option: " : "no such option: ") +
                badArgument(argv));
    }
}

// Also through links, and through standard input.
bool isSameFile(const std::string& log, const std::string& picture) {
    struct stat left {};
    struct stat right {};
    const int found = log == "-" ? fstat(STDIN_FILENO, &left) : stat(log.c_str(), &left);
    return found == 0 && stat(picture.c_str(), &right) == 0 && S_ISREG(left.st_mode) &&
           left.st_dev == right.st_dev && left.st_ino == right.st_ino;
}

// Nothing but an older picture may be overwritten.
bool isForeignFile(const std::string& picture) {
    struct stat status {};
    if (stat(picture.c_str(), &status) != 0) return false;
    if (!S_ISREG(status.st_mode)) return S_ISBLK(status.st_mode);
    const FileHandle file = openFile(picture, "re");
    std::array<char, 4> begin{};
    const std::size_t size = file ? std::fread(begin.data(), 1, begin.size(), file.get()) : 0;
    return status.st_size > 0 && std::string_view{begin.data(), size} != "<svg";
}

std::optional<int> contradiction(const DoctorOptions& options) {
    const bool hasOthers = !options.logs.empty() || !options.probes || options.askService ||
                           options.json || !options.picture.empty();
    if (options.settingsOnly && hasOthers) return complain("--settings goes only with --share");
    if (options.askService && !options.probes) {
        return complain("--ask-service is a probe, it does not go with --no-probes");
    }
    for (const std::string& log : options.logs) {
        if (isSameFile(log, options.picture)) return complain("--svg would overwrite a log");
    }
    if (isForeignFile(options.picture)) {
        return complain("--svg would overwrite a file that is no picture");
    }
    return std::nullopt;
}

}  // namespace

DoctorOptions parseDoctorOptions(int argc, char** argv) {
    DoctorOptions options;
    optind = 0;  // from the start, whatever was parsed before
    while (!options.exitStatus) {
        const int found = getopt_long(argc, argv, "+:h", kOptions, nullptr);
        if (found == -1) break;
        options.exitStatus = readOption(found, argv, options);
        const bool isFile = found == LOG || found == SVG;
        if (isFile && *optarg == '\0') options.exitStatus = complain("the name of a file is empty");
    }
    if (!options.exitStatus && optind < argc) {
        options.exitStatus = complain(std::string{"unexpected argument: "} + argv[optind]);
    }
    if (!options.exitStatus) options.exitStatus = contradiction(options);
    return options;
}

}  // namespace pelorus::doctor
