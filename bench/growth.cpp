// growth MEASURE SIZE CYCLES: CPU time of the whole daemon on the unit tests' doubles, whose work is
// included, without noise and the watcher's thread. Prints lines of a name, a size and microseconds.
//   table   the first cycle and later ones, with SIZE foreign entries in the gateway's table
//   keys    cycles that read changed settings with SIZE keys
//   bad     searches for ports, by the number of ports found bad before
//   uptime  all cycles up to the 1st, 10th, ...
#include <fcntl.h>
#include <sys/stat.h>

#include <cstdarg>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "config/global_config.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"
#include "support/log_capture.h"
#include "support/random_world.h"

// What the hardened build makes of syslog. NOLINTBEGIN: the names are the linker's.
extern "C" {
void __wrap_syslog(int priority, const char* format, ...);
void __wrap___syslog_chk(int priority, int flag, const char* format, ...);
void __wrap___syslog_chk(int priority, int /*flag*/, const char* format, ...) {
    static char line[16384];
    va_list values;
    va_start(values, format);
    if (std::vsnprintf(line, sizeof line, format, values) < 0) line[0] = '\0';
    va_end(values);
    __wrap_syslog(priority, "%s", line);
}
}
// NOLINTEND

namespace pelorus {
namespace {

using namespace support;  // NOLINT(google-build-using-namespace)

long badPorts = 0;
void (*takeLine)(int, const char*) = nullptr;

void watchSearches(int priority, const char* text) {
    if (std::strstr(text, "Cleared bad port vector") != nullptr) badPorts = 0;
    takeLine(priority, text);
}

double cpuMicros() {
    timespec used{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &used);
    return static_cast<double>(used.tv_sec) * 1e6 + static_cast<double>(used.tv_nsec) / 1e3;
}

// As the local web back end does; a later time makes the daemon read it.
void writeKeys(const std::string& file, long keys, long change) {
    std::ofstream out{file};
    for (long key = 0; key < keys; ++key) out << "OTHER_KEY_" << key << "=" << change << "\n";
    out.close();
    const timespec times[]{{change, 0}, {change, 0}};
    if (utimensat(AT_FDCWD, file.c_str(), times, 0) != 0) std::exit(1);
}

int measure(const std::string& what, long size, long cycles, const std::string& folder) {
    RandomWorld world{Stream{std::vector<std::uint8_t>{}}, Kind::UPNP, {0, 0, false, true}, folder};
    for (int port = 10000; what == "table" && port < 10000 + size; ++port)
        FakeGateway::get().table.push_back({port, "192.168.77.30", port, "game"});
    if (what == "bad") world.weather = 1U << PORT;
    takeLine = std::exchange(LogCapture::get().sink, watchSearches);
    double before = 0, total = 0;
    world.atCycleEnd = [&, power = 1L]() mutable {
        const double micros = cpuMicros() - before;
        const auto print = [](const char* name, long of, double time) {
            static_cast<void>(std::printf("%s %ld %.1f\n", name, of, time));
        };
        total += micros;
        const bool isSettled = world.cycles > 30;
        if (what == "table" && world.cycles == 1) print("first", size, micros);
        if (what == "table" && isSettled) print("steady", size, micros);
        if (what == "keys" && isSettled) print("keys", size, micros);
        if (what == "keys") writeKeys(folder + "/DYNAMIC_CONFIG_TMP", size, world.cycles);
        if (what == "bad" && isSettled) print("bad", badPorts, micros);
        badPorts += 3;
        if (what == "uptime" && world.cycles == power)
            print("uptime", std::exchange(power, power * 10), total);
        if (world.cycles == cycles) raise(SIGTERM);
        before = cpuMicros();
    };
    if (!GlobalConfig::getInstance()->loadConfig(folder + "/static.ini")) return 1;
    if (!installSignalHandlers()) return 1;
    DaemonControl::getInstance()->enableRemoteAccess();
    before = cpuMicros();
    DaemonControl::getInstance()->run();
    return 0;
}

}  // namespace
}  // namespace pelorus

int main(int argc, char** argv) {
    std::string folder = std::filesystem::temp_directory_path() / "pelorus-growth-XXXXXX";
    if (argc != 4 || mkdtemp(folder.data()) == nullptr) return 2;
    const int status = pelorus::measure(argv[1], std::strtol(argv[2], nullptr, 10),
                                        std::strtol(argv[3], nullptr, 10), folder);
    std::filesystem::remove_all(folder);
    return status;
}
