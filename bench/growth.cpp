// growth MEASURE SIZE: CPU time of the whole daemon on the unit tests' doubles, with no noise and no
// watcher threads. Prints pairs of a size and microseconds. The fakes' own work is included.
//   table SIZE   one first cycle, with its clean-up, SIZE entries of others in the gateway's table
//   steady SIZE  a cycle in which nothing changes, same table
//   keys SIZE    a cycle that reads changed settings with SIZE keys
//   bad SIZE     for 0 to 99 ports found bad, a search that finds three more; SIZE searches in all
//   uptime SIZE  all cycles from the start to the 1st, 10th, ... SIZEth
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdarg>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>

#include "config/global_config.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"
#include "support/log_capture.h"
#include "support/random_world.h"
#include "support/virtual_clock.h"

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

constexpr long kWarmUp = 30, kMeasured = 31;  // cycles

double cpuMicros() {
    timespec used{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &used);
    return static_cast<double>(used.tv_sec) * 1e6 + static_cast<double>(used.tv_nsec) / 1e3;
}

void print(long size, std::vector<double> times) {
    std::sort(times.begin(), times.end());
    std::printf("%ld %.1f\n", size, times[times.size() / 2]);
}

void fillTable(long entries) {
    auto& table = FakeGateway::get().table;
    for (int number = 0; number < entries; ++number)
        table.push_back({10000 + number, "192.168.77.30", 10000 + number, "game"});
}

// What the local web back end would write; a later time makes the daemon read it.
void writeKeys(const std::string& file, long keys, long change) {
    std::ofstream out{file};
    out << "COMMUNICATION_STATUS=portforwarded\n";
    for (long key = 0; key < keys; ++key)
        out << "OTHER_PROGRAM_KEY_" << key << "=" << change << "\n";
    out.close();
    const timespec times[]{{change, 0}, {change, 0}};
    if (utimensat(AT_FDCWD, file.c_str(), times, 0) != 0) std::exit(1);
}

long badPorts = 0;
void (*takeLine)(int, const char*) = nullptr;

void watchSearches(int priority, const char* text) {
    if (std::strstr(text, "Cleared bad port vector") != nullptr) badPorts = 0;
    takeLine(priority, text);
}

// Runs the daemon; @p atEnd, called in the pause after each cycle with its number and CPU time, says
// whether there is another one.
void live(RandomWorld& world,
          const std::string& folder,
          const std::function<bool(long cycle, double micros)>& atEnd) {
    double before = cpuMicros();
    world.atCycleEnd = [&] {
        const bool goesOn = atEnd(world.cycles, cpuMicros() - before);
        if (!goesOn) raise(SIGTERM);
        before = cpuMicros();
    };
    auto* const daemon = DaemonControl::getInstance();
    if (!GlobalConfig::getInstance()->loadConfig(folder + "/static.ini")) std::exit(1);
    if (!installSignalHandlers()) std::exit(1);
    daemon->enableRemoteAccess();
    before = cpuMicros();
    daemon->run();
}

void measure(const std::string& what, long size, const std::string& folder) {
    RandomWorld world{Stream{std::vector<std::uint8_t>{}}, Kind::UPNP, {0, 0, false, true}, folder};
    std::vector<double> times;
    if (what == "table" || what == "steady") fillTable(size);
    if (what == "table") {
        return live(world, folder, [&](long, double micros) {
            print(size, {micros});
            return false;
        });
    }
    if (what == "uptime") {
        double total = 0;
        return live(world, folder, [&, next = 1L](long cycle, double micros) mutable {
            total += micros;
            if (cycle == next) print(std::exchange(next, next * 10), {total});
            return cycle < size;
        });
    }
    if (what == "bad") {
        world.weather = 1U << PORT;
        takeLine = std::exchange(LogCapture::get().sink, watchSearches);
        std::map<long, std::vector<double>> byNumber;
        live(world, folder, [&](long cycle, double micros) {
            if (cycle > 2) byNumber[badPorts].push_back(micros);
            badPorts += 3;
            return cycle < size;
        });
        for (const auto& [number, searches] : byNumber) print(number, searches);
        return;
    }
    live(world, folder, [&](long cycle, double micros) {
        if (cycle > kWarmUp) times.push_back(micros);
        if (what == "keys") writeKeys(folder + "/DYNAMIC_CONFIG_TMP", size, cycle);
        return cycle < kWarmUp + kMeasured;
    });
    print(size, times);
}

}  // namespace
}  // namespace pelorus

int main(int argc, char** argv) {
    namespace fs = std::filesystem;
    std::string folder = (fs::temp_directory_path() / "pelorus-growth-XXXXXX").string();
    if (argc != 3 || mkdtemp(folder.data()) == nullptr) return 2;
    pelorus::measure(argv[1], std::strtol(argv[2], nullptr, 10), folder);
    fs::remove_all(folder);
    return 0;
}
